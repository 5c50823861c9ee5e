// A provider as its group sees it.
#pragma once

#include <memory>
#include <string>

#include "engine/ledger.h"
#include "engine/observer.h"
#include "engine/types.h"

namespace gs {

/// A voter's part in the running protocol.
struct Ballot {
  bool open = false;                              // asked in this phase, has not voted
  wyx_vote_value_t vote = WYX_NULL_VOTE;          // in this phase
  wyx_vote_value_t default_vote = WYX_NULL_VOTE;  // given with an earlier vote; WYX_NULL_VOTE: the group's
  std::uint32_t summary = 0;                      // flags of wyx_summary_code_t, of the vote
  Value proposed_state;                           // kept only where vote results are collected
  Value message;
  /// As it is while its member has had no part in the protocol.
  bool unused() const {
    return !open && vote == WYX_NULL_VOTE && default_vote == WYX_NULL_VOTE && summary == 0 && !proposed_state &&
           !message;
  }
};

struct Member {
  enum class Stage : std::uint8_t {
    kQueued,   // its join waits
    kJoining,  // its join runs
    kJoined,   // in the membership
    kOut,
  };
  Endpoint to;
  std::uint32_t user = 0;
  ProviderId id;
  std::string local_name;
  Stage stage = Stage::kQueued;
  bool leaving = false;   // its leave waits or runs
  bool changing = false;  // the running protocol changes its membership
  std::uint32_t gone_code =
      0;                    // flags of wyx_leave_code_t once it has died or said goodbye: it hears nothing more
  std::uint64_t place = 0;  // in its group's queue; 0: nothing of it waits
  Ballot ballot;
  Ledger::Charge charge;  // for its being there, names included
  Moment since = 0;       // it has joined; no part of the state

  bool gone() const { return gone_code != 0; }
  Payer payer() const { return {to.session, user}; }
};

/// Shared by its group's lists and the client table.
using MemberPtr = std::shared_ptr<Member>;

}  // namespace gs
