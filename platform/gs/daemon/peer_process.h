// Sees the end of the process at the other end of a local socket, whoever else holds that socket.
#pragma once

#include <chrono>
#include <optional>

#include "common/descriptor.h"

namespace gs::daemon {

/// Of the clock in which the kernel says when a process has started.
std::chrono::milliseconds time_since_boot();

/// A descriptor that is readable once the process that has connected `socket` has ended; empty where the kernel
/// has no such thing. Nothing: it has ended already. `connected`: when it was there at the latest, so that another
/// process to which the same number was given since is not taken for it.
std::optional<platform::Descriptor> process_of_peer(int socket, std::chrono::milliseconds connected);

}  // namespace gs::daemon
