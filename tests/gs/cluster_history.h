// All that any replica has applied, and what must never be taken back of it.
#pragma once

#include <map>
#include <set>
#include <string>

#include "cluster/replication.h"

namespace gs::cluster::test {

/// A tree: a place in it is a sequence of events, the root an empty engine. Replicas that are at the same place
/// must be in the same state.
///
/// A host *holds* a place when it has applied it, or (with safe delivery) has confirmed it while it had the state
/// before it, and has not lost its state since; it loses it by dying, by leaving the group, and where it takes up
/// a state without that place. What a replica has applied and a majority of all hosts holds, is on every later
/// replica's way: each ring with quorum has somebody who holds it. Where an exchange without a majority of holders
/// leaves somebody out who has a state, he counts as if he held what is applied: such an exchange must not be.
class History {
 public:
  using Place = std::uint32_t;
  static constexpr Place kEmpty = 0;

  explicit History(Node hosts) : majority_(hosts / 2 + 1), held_(hosts + 1, kEmpty), places_(1) {}

  /// From `at`, by the event of this name, to a state of this digest.
  Place apply(Place at, std::uint64_t event, std::uint64_t digest, const std::vector<TimerRequest>& timers) {
    const auto [known, is_new] = children_.try_emplace({at, event}, static_cast<Place>(places_.size()));
    if (is_new) {
      places_.push_back({at, places_[at].depth + 1, digest, places_[at].number, 0});
      for (const TimerRequest& timer : timers)
        if (timer.id.phase == 1 && timer.id.protocol <= std::exchange(places_.back().number, timer.id.protocol))
          error("numbers go back: in one sequence");
    }
    if (places_[known->second].digest != digest) error("states differ: after the same events");
    return known->second;
  }

  /// Who serves in one ring has applied more or less of the same. `beside`: who is in the same exchange; who hangs
  /// may be at an older one still, and what it alone has is lost.
  void serves(Node node, const RingId& ring, Place at, const std::set<Node>& beside) {
    serving_[node] = {ring, at};
    for (const Node other : beside) {
      const auto where = serving_.find(other);
      if (where != serving_.end() && where->second.first == ring && !on_one_way(where->second.second, at))
        error("sequences differ: nodes " + std::to_string(other) + " and " + std::to_string(node) +
              " serve in one ring");
    }
  }
  void serves_no_more(Node node) { serving_.erase(node); }

  /// What clients are told of a protocol by its number, they are told of no other one.
  void told(Place at, const std::vector<TimerRequest>& timers) {
    for (const TimerRequest& timer : timers)
      if (timer.id.phase == 1 && numbers_.try_emplace(timer.id.protocol, at).first->second != at)
        error("numbers twice: one names two protocols");
  }
  /// Where a majority is in this exchange, it has what a majority holds.
  void applied(Node node, Place at, const std::set<Node>& beside) {
    if (beside.size() >= majority_ && !on_one_way(at, kept_))
      error("taken back: node " + std::to_string(node) + " has not what a majority holds");
  }
  /// It has confirmed this, and knows what comes before.
  void confirmed(Node node, Place at) {
    const Place held = held_[node];
    if (places_[held].depth < places_[at].depth || !on_one_way(held, at)) hold(node, at);
  }
  Node majority() const { return majority_; }
  bool holds_something(Node node) const { return held_[node] != kEmpty; }
  void hold(Node node, Place to) {
    Place from = std::exchange(held_[node], to), best = kEmpty;
    while (from != to) {
      if (places_[from].depth >= places_[to].depth) {
        --places_[from].holders;
        from = places_[from].parent;
      } else {
        if (++places_[to].holders >= majority_ && best == kEmpty) best = to;
        to = places_[to].parent;
      }
    }
    while (kept_ != kEmpty && places_[kept_].holders < majority_) kept_ = places_[kept_].parent;
    if (places_[best].depth > places_[kept_].depth) kept_ = best;
  }

  /// Empty, or the first broken promise.
  const std::string& error() const { return error_; }
  void error(const std::string& what) {
    if (error_.empty()) error_ = what;
  }

 private:
  struct Entry {
    Place parent = kEmpty;
    std::uint32_t depth = 0;
    std::uint64_t digest = 0;
    std::uint64_t number = 0;  // the last that was given to a protocol
    Node holders = 0;
  };

  bool on_one_way(Place a, Place b) const {
    if (places_[a].depth > places_[b].depth) std::swap(a, b);
    while (places_[b].depth > places_[a].depth) b = places_[b].parent;
    return a == b;
  }

  const Node majority_;
  std::vector<Place> held_;  // by node
  std::vector<Entry> places_;
  std::map<std::pair<Place, std::uint64_t>, Place> children_;
  std::map<Node, std::pair<RingId, Place>> serving_;
  std::map<std::uint64_t, Place> numbers_;
  Place kept_ = kEmpty;  // the farthest that a majority holds
  std::string error_;
};

}  // namespace gs::cluster::test
