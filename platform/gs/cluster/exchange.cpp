#include "cluster/exchange.h"

#include <algorithm>

namespace gs::cluster {
namespace {

/// Greater than any before, as long as Corosync keeps the sequence of its rings, and than those that a host which
/// was alone has had until then.
std::uint64_t numbers_of(const Begin& begin) {
  constexpr int kRingShift = 42;  // a ring has fewer events
  constexpr std::uint64_t kMicrosecondsPerMillisecond = 1000;
  return (begin.ring.sequence << kRingShift) + begin.clock * kMicrosecondsPerMillisecond;
}

}  // namespace

bool Exchange::asks(Node node) const {
  return std::ranges::any_of(begin_.asked, [node](const Process& asked) { return asked.node == node; });
}

bool Exchange::asks(const Process& process) const {
  return std::ranges::find(begin_.asked, process) != begin_.asked.end();
}

bool Exchange::add(Node from, const Word& word) {
  if (word.begin != begin_.id || !asks(from)) return false;
  words_[from] = word;
  return true;
}

std::vector<Process> Exchange::missing() const {
  std::vector<Process> missing;
  std::ranges::copy_if(begin_.asked, std::back_inserter(missing),
                       [this](const Process& asked) { return !words_.contains(asked.node); });
  return missing;
}

std::shared_ptr<const Decision> Exchange::decision() const {
  if (!missing().empty()) return nullptr;
  std::optional<History> best;  // none is less than any
  for (const auto& [node, word] : words_) best = std::max(best, word.history);
  auto decision = std::make_shared<Decision>();
  std::uint32_t votes = 0;
  for (const auto& [node, word] : words_) {
    decision->asked[node] = word.life;
    if (word.history != best) continue;
    decision->holders[node] = word.life;
    decision->left.insert(word.left.begin(), word.left.end());
    const auto own = begin_.votes.find(node);
    if (own != begin_.votes.end()) votes += own->second;
  }
  if (votes < begin_.needed) return nullptr;
  const bool again = best && best->ring == begin_.ring.sequence;
  const std::uint64_t before = Track::mix(best ? best->digest : 0, begin_.id.life);
  decision->begin = begin_.id;
  decision->history = {begin_.ring.sequence, again ? best->exchanges + 1 : 1, 0,
                       Track::mix(before, begin_.id.number)};
  decision->numbers = numbers_of(begin_);
  return decision;
}

}  // namespace gs::cluster
