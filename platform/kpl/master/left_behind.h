// Subsystems that outlive their master: a master that is killed ends nothing, and the next one has neither their
// channel nor their end. It can tell them by the environment that they were started with.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

namespace kpl::master {

/// Its value is the subsystem's "NAME:PID", so that what a subsystem starts itself is not taken for it.
inline constexpr const char* kIdentityVariable = "KPL_SUBSYSTEM";

/// A process whose environment says that a master started it. Anybody can start one whose environment says so:
/// believe it of the users only that a subsystem of that name may have.
struct Claim {
  std::string name;
  pid_t pid = -1;
  uid_t user = 0;  // the real one, which a set-user-id program keeps
};

/// What the process says of itself; nothing: it is no subsystem of a master with this status socket.
std::optional<Claim> claim_of(pid_t pid, const std::string& status_socket);

/// All of them. To be called before this master has started any.
std::vector<Claim> find_claims(const std::string& status_socket);

}  // namespace kpl::master
