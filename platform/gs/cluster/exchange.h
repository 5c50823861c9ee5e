// One exchange: what was asked, who has answered, and what everyone makes of it.
#pragma once

#include <optional>

#include "cluster/track.h"

namespace gs::cluster {

class Exchange {
 public:
  explicit Exchange(Begin begin) : begin_(std::move(begin)) {}

  const Begin& begin() const { return begin_; }
  bool asks(Node node) const;
  bool asks(const Process& process) const;
  /// Of a host's two daemons, one of which is going, the later word counts.
  /// False: it does not answer this begin, or not by who was asked.
  bool add(Node from, const Word& word);
  std::vector<Process> missing() const;

  /// The same at all who have read the same. Nothing: words are missing, or votes of those who have the state.
  std::shared_ptr<const Decision> decision() const;
  const std::map<Node, Word>& words() const { return words_; }

 private:
  Begin begin_;
  std::map<Node, Word> words_;
};

}  // namespace gs::cluster
