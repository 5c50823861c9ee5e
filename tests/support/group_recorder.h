// What the callbacks of the base API were told, as the engine's values, for tests that use its entry points.
#pragma once

#include <gtest/gtest.h>
#include <poll.h>

#include <chrono>
#include <functional>
#include <mutex>

#include "client/wyx_entry_points.h"
#include "engine/types.h"

namespace test_support {

inline constexpr auto kHang = std::chrono::seconds(60);  // longer than anything takes that works

/// One callback.
struct Seen {
  wyx_notification_type_t type;
  wyx_token_t token = -1;
  gs::Notification what;
  wyx_responsiveness_t ping = {};  // of a ping, and nothing else

  const gs::ProtocolNotification& protocol() const { return std::get<gs::ProtocolNotification>(what); }
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
  std::vector<Seen> all() {
    std::lock_guard lock(mutex_);
    return seen_;
  }
  std::vector<Seen> of(wyx_token_t token) {
    std::vector<Seen> found = all();
    std::erase_if(found, [token](const Seen& one) { return one.token != token; });
    return found;
  }
  std::size_t count() { return all().size(); }
  wyx_callback_rc_t add(const Seen& seen) {
    std::function<void(const Seen&)> hook;
    wyx_callback_rc_t result;
    {
      std::lock_guard lock(mutex_);
      seen_.push_back(seen);
      hook = hook_;
      result = ping_result_;
    }
    if (hook) hook(seen);
    return result;
  }

