// Checks of a request's values that need no look at any group.
#pragma once

#include "engine/types.h"

namespace gs {

/// WYX_OK, or why no group can be made or joined with them: WYX_BAD_PARAMETER (no name), WYX_NAME_TOO_LONG,
/// WYX_NOT_SUPPORTED (a source group), WYX_BAD_GROUP_ATTRIBUTES (a value out of range).
wyx_rc_t check_attributes(const GroupAttributes& attributes);

/// Each: WYX_OK, or the code of the first value that is wrong. Lengths over the limits are WYX_BAD_PARAMETER.
wyx_rc_t check_values(const JoinRequest& request);
wyx_rc_t check_values(const StateChangeRequest& request);
wyx_rc_t check_values(const MessageRequest& request);
wyx_rc_t check_values(const LeaveRequest& request);
wyx_rc_t check_values(const ExpelRequest& request);
wyx_rc_t check_values(const AttributeChangeRequest& request);
wyx_rc_t check_values(const VoteRequest& request);
wyx_rc_t check_values(const SubscribeRequest& request);

/// Bytes that the engine keeps on the request's account.
std::size_t room_for(const JoinRequest& request);
std::size_t room_for(const StateChangeRequest& request);
std::size_t room_for(const MessageRequest& request);
std::size_t room_for(const ExpelRequest& request);
std::size_t room_for(const VoteRequest& request);
std::size_t room_for(const SubscribeRequest& request);

}  // namespace gs
