// Asks the kernel who is at the other end of a socket.
#pragma once

#include <optional>

#include "daemon/transport.h"

namespace gs::daemon {

/// Nothing: the kernel does not say, so nobody is to be served there.
std::optional<Peer> peer_of(int socket);

}  // namespace gs::daemon
