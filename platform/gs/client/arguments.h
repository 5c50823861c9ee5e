// The records that an application gives to a request, checked and turned into the engine's values.
//
// Nothing is read through a pointer that is null or past a limit. Each returns WYX_OK or the code that says what
// is wrong, and changes nothing then. What only the group can judge is left to the engine.
#pragma once

#include "engine/types.h"

namespace gs::client {

wyx_rc_t read_join(const wyx_proposal_info_t* info, JoinRequest* request);
wyx_rc_t read_state_change(const wyx_proposal_info_t* info, StateChangeRequest* request);
wyx_rc_t read_message(const wyx_proposal_info_t* info, MessageRequest* request);
wyx_rc_t read_leave(const wyx_proposal_info_t* info, LeaveRequest* request);
wyx_rc_t read_expel(const wyx_proposal_info_t* info, ExpelRequest* request);
wyx_rc_t read_attribute_change(const wyx_proposal_info_t* info, AttributeChangeRequest* request);
wyx_rc_t read_subscribe(const wyx_proposal_info_t* info, SubscribeRequest* request);
wyx_rc_t read_vote(wyx_vote_value_t vote, const wyx_state_value_t* proposed, const wyx_provider_message_t* message,
                   wyx_vote_value_t default_vote, VoteRequest* request);

}  // namespace gs::client
