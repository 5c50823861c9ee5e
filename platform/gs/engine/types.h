// The vocabulary of the group-services engine: identities, requests, events and notifications as plain values.
//
// Every layer above the engine speaks it: the wire codec turns these values into bytes and back, the daemon and
// the base API library pass them on. Shared payloads are immutable once published, so one notification can go to
// hundreds of endpoints without a copy.
#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "gscl/wyx_api.h"

namespace gs {

inline constexpr std::size_t kMaxGroupName = 32;               // characters
inline constexpr std::size_t kMaxStateValue = 64 * 1024;       // bytes
inline constexpr std::size_t kMaxProviderMessage = 64 * 1024;  // bytes
inline constexpr std::size_t kMaxExpelFlag = 256;              // bytes
inline constexpr std::size_t kMaxLocalName = 256;              // characters
inline constexpr std::size_t kMaxExpelList = 4096;             // providers
inline constexpr std::size_t kMaxSessionClients = 4096;        // providers and subscribers of one session
inline constexpr std::size_t kMaxSubscribers = 65'536;         // of one group
inline constexpr std::size_t kMaxBatch = 512;                  // joins or leaves in one protocol
inline constexpr std::size_t kMaxHosts = 512;
inline constexpr std::size_t kMaxAdapters = 64;                // of one host, those that stand first
inline constexpr std::size_t kMaxAdapterName = 15;             // bytes
inline constexpr std::size_t kMaxCollected = 4 * 1024 * 1024;  // bytes, of all values in one event's vote results

/// Chosen by the client, unique among the live tokens of its session, never negative.
using Token = std::int32_t;

/// One client's connection. Numbers are given out by the node's daemon and never used twice.
struct SessionId {
  std::uint32_t node = 0;
  std::uint64_t number = 0;
  auto operator<=>(const SessionId&) const = default;
};

/// A provider or a subscriber: what a notification is addressed to.
struct Endpoint {
  SessionId session;
  Token token = -1;
  auto operator<=>(const Endpoint&) const = default;
};

/// A provider's identity in its group.
struct ProviderId {
  std::int16_t instance = -1;
  std::int16_t node = -1;
  auto operator<=>(const ProviderId&) const = default;
};

using Membership = std::vector<ProviderId>;  // join order, oldest first
using Bytes = std::string;                   // state values and messages: any bytes
using SharedBytes = std::shared_ptr<const Bytes>;
using SharedMembership = std::shared_ptr<const Membership>;

struct GroupAttributes {
  std::int16_t client_version = 0;
  wyx_batch_ctrl_t batch_control = WYX_NO_BATCHING;
  wyx_num_phases_t num_phases = WYX_1_PHASE;
  wyx_num_phases_t source_reflection_num_phases = WYX_1_PHASE;
  wyx_vote_value_t default_vote = WYX_VOTE_APPROVE;
  wyx_merge_ctrl_t merge_control = WYX_DISSOLVE_MERGE;
  std::uint16_t time_limit = 0;  // seconds; 0: none
  std::uint16_t source_reflection_time_limit = 0;
  std::string group_name;
  std::string source_group_name;
  bool operator==(const GroupAttributes&) const = default;
};

/// One address of a host's network interface.
struct Adapter {
  /// IPv6, or an IPv4 address as IPv6 has it.
  using Address = std::array<std::uint8_t, 16>;
  std::string name;
  Address address{};
  bool operator==(const Adapter&) const = default;
};
using Adapters = std::vector<Adapter>;
inline bool is_adapter_name(const std::string& name) {
  return !name.empty() && name.size() <= kMaxAdapterName && name.find('\0') == std::string::npos;
}

// -------------------------------------------------------------------------------------------------- requests

/// How a proposed protocol runs.
struct ProtocolTerms {
  wyx_num_phases_t num_phases = WYX_1_PHASE;
  std::uint16_t time_limit = 0;  // seconds, of each phase; 0: none
  bool operator==(const ProtocolTerms&) const = default;
};

struct JoinRequest {
  Token token = -1;
  GroupAttributes attributes;
  std::int16_t instance = 0;
  std::string local_name;
  bool operator==(const JoinRequest&) const = default;
};
struct StateChangeRequest {
  Token token = -1;
  ProtocolTerms terms;
  Bytes new_state;
  bool operator==(const StateChangeRequest&) const = default;
};
struct MessageRequest {
  Token token = -1;
  ProtocolTerms terms;
  Bytes message;
  bool operator==(const MessageRequest&) const = default;
};
struct LeaveRequest {
  Token token = -1;
  ProtocolTerms terms;
  std::uint32_t leave_code = 0;
  bool operator==(const LeaveRequest&) const = default;
};
struct ExpelRequest {
  Token token = -1;
  ProtocolTerms terms;
  Membership expelled;
  std::int32_t deactivate_phase = 0;
  Bytes deactivate_flag;
  bool operator==(const ExpelRequest&) const = default;
};
struct AttributeChangeRequest {
  Token token = -1;
  ProtocolTerms terms;
  GroupAttributes attributes;
  bool operator==(const AttributeChangeRequest&) const = default;
};
struct GoodbyeRequest {
  Token token = -1;
  bool operator==(const GoodbyeRequest&) const = default;
};
struct VoteRequest {
  Token token = -1;
  wyx_vote_value_t vote = WYX_NULL_VOTE;
  std::optional<Bytes> proposed_state;
  std::optional<Bytes> message;
  wyx_vote_value_t default_vote = WYX_NULL_VOTE;  // WYX_NULL_VOTE: the group's
  bool operator==(const VoteRequest&) const = default;
};
struct SubscribeRequest {
  Token token = -1;
  std::uint32_t control = 0;  // flags of wyx_subscription_ctrl_t
  std::string group_name;
  bool operator==(const SubscribeRequest&) const = default;
};
struct UnsubscribeRequest {
  Token token = -1;
  bool operator==(const UnsubscribeRequest&) const = default;
};

using Request =
    std::variant<JoinRequest, StateChangeRequest, MessageRequest, LeaveRequest, ExpelRequest,
                 AttributeChangeRequest, GoodbyeRequest, VoteRequest, SubscribeRequest, UnsubscribeRequest>;

// -------------------------------------------------------------------------------------------- ordered events

/// A client's request. `answered`: its daemon has already said WYX_OK to the client (from precheck), so a refusal
/// found now goes out as a delayed error. None may be ordered after its session's SessionGoneEvent; those of a
/// host that is gone are refused with WYX_NO_INIT. `user`: the session's, in all its events; what is kept on the
/// request's account is charged to both.
struct RequestEvent {
  SessionId session;
  Request request;
  bool answered = false;
  std::uint32_t user = 0;  // 0: root
};
/// A client has quit or died; its providers fail, its subscriptions end.
struct SessionGoneEvent {
  SessionId session;
};
/// A host has died or left; all its sessions are gone. `leave_code`: flags of wyx_leave_code_t.
struct HostGoneEvent {
  std::uint32_t node = 0;
  std::uint32_t leave_code = WYX_HOST_FAILURE;
};
struct HostCameEvent {
  std::uint32_t node = 0;
};

/// What a host has from now on, so that clients of the others can ask for it.
struct AdaptersEvent {
  std::uint32_t node = 0;
  Adapters adapters;  // at most kMaxAdapters
};

/// Names one phase of one protocol of one group; an expiry of a phase that is over is ignored.
struct TimerId {
  std::string group;
  std::uint64_t protocol = 0;
  std::uint32_t phase = 0;
  auto operator<=>(const TimerId&) const = default;
};
struct TimerExpiredEvent {
  TimerId timer;
};
/// A client has stopped or started again to answer the daemon's pings; its groups are told.
struct ResponsivenessEvent {
  SessionId session;
  bool responding = false;
};

/// Goes on with what earlier events have left to do. To be ordered while Engine::busy.
struct ContinueEvent {};

/// What is numbered from now on has numbers above this one: those below may have named what is not known any more.
struct NumbersEvent {
  std::uint64_t above = 0;
};

using Event = std::variant<RequestEvent, SessionGoneEvent, HostGoneEvent, HostCameEvent, TimerExpiredEvent,
                           ResponsivenessEvent, ContinueEvent, NumbersEvent, AdaptersEvent>;

// --------------------------------------------------------------------------------------------- notifications

struct LeaveCode {
  std::uint32_t voluntary_or_failure = 0;  // flags of wyx_leave_code_t
  std::uint32_t voluntary_code = 0;        // what the leaver gave
  bool operator==(const LeaveCode&) const = default;
};

struct VoteResult {
  ProviderId voter;
  wyx_vote_value_t vote = WYX_NULL_VOTE;
  std::uint32_t summary = 0;  // flags of wyx_summary_code_t
  std::uint32_t leave_code = 0;
  SharedBytes proposed_state;
  SharedBytes message;
};

using SharedLeaveCodes = std::shared_ptr<const std::vector<LeaveCode>>;
using SharedVoteResults = std::shared_ptr<const std::vector<VoteResult>>;

struct ExpelInfo {
  std::int32_t deactivate_phase = 0;
  Bytes flag;
  bool operator==(const ExpelInfo&) const = default;
};

/// An absent part is a null pointer or an empty optional; `whats_changed` has the matching bits. Lists are shared:
/// in a batch each changing provider gets a notification of its own.
struct Proposal {
  std::uint16_t num_phases = 1;
  std::uint16_t phase = 1;  // counted from 1
  ProviderId proposed_by;
  std::uint32_t whats_changed = 0;  // flags of wyx_whats_changed_t
  SharedMembership current_providers;
  SharedMembership changing_providers;
  SharedLeaveCodes leave_codes;  // one for each changing provider of a leave; else null
  std::optional<ExpelInfo> expel_info;
  SharedBytes current_state;
  SharedBytes proposed_state;
  SharedBytes message;
  std::shared_ptr<const GroupAttributes> new_attributes;
  SharedVoteResults current_vote_results;
  SharedVoteResults changing_vote_results;
};

/// `type` is WYX_N_PHASE_NOTIFICATION, WYX_APPROVED_NOTIFICATION or WYX_REJECTED_NOTIFICATION.
struct ProtocolNotification {
  wyx_notification_type_t type = WYX_N_PHASE_NOTIFICATION;
  wyx_request_t protocol = WYX_JOIN;
  std::uint32_t summary = 0;     // flags of wyx_summary_code_t
  std::uint16_t time_limit = 0;  // seconds, of an n-phase notification
  Proposal proposal;
  std::uint64_t seqnum = 0;
};
struct AnnouncementNotification {
  std::uint32_t summary = 0;   // flags of wyx_summary_code_t
  SharedMembership providers;  // whom it is about; null: nobody in particular
};
struct SubscriptionNotification {
  std::uint32_t type = 0;  // flags of wyx_subscription_type_t
  SharedBytes state;
  SharedMembership full_membership;
  SharedMembership changing_membership;
  SharedLeaveCodes leave_codes;  // one for each changing provider of a leave; else null
  std::uint64_t seqnum = 0;
};
struct DelayedErrorNotification {
  wyx_request_t protocol = WYX_JOIN;
  wyx_rc_t rc = WYX_OK;  // `protocol` is WYX_INTERNAL_REQUEST for a vote or a goodbye
  Request failing_request;
  std::shared_ptr<const GroupAttributes> group_attributes;  // the group's, when they are the reason
};

using Notification = std::variant<ProtocolNotification, AnnouncementNotification, SubscriptionNotification,
                                  DelayedErrorNotification>;

/// One notification on its way to one endpoint.
struct Delivery {
  Endpoint to;
  std::shared_ptr<const Notification> what;
};

// ------------------------------------------------------------------------------- notifications of the domain

/// A host that takes part. `epoch`: another one each time that it comes.
struct DomainNode {
  std::uint32_t number = 0;
  std::uint32_t epoch = 0;
  bool operator==(const DomainNode&) const = default;
};
using DomainNodes = std::vector<DomainNode>;  // ascending

/// The hosts are other ones than before.
struct NodesNotification {
  DomainNodes current;
  DomainNodes added;
  DomainNodes removed;
};
/// The master, the host with the lowest number, is another one than before.
struct MasterNotification {
  DomainNode master;
  std::uint32_t size = 0;  // hosts
};
struct QuorumNotification {
  std::uint64_t sequence = 0;  // 0: it is not to be answered
  wyx_quorum_state_t before = WYX_QUORUM_STATE_PENDING;
  wyx_quorum_state_t now = WYX_QUORUM_STATE_HAS;
  std::uint64_t seqnum = 0;  // of the hosts' last change when there was quorum
};
/// What the client has answered to a quorum notification is refused.
struct QuorumErrorNotification {
  std::uint64_t sequence = 0;  // that it named
  wyx_rc_t rc = WYX_OK;
};

/// Goes to sessions that have asked for it, not to a provider or subscriber.
using DomainNotification =
    std::variant<NodesNotification, MasterNotification, QuorumNotification, QuorumErrorNotification>;

/// The hosts as they are.
struct DomainView {
  DomainNodes nodes;
  std::uint64_t seqnum = 0;  // of the last change
};

/// A phase has opened: asks that TimerExpiredEvent{id} be ordered after `seconds`.
struct TimerRequest {
  TimerId id;
  std::uint16_t seconds = 0;  // 0: the phase has no time limit
};

/// Somebody who has been asked to vote and has not.
struct MissingVoter {
  Endpoint to;
  ProviderId id;
  std::string local_name;
};
struct MissingVotes {
  std::string protocol;  // printable name; empty: none runs
  std::uint32_t phase = 0;
  std::size_t count = 0;
  std::vector<MissingVoter> voters;  // the first of them, in the order in which they were asked
};

/// What came of one ordered event. `rc` answers a RequestEvent; where it was answered before, a refusal is among
/// the deliveries instead.
struct Outcome {
  wyx_rc_t rc = WYX_OK;
  std::vector<Delivery> deliveries;  // in the order in which each endpoint must see them
  std::vector<TimerRequest> timers;
  std::vector<DomainNotification> domain;  // for each session that has asked for them, before its deliveries
};

}  // namespace gs
