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

/// What a subsystem's process is given of its master.
struct Given {
  int request_end = -1;  // becomes descriptor 0; -1: /dev/null does
  int output_end = -1;   // becomes descriptors 1 and 2; -1: the definition's file does
  const std::string& status_socket;
};

/// Forks a process that leads a session of its own, has the definition's user, environment and output, and no
/// descriptors but 0 to 2, and becomes the definition's program.
/// With a request channel a user other than root gets 0 as its group, which the channel demands of a subsystem.
/// Throws LaunchError. Other threads may run: the new process calls nothing that waits for them.
Launched launch(const Definition& definition, const Given& given);

/// How it went: nothing while that is not known, empty text when the program runs, else why it does not.
std::optional<std::string> launch_result(const Definition& definition, int report);

}  // namespace kpl::master
