// The traffic of an agreement without group services: as many processes, packets of the same sizes in the same
// order, the same sleeps. The relay copies instead of deciding and nobody looks at what comes, so that this is
// what an agreement takes on this machine at the least.
#pragma once

#include <string>

namespace zn {

constexpr int kRelayed = 3;  // processes, the proposer included

/// As the daemon; says on its standard output when it can be connected to. Ends with the first of its clients.
int run_relay(const std::string& path);

/// As a member: votes on what is proposed and takes what is approved, until its standard input ends.
int run_relayed(const std::string& path, int number);

/// The proposer's side. Throws Failure when the relay is gone.
class RelayedProposer {
 public:
  explicit RelayedProposer(const std::string& path);
  ~RelayedProposer();
  RelayedProposer(const RelayedProposer&) = delete;
  RelayedProposer& operator=(const RelayedProposer&) = delete;

  /// From the request to the own approval, with `voting` by way of everybody's vote.
  void agree(bool voting);

 private:
  const int requests_;
  const int events_;
};

}  // namespace zn
