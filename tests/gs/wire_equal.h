// Deep equality of messages, so that a round trip can be held against what went in.
#pragma once

#include "wire/messages.h"

namespace gs::wire {

template <typename T>
bool same(const std::shared_ptr<const T>& a, const std::shared_ptr<const T>& b) {
  return (a == nullptr) == (b == nullptr) && (a == nullptr || *a == *b);
}

inline bool same(const Proposal& a, const Proposal& b) {
  return a.num_phases == b.num_phases && a.phase == b.phase && a.proposed_by == b.proposed_by &&
         a.whats_changed == b.whats_changed && same(a.current_providers, b.current_providers) &&
         same(a.changing_providers, b.changing_providers) && a.leave_codes == b.leave_codes &&
         a.expel_info == b.expel_info && same(a.current_state, b.current_state) &&
         same(a.proposed_state, b.proposed_state) && same(a.message, b.message) &&
         same(a.new_attributes, b.new_attributes) && a.current_vote_results == b.current_vote_results &&
         a.changing_vote_results == b.changing_vote_results;
}
inline bool same(const ProtocolNotification& a, const ProtocolNotification& b) {
  return a.type == b.type && a.protocol == b.protocol && a.summary == b.summary && a.time_limit == b.time_limit &&
         same(a.proposal, b.proposal) && a.seqnum == b.seqnum;
}
inline bool same(const AnnouncementNotification& a, const AnnouncementNotification& b) {
  return a.summary == b.summary && same(a.providers, b.providers);
}
inline bool same(const SubscriptionNotification& a, const SubscriptionNotification& b) {
  return a.type == b.type && same(a.state, b.state) && same(a.full_membership, b.full_membership) &&
         same(a.changing_membership, b.changing_membership) && a.leave_codes == b.leave_codes &&
         a.seqnum == b.seqnum;
}
inline bool same(const DelayedErrorNotification& a, const DelayedErrorNotification& b) {
  return a.protocol == b.protocol && a.rc == b.rc && a.failing_request == b.failing_request &&
         same(a.group_attributes, b.group_attributes);
}

template <typename... Ts>
bool same(const std::variant<Ts...>& a, const std::variant<Ts...>& b);

inline bool same(const Hello& a, const Hello& b) {
  return a.protocol_version == b.protocol_version && a.api_version == b.api_version &&
         a.socket_control == b.socket_control && a.program == b.program;
}
inline bool same(const Attach& a, const Attach& b) {
  return a.session_number == b.session_number && a.cookie == b.cookie;
}
inline bool same(const Call& a, const Call& b) { return a.request == b.request; }
inline bool same(const SetResponsiveness& a, const SetResponsiveness& b) {
  return a.type == b.type && a.interval == b.interval && a.time_limit == b.time_limit;
}
inline bool same(const QueryNode&, const QueryNode&) { return true; }
inline bool same(const PingAnswer& a, const PingAnswer& b) { return a.number == b.number && a.ok == b.ok; }
inline bool same(const Quit&, const Quit&) { return true; }
inline bool same(const Welcome& a, const Welcome& b) {
  return a.node_number == b.node_number && a.session_number == b.session_number && a.cookie == b.cookie;
}
inline bool same(const Answer& a, const Answer& b) { return a.rc == b.rc; }
inline bool same(const NodeInfo& a, const NodeInfo& b) {
  return a.node_number == b.node_number && a.domain_master_node == b.domain_master_node;
}
inline bool same(const Notify& a, const Notify& b) { return a.token == b.token && same(*a.what, *b.what); }
inline bool same(const Ping& a, const Ping& b) { return a.number == b.number; }
inline bool same(const Farewell&, const Farewell&) { return true; }

template <typename... Ts>
bool same(const std::variant<Ts...>& a, const std::variant<Ts...>& b) {
  if (a.index() != b.index()) return false;
  return std::visit([&b](const auto& value) { return same(value, std::get<std::decay_t<decltype(value)>>(b)); },
                    a);
}

}  // namespace gs::wire
