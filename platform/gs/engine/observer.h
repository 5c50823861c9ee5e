// What happens in the groups, told while it happens, for people and tools. No part of the state: engines that are
// watched and engines that are not stay the same.
#pragma once

#include <optional>
#include <string_view>

#include "engine/types.h"

namespace gs {

/// The caller's clock, in milliseconds; 0: not known.
using Moment = std::int64_t;

/// Valid during the call. What a kind has no use for is as it is here.
struct Happening {
  enum class Kind : std::uint8_t {
    kRequest,      // somebody asks: `protocol`, `rc`
    kBegin,        // a protocol starts
    kPhase,        // its voters are asked
    kVote,         // `who` votes
    kDefaultVote,  // a vote is counted for `who`, as `summary` says why
    kApproved,
    kRejected,
    kFailure,       // `who` has died or said goodbye
    kTimer,         // the phase is over its time limit
    kAnnouncement,  // `changing` do not answer pings, or do again
  };
  Kind kind = Kind::kRequest;
  std::string_view group;
  std::string_view protocol;  // its name in the table of protocols; of a request also what else is asked for
  std::uint64_t number = 0;   // of the protocol
  std::uint32_t phase = 0;
  bool n_phase = false;
  std::uint64_t event_number = 0;  // 0: it is no event of the group
  std::optional<ProviderId> who;
  std::string_view name;  // of `who`
  SessionId session;      // of `who`
  wyx_rc_t rc = WYX_OK;
  wyx_vote_value_t vote = WYX_NULL_VOTE;
  std::uint32_t summary = 0;     // flags of wyx_summary_code_t
  std::uint32_t leave_code = 0;  // flags of wyx_leave_code_t
  SharedMembership changing;
  SharedLeaveCodes leave_codes;  // one for each of `changing`
  SharedMembership members;      // as they are now
  std::size_t voters = 0;
  SharedBytes state;  // proposed, or the new one
  bool state_changed = false;
  SharedBytes message;
};

class Observer {
 public:
  virtual ~Observer() = default;
  /// Must not throw, nor call the engine.
  virtual void happened(const Happening& happening) = 0;
};

/// What there has been of it since the engine was made.
struct Tally {
  std::uint64_t begun = 0;
  std::uint64_t approved = 0;
  std::uint64_t rejected = 0;
  std::uint64_t votes = 0;
  std::uint64_t default_votes = 0;
  std::uint64_t failures = 0;
};

/// Where an engine's caller looks at it from.
struct Watch {
  Observer* observer = nullptr;
  Moment now = 0;
  Tally tally;
};

}  // namespace gs
