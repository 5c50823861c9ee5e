// Subsystems that outlive their master: a master that is killed ends nothing, and the next one has neither their
// channel nor their end. It can tell them by the environment that they were started with.
#pragma once

#include <sys/types.h>

#include <map>
#include <string>

namespace kpl::master {

/// Its value is the subsystem's "NAME:PID", so that what a subsystem starts itself is not taken for it.
inline constexpr const char* kIdentityVariable = "KPL_SUBSYSTEM";

/// The name of the subsystem that a master with this status socket started as process `pid`; empty: none.
std::string subsystem_of(pid_t pid, const std::string& status_socket);

/// All of them, by name. To be called before this master has started any.
std::map<std::string, pid_t> find_left_behind(const std::string& status_socket);

}  // namespace kpl::master
