// Starts a subsystem's process.
#pragma once

#include <sys/types.h>

#include <optional>
#include <stdexcept>
#include <string>

#include "common/descriptor.h"
#include "master/definition.h"

namespace kpl::master {

/// Says in one line why there is no process.
class LaunchError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

/// A process on its way to the subsystem's program.
struct Launched {
  pid_t pid = -1;
  platform::Descriptor report;  // readable, not blocking, once it is known how it went
};

/// The definition's user; nothing: there is none of that name.
std::optional<uid_t> user_id(const Definition& definition);

/// Forks a process that leads a session of its own, has `request_end` (-1: /dev/null) on descriptor 0, the
/// definition's user, and the master's environment with KPL_MASTER_SOCKET, and becomes the definition's program.
/// With a request channel a user other than root gets 0 as its group, which the channel demands of a subsystem.
/// Throws LaunchError. Other threads may run: the new process calls nothing that waits for them.
Launched launch(const Definition& definition, int request_end, const std::string& status_socket);

/// How it went: nothing while that is not known, empty text when the program runs, else why it does not.
std::optional<std::string> launch_result(const Definition& definition, int report);

}  // namespace kpl::master