 private:
  std::mutex mutex_;
  std::vector<Seen> seen_;
  std::function<void(const Seen&)> hook_;
  wyx_callback_rc_t ping_result_ = WYX_CALLBACK_OK;
};

// ------------------------------------------------------------------------------------------ records to values

inline gs::ProviderId value(const wyx_provider_t& p) {
  return {p._gs_provider_info._gs_instance_number, p._gs_provider_info._gs_node_number};
}
inline gs::SharedMembership value(const wyx_membership_t* members) {
  if (members == nullptr) return nullptr;
  gs::Membership ids;
  for (unsigned i = 0; i < members->gs_count; ++i) ids.push_back(value(members->gs_providers[i]));
  return std::make_shared<const gs::Membership>(std::move(ids));
}
inline gs::Bytes value(const wyx_state_value_t& v) { return {v.gs_state, static_cast<std::size_t>(v.gs_length)}; }
inline gs::Bytes value(const wyx_provider_message_t& v) {
  return {v.gs_message, static_cast<std::size_t>(v.gs_length)};
}
inline gs::GroupAttributes value(const wyx_group_attributes_t& a) {
  return {a.gs_client_version,     a.gs_batch_control,    a.gs_num_phases, a.gs_source_reflection_num_phases,
          a.gs_group_default_vote, a.gs_merge_control,    a.gs_time_limit, a.gs_source_reflection_time_limit,
          a.gs_group_name,         a.gs_source_group_name};
}
template <typename Record>
auto shared(const Record* record) {
  using Value = decltype(value(*record));
  return record ? std::make_shared<const Value>(value(*record)) : nullptr;
}
/// Null for an empty list, as the engine has it.
template <typename T>
std::shared_ptr<const std::vector<T>> list(std::vector<T> all) {
  return all.empty() ? nullptr : std::make_shared<const std::vector<T>>(std::move(all));
}
inline gs::SharedLeaveCodes value(const wyx_leave_code_entry_t* codes, std::size_t count) {
  std::vector<gs::LeaveCode> all;
  for (std::size_t i = 0; codes != nullptr && i < count; ++i)
    all.push_back({codes[i].gs_voluntary_or_failure, codes[i].gs_voluntary_leave_code});
  return list(std::move(all));
}
inline gs::SharedVoteResults value(const wyx_vote_results_t* results) {
  std::vector<gs::VoteResult> all;
  for (unsigned i = 0; results != nullptr && i < results->gs_count; ++i) {
    const wyx_vote_result_t& r = *results->gs_vote_results[i];
    all.push_back({value(r.gs_voter), r.gs_vote_value, static_cast<std::uint32_t>(r.gs_summary_code),
                   static_cast<std::uint32_t>(r.gs_leave_code), shared(r.gs_proposed_state_value),
                   shared(r.gs_provider_message)});
  }
  return list(std::move(all));
}
inline gs::Proposal value(const wyx_proposal_t& p) {
  gs::Proposal proposal;
  proposal.num_phases = p.gs_phase_info.gs_num_phases;
  proposal.phase = p.gs_phase_info.gs_phase_number;
  proposal.proposed_by = value(p.gs_proposed_by);
  proposal.whats_changed = static_cast<std::uint32_t>(p.gs_whats_changed);
  proposal.current_providers = value(p.gs_current_providers);
  proposal.changing_providers = value(p.gs_changing_providers);
  if (const auto* leave = p.gs_leave_info) proposal.leave_codes = value(leave->gs_leave_codes, leave->gs_count);
  if (const auto* e = p.gs_expel_info)
    proposal.expel_info = {e->gs_deactivate_phase,
                           {e->gs_expel_flag, static_cast<std::size_t>(e->gs_expel_flag_length)}};
  proposal.current_state = shared(p.gs_current_state_value);
  proposal.proposed_state = shared(p.gs_proposed_state_value);
  proposal.message = shared(p.gs_provider_message);
  proposal.new_attributes = shared(p.gs_new_group_attributes);
  proposal.current_vote_results = value(p.gs_current_vote_results);
  proposal.changing_vote_results = value(p.gs_changing_vote_results);
  return proposal;
}

// -------------------------------------------------------------------------------------------------- callbacks

template <typename Record>
void record_protocol(const Record* n, std::uint16_t time_limit = 0) {
  Recorder::get().add({n->gs_notification_type, n->gs_provider_token,
                       gs::ProtocolNotification{n->gs_notification_type, n->gs_protocol_type,
                                                static_cast<std::uint32_t>(n->gs_summary_code), time_limit,
                                                value(*n->gs_proposal), n->gs_event_seqnum}});
}
inline void on_n_phase(const wyx_n_phase_notification_t* n) { record_protocol(n, n->gs_time_limit); }
inline void on_approved(const wyx_approved_notification_t* n) { record_protocol(n); }
inline void on_rejected(const wyx_rejected_notification_t* n) { record_protocol(n); }
inline void on_announcement(const wyx_announcement_notification_t* n) {
  const gs::AnnouncementNotification what{static_cast<std::uint32_t>(n->gs_summary_code),
                                          value(n->gs_announcement)};
  Recorder::get().add({n->gs_notification_type, n->gs_provider_token, what});
}
inline void on_subscription(const wyx_subscription_notification_t* n) {
  const auto changing = value(n->gs_changing_membership);
  const gs::SubscriptionNotification what{static_cast<std::uint32_t>(n->gs_subscription_type),
                                          shared(n->gs_state_value),
                                          value(n->gs_full_membership),
                                          changing,
                                          value(n->gs_leave_codes, changing ? changing->size() : 0),
                                          n->gs_event_seqnum};
  Recorder::get().add({n->gs_notification_type, n->gs_subscriber_token, what});
}

inline gs::Request failing_request(gs::Token token, int protocol, const wyx_proposal_info_t* info) {
  if (info == nullptr) return gs::GoodbyeRequest{token};
  const auto& r = info->_gs_protocol_info;
  const auto terms = [](const auto& record) {
    return gs::ProtocolTerms{record.gs_num_phases, record.gs_time_limit};
  };
  switch (protocol) {
    case WYX_JOIN:
      EXPECT_EQ(r._gs_join_request.gs_protocol_approved_callback, on_approved);
      EXPECT_EQ(r._gs_join_request.gs_protocol_rejected_callback, on_rejected);
      return gs::JoinRequest{token, value(*r._gs_join_request.gs_group_attributes),
                             r._gs_join_request.gs_provider_instance, r._gs_join_request.gs_provider_local_name};
    case WYX_STATE_VALUE_CHANGE:
      return gs::StateChangeRequest{token, terms(r._gs_state_change_request),
                                    value(r._gs_state_change_request.gs_new_state)};
    case WYX_PROVIDER_MESSAGE:
      return gs::MessageRequest{token, terms(r._gs_message_request), value(r._gs_message_request.gs_message)};
    case WYX_EXPEL:
      return gs::ExpelRequest{token, terms(r._gs_expel_request), *value(&r._gs_expel_request.gs_expel_list),
                              r._gs_expel_request.gs_deactivate_phase, r._gs_expel_request.gs_deactivate_flag};
    case WYX_LEAVE:
      return gs::LeaveRequest{token, terms(r._gs_leave_request), r._gs_leave_request.gs_leave_code};
    case WYX_GROUP_ATTRIBUTE_CHANGE:
      return gs::AttributeChangeRequest{token, terms(r._gs_attribute_change_request),
                                        value(*r._gs_attribute_change_request.gs_group_attributes)};
    default:
      return gs::SubscribeRequest{token,
                                  static_cast<std::uint32_t>(r._gs_subscribe_request.gs_subscription_control),
                                  r._gs_subscribe_request.gs_subscription_group};
  }
}
inline void on_delayed_error(const wyx_delayed_error_notification_t* n) {
  const gs::Token token = n->gs_request_token;
  Recorder::get().add(
      {n->gs_notification_type, token,
       gs::DelayedErrorNotification{n->gs_protocol_type, n->gs_delayed_return_code,
                                    failing_request(token, n->gs_protocol_type, n->gs_failing_request),
                                    shared(n->old_group_attributes)}});
}
inline wyx_callback_rc_t on_ping(const wyx_responsiveness_notification_t* n) {
  return Recorder::get().add({n->gs_notification_type, -1, {}, n->gs_responsiveness_information});
}
inline void on_query(const wyx_query_notification_t*) {}

// ------------------------------------------------------------------------------------------------ dispatching

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
