// Deep equality of what the engine and the wire say: what pointers point at is compared, not the pointers.
#pragma once

#include <algorithm>
#include <tuple>

#include "wire/messages.h"

namespace gs {

inline auto fields(const VoteResult& r) {
  return std::tie(r.voter, r.vote, r.summary, r.leave_code, r.proposed_state, r.message);
}
inline auto fields(const Proposal& p) {
  return std::tie(p.num_phases, p.phase, p.proposed_by, p.whats_changed, p.current_providers, p.changing_providers,
                  p.leave_codes, p.expel_info, p.current_state, p.proposed_state, p.message, p.new_attributes,
                  p.current_vote_results, p.changing_vote_results);
}
inline auto fields(const ProtocolNotification& n) {
  return std::tie(n.type, n.protocol, n.summary, n.time_limit, n.proposal, n.seqnum);
}
inline auto fields(const AnnouncementNotification& n) { return std::tie(n.summary, n.providers); }
inline auto fields(const SubscriptionNotification& n) {
  return std::tie(n.type, n.state, n.full_membership, n.changing_membership, n.leave_codes, n.seqnum);
}
inline auto fields(const DelayedErrorNotification& n) {
  return std::tie(n.protocol, n.rc, n.failing_request, n.group_attributes);
}
inline auto fields(const NodesNotification& n) { return std::tie(n.current, n.added, n.removed); }
inline auto fields(const MasterNotification& n) { return std::tie(n.master, n.size); }
inline auto fields(const QuorumNotification& n) { return std::tie(n.sequence, n.before, n.now, n.seqnum); }
inline auto fields(const QuorumErrorNotification& n) { return std::tie(n.sequence, n.rc); }
inline auto fields(const Delivery& d) { return std::tie(d.to, d.what); }
inline auto fields(const TimerRequest& t) { return std::tie(t.id, t.seconds); }
inline auto fields(const Outcome& o) { return std::tie(o.rc, o.deliveries, o.timers, o.domain); }

namespace wire {

inline auto fields(const Hello& m) {
  return std::tie(m.protocol_version, m.api_version, m.socket_control, m.program);
}
inline auto fields(const Attach& m) { return std::tie(m.session_number, m.cookie); }
inline auto fields(const Call& m) { return std::tie(m.request); }
inline auto fields(const SetResponsiveness& m) { return std::tie(m.type, m.interval, m.time_limit); }
inline auto fields(const PingAnswer& m) { return std::tie(m.number, m.ok); }
inline auto fields(const Welcome& m) { return std::tie(m.node_number, m.session_number, m.cookie); }
inline auto fields(const Answer& m) { return std::tie(m.rc); }
inline auto fields(const NodeInfo& m) { return std::tie(m.node_number, m.domain_master_node); }
inline auto fields(const Notify& m) { return std::tie(m.token, m.what); }
inline auto fields(const Ping& m) { return std::tie(m.number); }
inline auto fields(const QueryNode&) { return std::tie(); }
inline auto fields(const Quit&) { return std::tie(); }
inline auto fields(const Farewell&) { return std::tie(); }
inline auto fields(const Fanout& m) { return std::tie(m.tokens); }
inline auto fields(const FanoutEnd&) { return std::tie(); }
inline auto fields(const QuorumAnswer& m) { return std::tie(m.sequence); }
inline auto fields(const QueryAdapters& m) { return std::tie(m.node, m.address); }
inline auto fields(const DomainControl& m) { return std::tie(m.what); }
inline auto fields(const Inspect& m) { return std::tie(m.ask); }
inline auto fields(const Report& m) { return std::tie(m.report); }
inline auto fields(const NodeAdapters& m) { return std::tie(m.node, m.adapters); }

}  // namespace wire

struct Same {
  template <typename T>
  bool operator()(const T& a, const T& b) const {
    if constexpr (requires { fields(a); })
      return (*this)(fields(a), fields(b));
    else
      return a == b;
  }
  template <typename T>
  bool operator()(const std::shared_ptr<T>& a, const std::shared_ptr<T>& b) const {
    return a && b ? (*this)(*a, *b) : a == b;
  }
  template <typename T>
  bool operator()(const std::vector<T>& a, const std::vector<T>& b) const {
    return std::ranges::equal(a, b, *this);
  }
  template <typename... Ts>
  bool operator()(const std::tuple<Ts...>& a, const std::tuple<Ts...>& b) const {
    return [&]<std::size_t... I>(std::index_sequence<I...>) {
      return ((*this)(std::get<I>(a), std::get<I>(b)) && ...);
    }
    (std::index_sequence_for<Ts...>());
  }
  template <typename... Ts>
  bool operator()(const std::variant<Ts...>& a, const std::variant<Ts...>& b) const {
    const auto same_value = [&](const auto& value) {
      return (*this)(value, std::get<std::decay_t<decltype(value)>>(b));
    };
    return a.index() == b.index() && std::visit(same_value, a);
  }
};
inline constexpr Same same;

}  // namespace gs
