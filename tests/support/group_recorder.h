// What the callbacks of the base API were told, for tests that use its entry points directly.
#pragma once

#include <poll.h>

#include <chrono>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "client/wyx_entry_points.h"

namespace test_support {

inline constexpr auto kHang = std::chrono::seconds(60);  // longer than anything takes that works

/// One callback, copied out of its record. -1 and absent: the record had no such part.
struct Seen {
  wyx_notification_type_t type = WYX_QUERY_NOTIFICATION;
  wyx_token_t token = -1;
  int protocol = -1;
  unsigned summary = 0;  // of a subscription: its type; of a delayed error: its code
  unsigned whats_changed = 0;
  int time_limit = -1;
  int phase = -1;
  int proposed_by = 0;
  std::optional<std::vector<int>> members;   // instance numbers
  std::optional<std::vector<int>> changing;  // instance numbers
  std::optional<std::string> state;
  std::optional<std::string> proposed;
  std::optional<std::string> message;
  std::optional<std::string> expel_flag;
  std::vector<unsigned> leave_codes;
  std::vector<std::string> votes;  // "instance:vote"
  std::string group;               // of new group attributes
  uint64_t seqnum = 0;
  std::string request;  // of a delayed error: what the failing request said
};

/// The process's one recorder, since callbacks have no argument of their own. Any thread.
class Recorder {
 public:
  static Recorder& get() {
    static Recorder recorder;
    return recorder;
  }

  void reset() {
    std::lock_guard lock(mutex_);
    seen_.clear();
    hook_ = nullptr;
    ping_result_ = WYX_CALLBACK_OK;
  }
  /// Runs inside every callback, after it was recorded.
  void set_hook(std::function<void(const Seen&)> hook) {
    std::lock_guard lock(mutex_);
    hook_ = std::move(hook);
  }
  void set_ping_result(wyx_callback_rc_t result) {
    std::lock_guard lock(mutex_);
    ping_result_ = result;
  }
  wyx_callback_rc_t ping_result() {
    std::lock_guard lock(mutex_);
    return ping_result_;
  }
  std::vector<Seen> all() {
    std::lock_guard lock(mutex_);
    return seen_;
  }
  std::vector<Seen> of(wyx_token_t token) {
    std::vector<Seen> found;
    for (const Seen& one : all()) {
      if (one.token == token) found.push_back(one);
    }
    return found;
  }
  std::size_t count() { return all().size(); }
  std::size_t count(wyx_token_t token, wyx_notification_type_t type) {
    std::size_t found = 0;
    for (const Seen& one : of(token)) found += one.type == type;
    return found;
  }
  void add(const Seen& seen) {
    std::function<void(const Seen&)> hook;
    {
      std::lock_guard lock(mutex_);
      seen_.push_back(seen);
      hook = hook_;
    }
    if (hook) hook(seen);
  }

