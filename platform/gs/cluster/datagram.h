// A Confirmed as a datagram between two daemons, beside the order.
//
// Fixed places for its few numbers: there is one for every event to every daemon, and who sends them has learnt
// from the words that all have one version.
//
// Its end is a tag that only who has the sender's key can make: two of SipHash-2-4, one with each half of the key,
// which together are 16 bytes and take a tenth of the time of a longer hash. So nobody outside the process group,
// who has not read the words with the keys, can confirm in a daemon's name or change what it confirms. It does not
// protect from a daemon of the group, which has all keys; from being read; from being lost, late or sent once
// more. The last is harmless: positions only grow within the exchange that is named.
//
// All of it is safe to use from several threads at once on different objects.
#pragma once

#include <functional>
#include <span>
#include <utility>

#include "cluster/messages.h"

namespace gs::cluster {

inline constexpr std::size_t kKeySize = 32;  // bytes

/// kKeySize random bytes, for a daemon's words.
std::string new_key();

/// Empty: the others would refuse it, it asks somebody (which goes by the order), or `key` is none.
std::vector<std::byte> seal(const Confirmed& confirmed, Node from, const std::string& key);

/// A daemon's key as its word has it; null: there is no such daemon.
using KeyOfNode = std::function<const std::string*(Node)>;
/// Bytes from anybody. Nothing: they are none that the daemon which they name has sealed.
std::optional<std::pair<Node, Confirmed>> open(std::span<const std::byte> bytes, const KeyOfNode& key_of_node);

}  // namespace gs::cluster
