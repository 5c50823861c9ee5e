// What set, send and expel have in common: to be a member for as long as one proposal takes.
#pragma once

#include <functional>
#include <string>

#include "tools/gsctl/command.h"
#include "tools/gsctl/member.h"

namespace gsctl {

struct Proposal {
  std::string group;
  std::string name = "gsctl";
  int retries = 5;  // after collisions
  unsigned short vote_time = kVoteTime;
};

void add_proposal_options(CLI::App& command, Proposal& proposal);

/// Joins, makes the request that `submit` makes, tells the outcome, and leaves. `submit` is called once more after
/// each collision.
int propose(const Proposal& proposal, const Settings& settings, const std::function<wyx_rc_t(Member&)>& submit);

/// What those that collide wait before they try again, each as long as it happens to.
std::chrono::duration<double> pause_before(int attempt);

/// What an orderly end waits for; then the end of the session does it.
constexpr std::chrono::duration<double> kLeaveTime(2);

/// The base API's own form of bytes that it does not change.
template <typename Record>
Record record_of(const std::string& bytes) {
  return {static_cast<int>(bytes.size()), const_cast<char*>(bytes.data())};
}

}  // namespace gsctl
