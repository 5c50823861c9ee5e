// Deep equality of what the engine says: what its pointers point at is compared, not the pointers.
#pragma once

#include <algorithm>

#include "engine/types.h"

namespace gs {

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
bool same(const std::variant<Ts...>& a, const std::variant<Ts...>& b) {
  if (a.index() != b.index()) return false;
  return std::visit([&b](const auto& value) { return same(value, std::get<std::decay_t<decltype(value)>>(b)); },
                    a);
}

inline bool same(const Outcome& a, const Outcome& b) {
  return a.rc == b.rc &&
         std::ranges::equal(a.deliveries, b.deliveries,
                            [](const auto& x, const auto& y) { return x.to == y.to && same(*x.what, *y.what); }) &&
         std::ranges::equal(a.timers, b.timers,
                            [](const auto& x, const auto& y) { return x.id == y.id && x.seconds == y.seconds; });
}

}  // namespace gs
