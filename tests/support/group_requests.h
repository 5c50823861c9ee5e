// The base API's requests as one-liners, with the recorder's callbacks.
#pragma once

#include <string>

#include "support/group_recorder.h"

namespace test_support {

struct SetupResult {
  wyx_rc_t rc = WYX_NOT_OK;
  wyx_descriptor_t descriptor = -1;
};

inline SetupResult setup(const wyx_responsiveness_t& responsiveness = {},
                         wyx_socket_ctrl_t control = WYX_SOCKET_NO_SIGNAL) {
  SetupResult result;
  result.rc =
      wyx_setup(28, 7, &result.descriptor, control, &responsiveness, "", on_ping, on_delayed_error, on_query);
  return result;
}

/// A group with everything at its plainest; change what a test is about.
struct Group {
  explicit Group(std::string name_of_group) : name(std::move(name_of_group)) {
    attributes.gs_sizeof_group_attributes = sizeof(attributes);
    attributes.gs_num_phases = WYX_1_PHASE;
    attributes.gs_source_reflection_num_phases = WYX_1_PHASE;
    attributes.gs_group_default_vote = WYX_VOTE_APPROVE;
  }
  wyx_group_attributes_t* record() {
    attributes.gs_group_name = name.data();
    return &attributes;
  }
  std::string name;
  wyx_group_attributes_t attributes = {};
};

inline wyx_proposal_info_t join_info(Group& group, short instance, std::string& local_name) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_join_request = {group.record(), instance,    local_name.data(), on_n_phase,
                                             on_approved,    on_rejected, on_announcement,   nullptr};
  return info;
}
inline wyx_rc_t join(Group& group, short instance, wyx_token_t* token) {
  std::string local_name = "local";
  const wyx_proposal_info_t info = join_info(group, instance, local_name);
  return wyx_join(token, &info);
}
inline wyx_proposal_info_t state_info(std::string& state, wyx_num_phases_t phases, wyx_time_limit_t limit = 0) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_state_change_request = {
      phases, limit, {static_cast<int>(state.size()), state.data()}};
  return info;
}
inline wyx_rc_t change_state(wyx_token_t token, std::string state, wyx_num_phases_t phases = WYX_1_PHASE,
                             wyx_time_limit_t limit = 0) {
  const wyx_proposal_info_t info = state_info(state, phases, limit);
  return wyx_change_state_value(token, &info);
}
inline wyx_rc_t send_message(wyx_token_t token, std::string text, wyx_num_phases_t phases = WYX_1_PHASE) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_message_request = {phases, 0, {static_cast<int>(text.size()), text.data()}};
  return wyx_send_message(token, &info);
}
inline wyx_rc_t leave(wyx_token_t token, unsigned code = 0, wyx_num_phases_t phases = WYX_1_PHASE) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_leave_request = {phases, 0, code};
  return wyx_leave(token, &info);
}
inline wyx_rc_t expel(wyx_token_t token, wyx_provider_t whom, std::string flag) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_expel_request = {WYX_1_PHASE, 0, {1, &whom}, 0, flag.data()};
  return wyx_expel(token, &info);
}
inline wyx_rc_t subscribe(std::string group, int control, wyx_token_t* token) {
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_subscribe_request = {static_cast<wyx_subscription_ctrl_t>(control), group.data(),
                                                  on_subscription};
  return wyx_subscribe(token, &info);
}
inline wyx_rc_t vote(wyx_token_t token, wyx_vote_value_t value) {
  return wyx_vote(token, value, nullptr, nullptr, WYX_NULL_VOTE);
}

}  // namespace test_support
