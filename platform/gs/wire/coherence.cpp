#include "wire/coherence.h"

#include <algorithm>

#include "engine/protocols.h"

namespace gs::wire::detail {
namespace {

constexpr std::uint32_t kMembership =
    WYX_PROPOSED_MEMBERSHIP | WYX_ONGOING_MEMBERSHIP | WYX_UPDATED_MEMBERSHIP | WYX_REJECTED_MEMBERSHIP;
constexpr std::uint32_t kAttributes = WYX_PROPOSED_GROUP_ATTRIBUTES | WYX_ONGOING_GROUP_ATTRIBUTES |
                                      WYX_UPDATED_GROUP_ATTRIBUTES | WYX_REJECTED_GROUP_ATTRIBUTES;

/// Every part that `whats_changed` names is there. An updated state value is the current one.
bool has_what_it_says(const Proposal& p) {
  const auto lacks = [&](std::uint32_t bits, bool there) { return (p.whats_changed & bits) != 0 && !there; };
  return !lacks(kMembership, p.changing_providers != nullptr) &&
         !lacks(WYX_PROPOSED_STATE_VALUE | WYX_ONGOING_STATE_VALUE, p.proposed_state != nullptr) &&
         !lacks(WYX_UPDATED_PROVIDER_MESSAGE, p.message != nullptr) &&
         !lacks(WYX_EXPEL_INFORMATION, p.expel_info.has_value()) &&
         !lacks(kAttributes, p.new_attributes != nullptr);
}

const char* contradiction_in(const ProtocolNotification& n) {
  const Proposal& p = n.proposal;
  if (!is_protocol(n.protocol)) return "a notification of something that is no protocol";
  if (p.num_phases < WYX_1_PHASE || p.num_phases > WYX_N_PHASE || p.phase == 0) return "phases that cannot be";
  if (!p.current_providers || !p.current_state) return "a proposal without the group's members or state value";
  if (!has_what_it_says(p)) return "a proposal without a part that it says has changed";
  return nullptr;
}

const char* contradiction_in(const AnnouncementNotification& n) {
  const bool dissolved = (n.summary & WYX_GROUP_DISSOLVED) != 0;
  if (dissolved && n.summary != WYX_GROUP_DISSOLVED) return "a group's end together with something else";
  if ((n.summary & WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY) != 0) return "a daemon that says that it is dead";
  return nullptr;
}

const char* contradiction_in(const SubscriptionNotification& n) {
  constexpr std::uint32_t kDeltas = WYX_SUBSCRIPTION_DELTA_JOIN | WYX_SUBSCRIPTION_DELTA_LEAVE;
  const bool dissolved = (n.type & WYX_SUBSCRIPTION_DISSOLVED) != 0;
  if (dissolved && n.type != WYX_SUBSCRIPTION_DISSOLVED) return "a group's end together with something else";
  if ((n.type & kDeltas) == kDeltas) return "joins and leaves in one list";
  if ((n.type & kDeltas) != 0 && !n.changing_membership) return "a change of members without them";
  if ((n.type & WYX_SUBSCRIPTION_STATE) != 0 && !n.state) return "a change of a state value without it";
  if ((n.type & WYX_SUBSCRIPTION_MEMBERSHIP) != 0 && !n.full_membership) return "a membership without it";
  if ((n.type & WYX_SUBSCRIPTION_DELTA_LEAVE) == 0 && n.leave_codes) return "leave codes without a leave";
  return nullptr;
}

const char* contradiction_in(const DelayedErrorNotification& n) {
  if (n.protocol != protocol_of(n.failing_request)) return "a delayed error of another request than it names";
  if (n.rc == WYX_OK) return "a delayed error that is none";
  return nullptr;
}

bool ascend(const DomainNodes& nodes) {
  const auto not_before = [](const DomainNode& a, const DomainNode& b) { return a.number >= b.number; };
  return nodes.size() <= kMaxHosts && std::ranges::adjacent_find(nodes, not_before) == nodes.end();
}

const char* contradiction_in(const NodesNotification& n) {
  return ascend(n.current) && ascend(n.added) && ascend(n.removed) ? nullptr : "nodes that do not ascend";
}
const char* contradiction_in(const MasterNotification& n) {
  return n.size == 0 || n.size > kMaxHosts ? "a master of too few or too many nodes" : nullptr;
}
const char* contradiction_in(const QuorumNotification&) { return nullptr; }
const char* contradiction_in(const QuorumErrorNotification& n) {
  return n.rc == WYX_OK ? "an error that is none" : nullptr;
}

}  // namespace

const char* contradiction_in(const DomainNotification& notification) {
  return std::visit([](const auto& n) { return contradiction_in(n); }, notification);
}

const char* contradiction_in(const Notification& notification) {
  return std::visit([](const auto& n) { return contradiction_in(n); }, notification);
}

}  // namespace gs::wire::detail
