#include "common/peer.h"

#include <sys/socket.h>

#include <cerrno>

namespace platform {
namespace {

/// Empty where the kernel does not tell: then only the primary group counts.
std::vector<std::uint32_t> supplementary_groups(int socket) {
  std::vector<gid_t> groups(32);
  for (;;) {
    auto length = static_cast<socklen_t>(groups.size() * sizeof(gid_t));
    const int result = getsockopt(socket, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &length);
    if (result != 0 && errno != ERANGE) return {};
    groups.resize(length / sizeof(gid_t));
    if (result == 0) return {groups.begin(), groups.end()};
  }
}

}  // namespace

std::optional<Peer> peer_of(int socket) {
  ucred credentials{};
  socklen_t length = sizeof credentials;
  if (getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) return std::nullopt;
  return Peer{credentials.pid, credentials.uid, credentials.gid, supplementary_groups(socket)};
}

}  // namespace platform
