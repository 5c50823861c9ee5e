// How the master has to look to its subsystems, and how it gets there.
#pragma once

#include <string>

#include "common/descriptor.h"

namespace kpl::master {

/// Goes on in a process that is a child of process 1 and leads a session of its own. The calling process waits for
/// `ready`, ends with status 0 then, and with 1 when this object goes before.
class Detached {
 public:
  /// Comes back in the new process only. Throws std::system_error.
  Detached();
  void ready();

 private:
  platform::Descriptor tell_;
};

/// Why subsystems would not take this process for the master: it is not user 0, no child of process 1, leads no
/// session or has a terminal. Empty when they will.
std::string parent_problem();

}  // namespace kpl::master
