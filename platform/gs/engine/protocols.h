// The protocols of a group, and how they differ from one another: all of it in one table.
#pragma once

#include <cstdint>
#include <iterator>

#include "engine/types.h"

namespace gs {

/// How the providers whose membership a protocol changes take part in it.
enum class ChangingRole : std::uint8_t {
  kNone,     // the protocol changes no membership: all members vote
  kVote,     // they vote beside the members, and hear every phase
  kHearEnd,  // they have no vote and hear the end only
};

struct ProtocolTraits {
  wyx_request_t type;
  const char* name;  // for people
  ChangingRole changing_role;
  bool preventable;           // a reject rejects it; else a reject only ends its phases
  std::uint32_t leave_code;   // flags of wyx_leave_code_t for those it takes out; 0: each failed one's own
  bool message_is_proposal;   // its message stays from phase to phase; else one in a vote is seen once
  bool each_proposes_itself;  // a changing provider reads its own id in `proposed_by`, also in a batch
};

inline constexpr ProtocolTraits kProtocols[] = {
    {WYX_JOIN, "join", ChangingRole::kVote, true, 0, false, true},
    {WYX_FAILURE_LEAVE, "failure", ChangingRole::kHearEnd, false, 0, false, false},
    {WYX_LEAVE, "leave", ChangingRole::kHearEnd, false, WYX_VOLUNTARY_LEAVE, false, true},
    {WYX_EXPEL, "expel", ChangingRole::kHearEnd, true, WYX_PROVIDER_EXPELLED, false, false},
    {WYX_STATE_VALUE_CHANGE, "state", ChangingRole::kNone, true, 0, false, false},
    {WYX_PROVIDER_MESSAGE, "message", ChangingRole::kNone, true, 0, true, false},
    {WYX_GROUP_ATTRIBUTE_CHANGE, "attributes", ChangingRole::kNone, true, 0, false, false},
};

/// `type` is one of the table's.
constexpr const ProtocolTraits& traits_of(wyx_request_t type) {
  for (const ProtocolTraits& traits : kProtocols)
    if (traits.type == type) return traits;
  return kProtocols[0];
}

constexpr bool is_protocol(wyx_request_t type) {
  for (const ProtocolTraits& traits : kProtocols)
    if (traits.type == type) return true;
  return false;
}

/// What a request asks for, as its delayed error names it: a protocol or a subscription; a vote, a goodbye and an
/// unsubscription are WYX_INTERNAL_REQUEST.
constexpr wyx_request_t protocol_of(const Request& request) {
  constexpr wyx_request_t kTypes[] = {
      WYX_JOIN,         WYX_STATE_VALUE_CHANGE,     WYX_PROVIDER_MESSAGE, WYX_LEAVE,
      WYX_EXPEL,        WYX_GROUP_ATTRIBUTE_CHANGE, WYX_INTERNAL_REQUEST, WYX_INTERNAL_REQUEST,
      WYX_SUBSCRIPTION, WYX_INTERNAL_REQUEST};
  static_assert(std::size(kTypes) == std::variant_size_v<Request>);
  return kTypes[request.index()];
}

/// What the end of a phase leads to.
enum class PhaseEnd : std::uint8_t { kApprove, kNextPhase, kReject, kApproveRejected };

/// The protocol's state machine. A group is at rest, or it is in a phase of one protocol:
///
///   state     | event                                  | then
///   ----------|----------------------------------------|--------------------------------------------------------
///   at rest   | failure, leave or join                 | it starts
///   at rest   | another proposal                       | it starts
///   (start)   | one phase, or nobody to vote           | approved, at rest
///   (start)   | n phases                               | phase 1: every voter is asked, the time limit runs
///   in phase  | failure, leave or join                 | it queues
///   in phase  | another proposal                       | WYX_COLLIDE
///   in phase  | vote of one who is asked               | counted; the last one ends the phase
///   in phase  | any other vote                         | WYX_VOTE_NOT_EXPECTED
///   in phase  | a voter who has not voted is gone      | its default vote is counted; the last one ends the phase
///   in phase  | a voter who has voted is gone          | its vote stands
///   in phase  | its time limit is over                 | the missing default votes are counted, the phase ends
///   in phase  | the time limit of an earlier one       | nothing
///   phase end | see phase_end                          | next phase, or at rest: the queue's next protocol starts
constexpr PhaseEnd phase_end(bool any_reject, bool any_continue, bool preventable) {
  if (any_reject) return preventable ? PhaseEnd::kReject : PhaseEnd::kApproveRejected;
  return any_continue ? PhaseEnd::kNextPhase : PhaseEnd::kApprove;
}

}  // namespace gs
