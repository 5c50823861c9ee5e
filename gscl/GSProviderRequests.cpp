// A provider's requests in all their forms.
#include "gscl/GSController.h"
#include "gscl/GSProvider.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace_text_internal.h"

namespace zelt_gscl_V1 {

wyx_rc_t GSProvider::joinGroup() {
  gscl_internal::CancellationHold hold;
  GS_TRACE(GSCL_TRC_API, "GSProvider::joinGroup(%s) begins\n", GSCL_ID(this));
  wyx_group_attributes_t attributes;
  getGroupAttributes(&attributes);
  // Whatever name the attributes carry, it is the client's own group that is joined.
  attributes.gs_group_name = const_cast<char*>(getGroupName());

  wyx_proposal_info_t proposal;
  wyx_join_request_t& join = proposal._gs_protocol_info._gs_join_request;
  join.gs_group_attributes = &attributes;
  join.gs_provider_instance = getInstanceNumber();
  join.gs_provider_local_name = const_cast<char*>(getLocalName());
  join.gs_n_phase_protocol_callback = GSController::stub_nPhaseCb;
  join.gs_protocol_approved_callback = GSController::stub_approvedCb;
  join.gs_protocol_rejected_callback = GSController::stub_rejectedCb;
  join.gs_announcement_callback = GSController::stub_announcementCb;
  join.gs_merge_callback = GSController::stub_mergeCb;

  const wyx_rc_t rc = GSController::stub_join_group(this, &proposal);
  GS_TRACE(GSCL_TRC_API, "GSProvider::joinGroup(%s) returns  sync_rc=%s.\n", GSCL_ID(this), gscl_rc_name(rc));
  return rc;
}

wyx_rc_t GSProvider::goodbyeGroup() {
  gscl_internal::CancellationHold hold;
  if (getClientState() == zelt_gscl::GS_IAM_IDLE) {
    GS_TRACE(GSCL_TRC_API, "%s was already out-of-group.\n", GSCL_ID(this));
    return WYX_NOT_OK;
  }
  const wyx_rc_t rc = GSController::stub_goodbye_group(this);
  GS_TRACE(GSCL_TRC_API, "%s issued goodbye and get sync_rc=%s.\n", GSCL_ID(this), gscl_rc_name(rc));
  return rc;
}

wyx_rc_t GSProvider::changeStateValue(const wyx_proposal_info_t* proposal) {
  return GSController::stub_change_state_value(this, proposal);
}

wyx_rc_t GSProvider::leaveGroup(const wyx_proposal_info_t* proposal) {
  return GSController::stub_leave(this, proposal);
}

wyx_rc_t GSProvider::expelMembers(const wyx_proposal_info_t* proposal) {
  return GSController::stub_expel(this, proposal);
}

wyx_rc_t GSProvider::send_message(const wyx_proposal_info_t* proposal) {
  return GSController::stub_send_message(this, proposal);
}

wyx_rc_t GSProvider::vote(wyx_vote_value_t vote_value, wyx_vote_value_t def_vote_value,
                          const wyx_state_value_t* proposed_state_value, const wyx_provider_message_t* message) {
  return GSController::stub_vote(this, vote_value, proposed_state_value, message, def_vote_value);
}

wyx_rc_t GSProvider::change_attributes(const wyx_proposal_info_t* proposal) {
  return GSController::stub_change_attributes(this, proposal);
}

wyx_rc_t GSProvider::changeStateValue(const wyx_state_change_request_t* request) {
  wyx_proposal_info_t proposal;
  proposal._gs_protocol_info._gs_state_change_request = *request;
  return changeStateValue(&proposal);
}

wyx_rc_t GSProvider::changeStateValue(const wyx_state_value_t& new_val, wyx_num_phases_t num_phases,
                                      wyx_time_limit_t time_limit) {
  wyx_proposal_info_t proposal;
  wyx_state_change_request_t& request = proposal._gs_protocol_info._gs_state_change_request;
  request.gs_num_phases = num_phases;
  request.gs_time_limit = time_limit;
  request.gs_new_state = new_val;
  return changeStateValue(&proposal);
}

wyx_rc_t GSProvider::changeStateValue(const GSStateValue& new_val, wyx_num_phases_t num_phases,
                                      wyx_time_limit_t time_limit) {
  const wyx_state_value_t* held = new_val.getValue();
  const wyx_state_value_t empty = {0, nullptr};
  return changeStateValue(held != nullptr ? *held : empty, num_phases, time_limit);
}

wyx_rc_t GSProvider::leaveGroup(const wyx_leave_request_t* request) {
  wyx_proposal_info_t proposal;
  proposal._gs_protocol_info._gs_leave_request = *request;
  return leaveGroup(&proposal);
}

wyx_rc_t GSProvider::leaveGroup(unsigned int leave_code, wyx_num_phases_t num_phases,
                                wyx_time_limit_t time_limit) {
  wyx_proposal_info_t proposal;
  wyx_leave_request_t& request = proposal._gs_protocol_info._gs_leave_request;
  request.gs_num_phases = num_phases;
  request.gs_time_limit = time_limit;
  request.gs_leave_code = leave_code;
  return leaveGroup(&proposal);
}

wyx_rc_t GSProvider::expelMembers(const wyx_expel_request_t* request) {
  wyx_proposal_info_t proposal;
  proposal._gs_protocol_info._gs_expel_request = *request;
  return expelMembers(&proposal);
}

wyx_rc_t GSProvider::send_message(const wyx_message_request_t* request) {
  wyx_proposal_info_t proposal;
  proposal._gs_protocol_info._gs_message_request = *request;
  return send_message(&proposal);
}

wyx_rc_t GSProvider::send_message(const wyx_provider_message_t& message, wyx_num_phases_t num_phases,
                                  wyx_time_limit_t time_limit) {
  wyx_proposal_info_t proposal;
  wyx_message_request_t& request = proposal._gs_protocol_info._gs_message_request;
  request.gs_num_phases = num_phases;
  request.gs_time_limit = time_limit;
  request.gs_message = message;
  return send_message(&proposal);
}

wyx_rc_t GSProvider::change_attributes(const wyx_attribute_change_request_t* request) {
  wyx_proposal_info_t proposal;
  proposal._gs_protocol_info._gs_attribute_change_request = *request;
  return change_attributes(&proposal);
}

wyx_rc_t GSProvider::change_attributes(const wyx_group_attributes_t& attr, wyx_num_phases_t num_phases,
                                       wyx_time_limit_t time_limit) {
  wyx_attribute_change_request_t request;
  request.gs_num_phases = num_phases;
  request.gs_time_limit = time_limit;
  request.gs_group_attributes = const_cast<wyx_group_attributes_t*>(&attr);
  request.gs_backlevel_providers = nullptr;
  return change_attributes(&request);
}

}  // namespace zelt_gscl_V1
