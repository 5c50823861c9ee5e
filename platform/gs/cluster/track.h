// A state of the engine as the order sees it: how far it is ahead, and what it has received and not applied.
#pragma once

#include <algorithm>
#include <deque>
#include <optional>
#include <utility>

#include "cluster/messages.h"

namespace gs::cluster {

using Lives = std::map<Node, Life>;
inline bool has(const Lives& lives, Node node, Life life) {
  const auto found = lives.find(node);
  return found != lives.end() && found->second == life;
}

/// How an exchange ended. An event itself: it is confirmed and applied in its place in the order.
struct Decision {
  BeginId begin;
  Lives holders;  // whose state goes on
  Lives asked;    // whose messages count from now on, and whose confirmations are waited for
  History history;
  std::map<Node, std::uint32_t> left;
  std::uint64_t numbers = 0;  // above which the engine's go on where somebody is gone
};

struct Entry {
  std::uint64_t position = 0;  // that everybody has to confirm
  std::variant<std::shared_ptr<const Event>, std::shared_ptr<const Decision>> what;
  std::size_t size = 0;  // bytes
};

struct Track {
  std::optional<History> history;  // with what was received; none: there is no state
  Lives lives;                     // of the last exchange
  Lives hosts;                     // that the engine knows
  std::deque<Entry> waiting;       // received and not applied
  std::size_t bytes = 0;           // of those
  std::size_t apart = 0;           // the last of those: received in another ring than that of the history
  std::uint64_t received = 0;      // position of the last

  /// In another ring than that of the history it may be known to few: it does not put them ahead of the others.
  void append(const Ordered& message, const RingId& ring) {
    ++(history->ring == ring.sequence ? history->messages : apart);
    history->digest = mix(mix(history->digest, message.life), message.number);
    waiting.push_back({++received, message.event, message.size});
    bytes += message.size;
  }
  /// What an older view may have confirmed counts no more: it has to be confirmed with the decision. Before what
  /// was received in another ring something may be missing that others have told: its numbers are new ones.
  void append(const std::shared_ptr<const Decision>& decision) {
    const auto number_on = std::make_shared<const Event>(NumbersEvent{decision->numbers});
    const auto those = static_cast<std::ptrdiff_t>(std::min(std::exchange(apart, 0), waiting.size()));
    if (those > 0) waiting.insert(waiting.end() - those, {1, number_on});
    for (Entry& entry : waiting) entry.position = 1;
    history = decision->history;
    lives = decision->asked;
    received = 1;
    waiting.push_back({received, decision});
  }
  Entry take() {
    Entry first = std::move(waiting.front());
    waiting.pop_front();
    bytes -= first.size;
    return first;
  }

  static std::uint64_t mix(std::uint64_t digest, std::uint64_t word) {
    digest = (digest ^ word) * 0x9E3779B97F4A7C15u;
    return digest ^ (digest >> 29);
  }
};

}  // namespace gs::cluster
