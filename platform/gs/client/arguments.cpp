#include "client/arguments.h"

#include <cstring>

#include "engine/checks.h"

namespace gs::client {
namespace {

/// `name` may be null where it is optional: then it is read as empty.
wyx_rc_t read_name(const char* name, std::size_t limit, std::string* out) {
  if (name == nullptr) return WYX_OK;
  const std::size_t length = strnlen(name, limit + 1);
  if (length > limit) return WYX_NAME_TOO_LONG;
  out->assign(name, length);
  return WYX_OK;
}

wyx_rc_t read_group_name(const char* name, std::string* out) {
  if (name == nullptr || *name == '\0') return WYX_BAD_PARAMETER;
  return read_name(name, kMaxGroupName, out);
}

wyx_rc_t read_bytes(const char* bytes, int length, std::size_t limit, Bytes* out) {
  if (length < 0 || static_cast<std::size_t>(length) > limit) return WYX_BAD_PARAMETER;
  if (length == 0) return WYX_OK;
  if (bytes == nullptr) return WYX_BAD_PARAMETER;
  out->assign(bytes, static_cast<std::size_t>(length));
  return WYX_OK;
}

wyx_rc_t read_state(const wyx_state_value_t& state, Bytes* out) {
  return read_bytes(state.gs_state, state.gs_length, kMaxStateValue, out);
}
wyx_rc_t read_message(const wyx_provider_message_t& message, Bytes* out) {
  return read_bytes(message.gs_message, message.gs_length, kMaxProviderMessage, out);
}

wyx_rc_t read_attributes(const wyx_group_attributes_t* record, GroupAttributes* out) {
  if (record == nullptr) return WYX_BAD_PARAMETER;
  const wyx_rc_t rc = read_group_name(record->gs_group_name, &out->group_name);
  if (rc != WYX_OK) return rc;
  const char* source = record->gs_source_group_name;
  if (source != nullptr && *source != '\0') return WYX_NOT_SUPPORTED;
  out->client_version = record->gs_client_version;
  out->batch_control = record->gs_batch_control;
  out->num_phases = record->gs_num_phases;
  out->source_reflection_num_phases = record->gs_source_reflection_num_phases;
  out->default_vote = record->gs_group_default_vote;
  out->merge_control = record->gs_merge_control;
  out->time_limit = record->gs_time_limit;
  out->source_reflection_time_limit = record->gs_source_reflection_time_limit;
  return WYX_OK;
}

/// The result of reading, and if that is well, whether the values can be at all.
template <typename Request>
wyx_rc_t checked(wyx_rc_t rc, const Request& request) {
  return rc == WYX_OK ? check_values(request) : rc;
}

template <typename Record>
ProtocolTerms terms_of(const Record& record) {
  return {record.gs_num_phases, record.gs_time_limit};
}

}  // namespace

wyx_rc_t read_join(const wyx_proposal_info_t* info, JoinRequest* request) {
  if (info == nullptr) return WYX_BAD_PARAMETER;
  const wyx_join_request_t& record = info->_gs_protocol_info._gs_join_request;
  const wyx_rc_t rc = read_attributes(record.gs_group_attributes, &request->attributes);
  if (rc != WYX_OK) return rc;
  request->instance = record.gs_provider_instance;
  return checked(read_name(record.gs_provider_local_name, kMaxLocalName, &request->local_name), *request);
}

wyx_rc_t read_state_change(const wyx_proposal_info_t* info, StateChangeRequest* request) {
  if (info == nullptr) return WYX_BAD_PARAMETER;
  const wyx_state_change_request_t& record = info->_gs_protocol_info._gs_state_change_request;
  request->terms = terms_of(record);
  return checked(read_state(record.gs_new_state, &request->new_state), *request);
}

wyx_rc_t read_message(const wyx_proposal_info_t* info, MessageRequest* request) {
  if (info == nullptr) return WYX_BAD_PARAMETER;
  const wyx_message_request_t& record = info->_gs_protocol_info._gs_message_request;
  request->terms = terms_of(record);
  return checked(read_message(record.gs_message, &request->message), *request);
}

wyx_rc_t read_leave(const wyx_proposal_info_t* info, LeaveRequest* request) {
  if (info == nullptr) return WYX_BAD_PARAMETER;
  const wyx_leave_request_t& record = info->_gs_protocol_info._gs_leave_request;
  request->terms = terms_of(record);
  request->leave_code = record.gs_leave_code;
  return check_values(*request);
}

wyx_rc_t read_expel(const wyx_proposal_info_t* info, ExpelRequest* request) {
  if (info == nullptr) return WYX_BAD_PARAMETER;
  const wyx_expel_request_t& record = info->_gs_protocol_info._gs_expel_request;
  const wyx_membership_t& list = record.gs_expel_list;
  if (list.gs_count == 0 || list.gs_count > kMaxExpelList || list.gs_providers == nullptr)
    return WYX_BAD_PARAMETER;
  request->terms = terms_of(record);
  request->deactivate_phase = record.gs_deactivate_phase;
  for (unsigned i = 0; i < list.gs_count; ++i) {
    const auto& id = list.gs_providers[i]._gs_provider_info;
    request->expelled.push_back({id._gs_instance_number, id._gs_node_number});
  }
  const wyx_rc_t rc = read_name(record.gs_deactivate_flag, kMaxExpelFlag, &request->deactivate_flag);
  return checked(rc == WYX_NAME_TOO_LONG ? WYX_BAD_PARAMETER : rc, *request);
}

wyx_rc_t read_attribute_change(const wyx_proposal_info_t* info, AttributeChangeRequest* request) {
  if (info == nullptr) return WYX_BAD_PARAMETER;
  const wyx_attribute_change_request_t& record = info->_gs_protocol_info._gs_attribute_change_request;
  request->terms = terms_of(record);
  return checked(read_attributes(record.gs_group_attributes, &request->attributes), *request);
}

wyx_rc_t read_subscribe(const wyx_proposal_info_t* info, SubscribeRequest* request) {
  if (info == nullptr) return WYX_BAD_PARAMETER;
  const wyx_subscribe_request_t& record = info->_gs_protocol_info._gs_subscribe_request;
  request->control = static_cast<std::uint32_t>(record.gs_subscription_control);
  return checked(read_group_name(record.gs_subscription_group, &request->group_name), *request);
}

wyx_rc_t read_vote(wyx_vote_value_t vote, const wyx_state_value_t* proposed, const wyx_provider_message_t* message,
                   wyx_vote_value_t default_vote, VoteRequest* request) {
  request->vote = vote;
  request->default_vote = default_vote;
  wyx_rc_t rc = WYX_OK;
  if (proposed != nullptr) rc = read_state(*proposed, &request->proposed_state.emplace());
  if (rc == WYX_OK && message != nullptr) rc = read_message(*message, &request->message.emplace());
  return checked(rc, *request);
}

}  // namespace gs::client
