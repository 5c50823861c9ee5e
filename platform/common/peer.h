// Asks the kernel who is at the other end of a local socket.
#pragma once

#include <cstdint>
#include <optional>
#include <vector>

namespace platform {

/// Who is at the other end, as the kernel says.
struct Peer {
  int pid = 0;
  std::uint32_t uid = 0;
  std::uint32_t gid = 0;
  std::vector<std::uint32_t> groups;  // supplementary
};

/// Nothing: the kernel does not say, so nobody is to be served there.
std::optional<Peer> peer_of(int socket);

}  // namespace platform
