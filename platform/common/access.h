// Who may connect to a daemon of this host.
#pragma once

#include <algorithm>
#include <optional>

#include "common/peer.h"

namespace platform {

/// The daemon's own user, root, and the members of the access group where one is configured.
struct AccessRule {
  std::uint32_t owner = 0;                  // user id
  std::optional<std::uint32_t> group = {};  // group id

  bool allows(const Peer& peer) const {
    if (peer.uid == 0 || peer.uid == owner) return true;
    if (!group) return false;
    return peer.gid == *group || std::find(peer.groups.begin(), peer.groups.end(), *group) != peer.groups.end();
  }
};

}  // namespace platform