 private:
  std::mutex mutex_;
  std::vector<Seen> seen_;
  std::function<void(const Seen&)> hook_;
  wyx_callback_rc_t ping_result_ = WYX_CALLBACK_OK;
};

inline std::optional<std::vector<int>> copy(const wyx_membership_t* members) {
  if (members == nullptr) return std::nullopt;
  std::vector<int> instances;
  for (unsigned i = 0; i < members->gs_count; ++i) {
    instances.push_back(members->gs_providers[i]._gs_provider_info._gs_instance_number);
  }
  return instances;
}
inline std::optional<std::string> copy(const wyx_state_value_t* value) {
  if (value == nullptr) return std::nullopt;
  return std::string(value->gs_state, static_cast<std::size_t>(value->gs_length));
}
inline std::optional<std::string> copy(const wyx_provider_message_t* value) {
  if (value == nullptr) return std::nullopt;
  return std::string(value->gs_message, static_cast<std::size_t>(value->gs_length));
}

inline void copy_proposal(const wyx_proposal_t& p, Seen* seen) {
  seen->whats_changed = p.gs_whats_changed;
  seen->phase = p.gs_phase_info.gs_phase_number;
  seen->proposed_by = p.gs_proposed_by._gs_provider_info._gs_instance_number;
  seen->members = copy(p.gs_current_providers);
  seen->changing = copy(p.gs_changing_providers);
  seen->state = copy(p.gs_current_state_value);
  seen->proposed = copy(p.gs_proposed_state_value);
  seen->message = copy(p.gs_provider_message);
  if (p.gs_expel_info != nullptr) {
    seen->expel_flag = std::string(p.gs_expel_info->gs_expel_flag,
                                   static_cast<std::size_t>(p.gs_expel_info->gs_expel_flag_length));
  }
  for (unsigned i = 0; p.gs_leave_info != nullptr && i < p.gs_leave_info->gs_count; ++i) {
    seen->leave_codes.push_back(p.gs_leave_info->gs_leave_codes[i].gs_voluntary_or_failure);
  }
  for (unsigned i = 0; p.gs_current_vote_results != nullptr && i < p.gs_current_vote_results->gs_count; ++i) {
    const wyx_vote_result_t& vote = *p.gs_current_vote_results->gs_vote_results[i];
    seen->votes.push_back(std::to_string(vote.gs_voter._gs_provider_info._gs_instance_number) + ":" +
                          std::to_string(vote.gs_vote_value));
  }
  if (p.gs_new_group_attributes != nullptr) seen->group = p.gs_new_group_attributes->gs_group_name;
}

template <typename Notification>
Seen copy_protocol(const Notification* n) {
  Seen seen;
  seen.type = n->gs_notification_type;
  seen.token = n->gs_provider_token;
  seen.protocol = n->gs_protocol_type;
  seen.summary = n->gs_summary_code;
  seen.seqnum = n->gs_event_seqnum;
  copy_proposal(*n->gs_proposal, &seen);
  return seen;
}

inline void on_n_phase(const wyx_n_phase_notification_t* n) {
  Seen seen = copy_protocol(n);
  seen.time_limit = n->gs_time_limit;
  Recorder::get().add(seen);
}
inline void on_approved(const wyx_approved_notification_t* n) { Recorder::get().add(copy_protocol(n)); }
inline void on_rejected(const wyx_rejected_notification_t* n) { Recorder::get().add(copy_protocol(n)); }
inline void on_announcement(const wyx_announcement_notification_t* n) {
  Seen seen;
  seen.type = n->gs_notification_type;
  seen.token = n->gs_provider_token;
  seen.summary = n->gs_summary_code;
  seen.members = copy(n->gs_announcement);
  Recorder::get().add(seen);
}
inline void on_subscription(const wyx_subscription_notification_t* n) {
  Seen seen;
  seen.type = n->gs_notification_type;
  seen.token = n->gs_subscriber_token;
  seen.summary = n->gs_subscription_type;
  seen.state = copy(n->gs_state_value);
  seen.members = copy(n->gs_full_membership);
  seen.changing = copy(n->gs_changing_membership);
  if (n->gs_leave_codes != nullptr) seen.leave_codes.push_back(n->gs_leave_codes[0].gs_voluntary_or_failure);
  seen.seqnum = n->gs_event_seqnum;
  Recorder::get().add(seen);
}
inline std::string describe(int protocol, const wyx_proposal_info_t* info) {
  if (info == nullptr) return "none";
  const auto& request = info->_gs_protocol_info;
  switch (protocol) {
    case WYX_JOIN:
      return std::string(request._gs_join_request.gs_group_attributes->gs_group_name) + "/" +
             request._gs_join_request.gs_provider_local_name + "/" +
             std::to_string(request._gs_join_request.gs_provider_instance) +
             (request._gs_join_request.gs_protocol_approved_callback == on_approved ? "/own routine" : "");
    case WYX_STATE_VALUE_CHANGE:
      return *copy(&request._gs_state_change_request.gs_new_state);
    case WYX_PROVIDER_MESSAGE:
      return *copy(&request._gs_message_request.gs_message);
    case WYX_EXPEL:
      return std::to_string(copy(&request._gs_expel_request.gs_expel_list)->front()) + "/" +
             request._gs_expel_request.gs_deactivate_flag;
    case WYX_SUBSCRIPTION:
      return request._gs_subscribe_request.gs_subscription_group;
    case WYX_LEAVE:
      return std::to_string(request._gs_leave_request.gs_leave_code);
    case WYX_GROUP_ATTRIBUTE_CHANGE:
      return request._gs_attribute_change_request.gs_group_attributes->gs_group_name;
    default:
      return "?";
  }
}
inline void on_delayed_error(const wyx_delayed_error_notification_t* n) {
  Seen seen;
  seen.type = n->gs_notification_type;
  seen.token = n->gs_request_token;
  seen.protocol = n->gs_protocol_type;
  seen.summary = n->gs_delayed_return_code;
  seen.request = describe(n->gs_protocol_type, n->gs_failing_request);
  if (n->old_group_attributes != nullptr) seen.group = n->old_group_attributes->gs_group_name;
  Recorder::get().add(seen);
}
inline wyx_callback_rc_t on_ping(const wyx_responsiveness_notification_t* n) {
  Seen seen;
  seen.type = n->gs_notification_type;
  seen.time_limit = static_cast<int>(n->gs_responsiveness_information.gs_responsiveness_interval);
  Recorder::get().add(seen);
  return Recorder::get().ping_result();
}
inline void on_query(const wyx_query_notification_t*) {}

inline bool readable(int descriptor, int milliseconds = 0) {
  pollfd watched = {descriptor, POLLIN, 0};
  return poll(&watched, 1, milliseconds) == 1;
}

/// Dispatches whenever the descriptor is readable, until `done`. False: it never came about.
inline bool dispatch_until(int descriptor, const std::function<bool()>& done) {
  const auto deadline = std::chrono::steady_clock::now() + kHang;
  while (!done()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    if (readable(descriptor, 100)) wyx_dispatch(WYX_NON_BLOCKING);
  }
  return true;
}

}  // namespace test_support
