// Which numbers are values of an enumeration: the one list that reader and sender check against.
#pragma once

#include <cstdint>

#include "gscl/wyx_api.h"

namespace gs {

/// For wyx_num_phases_t 0, "not set", passes as well: what it means is the engine's to say.
constexpr bool known(wyx_num_phases_t*, int value) { return value >= 0 && value <= WYX_N_PHASE; }
constexpr bool known(wyx_batch_ctrl_t*, int value) {
  return (value & ~(WYX_BATCH_BOTH | WYX_DEACTIVATE_ON_FAILURE | WYX_COLLECT_ALL_RESULT)) == 0;
}
constexpr bool known(wyx_merge_ctrl_t*, int value) {
  return value >= WYX_FIRST_MERGE_TYPE && value <= WYX_LAST_MERGE_TYPE;
}
constexpr bool known(wyx_vote_value_t*, int value) {
  return (value >= WYX_NULL_VOTE && value <= WYX_VOTE_REJECT) ||
         value == WYX_VOTE_APPROVE_AND_SWITCH_ALPHA_OMEGA || value == WYX_VOTE_CONTINUE_AND_SWITCH_ALPHA_OMEGA;
}
/// WYX_INTERNAL_REQUEST stands in the delayed error of a vote or a goodbye.
constexpr bool known(wyx_request_t*, int value) {
  return (value >= WYX_RESPONSIVENESS && value <= MAX_REQUEST) || value == WYX_INTERNAL_REQUEST;
}
constexpr bool known(wyx_rc_t*, int value) { return value >= WYX_OK && value <= WYX_UNEXPECTED_QUORUM_RESP; }

/// Of a ProtocolNotification; the other notifications are types of their own.
constexpr bool known(wyx_notification_type_t*, int value) {
  return value >= WYX_N_PHASE_NOTIFICATION && value <= WYX_REJECTED_NOTIFICATION;
}

constexpr bool known(wyx_quorum_state_t*, int value) {
  return value >= WYX_QUORUM_STATE_HAS && value <= WYX_QUORUM_STATE_NONE;
}

/// A node's number is that of its providers' ids.
inline constexpr std::uint32_t kMaxNodeNumber = INT16_MAX;

// The bits of the flag sets that a daemon sends.
inline constexpr std::uint32_t kSummaryBits = 2 * WYX_MAX_SUMMARY_CODE - 1;
/// Without those of parts that no message has: a source group's state value, merges.
inline constexpr std::uint32_t kWhatsChangedBits =
    (2 * WYX_CURRENT_STATE_VALUE - 1) & ~std::uint32_t{WYX_REFLECTED_SOURCE_STATE_VALUE};
inline constexpr std::uint32_t kLeaveCodeBits = 2 * WYX_HOST_LEAVE_DUE_TO_FORCE_DOWN - 1;
/// Without special data, which no message has, and the daemon's death, which the library tells.
inline constexpr std::uint32_t kSubscriptionTypeBits = WYX_SUBSCRIPTION_STATE | WYX_SUBSCRIPTION_DELTA_JOIN |
                                                       WYX_SUBSCRIPTION_DELTA_LEAVE | WYX_SUBSCRIPTION_MEMBERSHIP |
                                                       WYX_SUBSCRIPTION_DISSOLVED | WYX_SUBSCRIPTION_PERSISTENT;

}  // namespace gs
