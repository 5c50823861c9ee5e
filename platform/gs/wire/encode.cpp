#include <algorithm>

#include "gs_generated.h"
#include "wire/fb_codec.h"

namespace gs::wire::detail {
namespace {

using Builder = flatbuffers::FlatBufferBuilder;
template <typename T>
using Offset = flatbuffers::Offset<T>;
using BytesOffset = Offset<flatbuffers::Vector<std::uint8_t>>;
using ProvidersOffset = Offset<flatbuffers::Vector<const fb::ProviderId*>>;

fb::ProviderId pack(const ProviderId& id) { return {id.instance, id.node}; }
fb::LeaveCode pack(const LeaveCode& code) { return {code.voluntary_or_failure, code.voluntary_code}; }
fb::DomainNode pack(const DomainNode& node) { return {node.number, node.epoch}; }
fb::Terms pack(const ProtocolTerms& terms) { return {terms.num_phases, terms.time_limit}; }

BytesOffset put(Builder& b, const Bytes& bytes) {
  return b.CreateVector(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
}
BytesOffset put(Builder& b, const std::optional<Bytes>& bytes) { return bytes ? put(b, *bytes) : BytesOffset(); }
BytesOffset put(Builder& b, const SharedBytes& bytes) { return bytes ? put(b, *bytes) : BytesOffset(); }

template <typename Packed, typename T>
Offset<flatbuffers::Vector<const Packed*>> put_structs(Builder& b, const std::vector<T>& values) {
  Packed* out = nullptr;
  auto offset = b.CreateUninitializedVectorOfStructs<Packed>(values.size(), &out);
  std::transform(values.begin(), values.end(), out, [](const T& value) { return pack(value); });
  return offset;
}
ProvidersOffset put(Builder& b, const Membership& members) { return put_structs<fb::ProviderId>(b, members); }
ProvidersOffset put(Builder& b, const SharedMembership& members) {
  return members ? put(b, *members) : ProvidersOffset();
}
Offset<flatbuffers::Vector<const fb::LeaveCode*>> put(Builder& b, const SharedLeaveCodes& codes) {
  if (!codes) return {};
  return put_structs<fb::LeaveCode>(b, *codes);
}

Offset<fb::Attributes> put(Builder& b, const GroupAttributes& a) {
  const auto group_name = b.CreateString(a.group_name);
  const auto source_name = b.CreateString(a.source_group_name);
  return fb::CreateAttributes(b, a.client_version, a.batch_control, a.num_phases, a.source_reflection_num_phases,
                              a.default_vote, a.merge_control, a.time_limit, a.source_reflection_time_limit,
                              group_name, source_name);
}
Offset<fb::Attributes> put(Builder& b, const std::shared_ptr<const GroupAttributes>& a) {
  return a ? put(b, *a) : Offset<fb::Attributes>();
}

// ------------------------------------------------------------------------------------------------ requests

using RequestBody = Body<fb::Request>;

RequestBody body(Builder& b, const JoinRequest& r) {
  const auto attributes = put(b, r.attributes);
  const auto local_name = b.CreateString(r.local_name);
  return {fb::Request::Join, fb::CreateJoin(b, r.token, attributes, r.instance, local_name).Union()};
}
RequestBody body(Builder& b, const StateChangeRequest& r) {
  const auto terms = pack(r.terms);
  const auto state = put(b, r.new_state);
  return {fb::Request::StateChange, fb::CreateStateChange(b, r.token, &terms, state).Union()};
}
RequestBody body(Builder& b, const MessageRequest& r) {
  const auto terms = pack(r.terms);
  const auto message = put(b, r.message);
  return {fb::Request::Message, fb::CreateMessage(b, r.token, &terms, message).Union()};
}
RequestBody body(Builder& b, const LeaveRequest& r) {
  const auto terms = pack(r.terms);
  return {fb::Request::Leave, fb::CreateLeave(b, r.token, &terms, r.leave_code).Union()};
}
RequestBody body(Builder& b, const ExpelRequest& r) {
  const auto terms = pack(r.terms);
  const auto expelled = put(b, r.expelled);
  const auto flag = put(b, r.deactivate_flag);
  return {fb::Request::Expel, fb::CreateExpel(b, r.token, &terms, expelled, r.deactivate_phase, flag).Union()};
}
RequestBody body(Builder& b, const AttributeChangeRequest& r) {
  const auto terms = pack(r.terms);
  const auto attributes = put(b, r.attributes);
  return {fb::Request::AttributeChange, fb::CreateAttributeChange(b, r.token, &terms, attributes).Union()};
}
RequestBody body(Builder& b, const GoodbyeRequest& r) {
  return {fb::Request::Goodbye, fb::CreateGoodbye(b, r.token).Union()};
}
RequestBody body(Builder& b, const VoteRequest& r) {
  const auto state = put(b, r.proposed_state);
  const auto message = put(b, r.message);
  return {fb::Request::Vote, fb::CreateVote(b, r.token, r.vote, state, message, r.default_vote).Union()};
}
RequestBody body(Builder& b, const SubscribeRequest& r) {
  const auto group_name = b.CreateString(r.group_name);
  return {fb::Request::Subscribe, fb::CreateSubscribe(b, r.token, r.control, group_name).Union()};
}
RequestBody body(Builder& b, const UnsubscribeRequest& r) {
  return {fb::Request::Unsubscribe, fb::CreateUnsubscribe(b, r.token).Union()};
}
RequestBody body(Builder& b, const Request& request) {
  return std::visit([&b](const auto& r) { return body(b, r); }, request);
}

// ---------------------------------------------------------------------------------------- client messages

using ClientBody = Body<fb::ClientBody>;

ClientBody body(Builder& b, const Hello& m) {
  const auto program = b.CreateString(m.program);
  return {fb::ClientBody::Hello,
          fb::CreateHello(b, m.protocol_version, m.api_version, m.socket_control, program).Union()};
}
ClientBody body(Builder& b, const Attach& m) {
  return {fb::ClientBody::Attach, fb::CreateAttach(b, m.session_number, m.cookie).Union()};
}
ClientBody body(Builder& b, const Call& m) {
  const auto request = body(b, m.request);
  return {fb::ClientBody::Call, fb::CreateCall(b, request.kind, request.value).Union()};
}
ClientBody body(Builder& b, const SetResponsiveness& m) {
  return {fb::ClientBody::SetResponsiveness,
          fb::CreateSetResponsiveness(b, m.type, m.interval, m.time_limit).Union()};
}
ClientBody body(Builder& b, const QueryNode&) {
  return {fb::ClientBody::QueryNode, fb::CreateQueryNode(b).Union()};
}
ClientBody body(Builder& b, const PingAnswer& m) {
  return {fb::ClientBody::PingAnswer, fb::CreatePingAnswer(b, m.number, m.ok).Union()};
}
ClientBody body(Builder& b, const Quit&) { return {fb::ClientBody::Quit, fb::CreateQuit(b).Union()}; }
ClientBody body(Builder& b, const QuorumAnswer& m) {
  return {fb::ClientBody::QuorumAnswer, fb::CreateQuorumAnswer(b, m.sequence).Union()};
}
ClientBody body(Builder& b, const QueryAdapters& m) {
  const auto address = m.address ? b.CreateVector(m.address->data(), m.address->size()) : BytesOffset();
  return {fb::ClientBody::QueryAdapters, fb::CreateQueryAdapters(b, m.node, address).Union()};
}

ClientBody body(Builder& b, const Inspect& m) {
  return {fb::ClientBody::Inspect, fb::CreateInspect(b, put(b, m.ask)).Union()};
}

// ------------------------------------------------------------------------------------------- notifications

using NotificationBody = Body<fb::Notification>;

Offset<flatbuffers::Vector<Offset<fb::VoteResult>>> put(Builder& b, const SharedVoteResults& results) {
  if (!results) return {};
  std::vector<Offset<fb::VoteResult>> offsets;
  offsets.reserve(results->size());
  for (const VoteResult& result : *results) {
    const auto voter = pack(result.voter);
    const auto state = put(b, result.proposed_state);
    const auto message = put(b, result.message);
    offsets.push_back(
        fb::CreateVoteResult(b, &voter, result.vote, result.summary, result.leave_code, state, message));
  }
  return b.CreateVector(offsets);
}

Offset<fb::ExpelInfo> put(Builder& b, const std::optional<ExpelInfo>& info) {
  if (!info) return {};
  const auto flag = put(b, info->flag);
  return fb::CreateExpelInfo(b, info->deactivate_phase, flag);
}

Offset<fb::Proposal> put(Builder& b, const Proposal& p) {
  const auto proposed_by = pack(p.proposed_by);
  const auto current_providers = put(b, p.current_providers);
  const auto changing_providers = put(b, p.changing_providers);
  const auto leave_codes = put(b, p.leave_codes);
  const auto expel_info = put(b, p.expel_info);
  const auto current_state = put(b, p.current_state);
  const auto proposed_state = put(b, p.proposed_state);
  const auto message = put(b, p.message);
  const auto new_attributes = put(b, p.new_attributes);
  const auto current_votes = put(b, p.current_vote_results);
  const auto changing_votes = put(b, p.changing_vote_results);
  return fb::CreateProposal(b, p.num_phases, p.phase, &proposed_by, p.whats_changed, current_providers,
                            changing_providers, leave_codes, expel_info, current_state, proposed_state, message,
                            new_attributes, current_votes, changing_votes);
}

NotificationBody body(Builder& b, const ProtocolNotification& n) {
  const auto proposal = put(b, n.proposal);
  return {fb::Notification::Protocol,
          fb::CreateProtocol(b, n.type, n.protocol, n.summary, n.time_limit, proposal, n.seqnum).Union()};
}
NotificationBody body(Builder& b, const AnnouncementNotification& n) {
  const auto providers = put(b, n.providers);
  return {fb::Notification::Announcement, fb::CreateAnnouncement(b, n.summary, providers).Union()};
}
NotificationBody body(Builder& b, const SubscriptionNotification& n) {
  const auto state = put(b, n.state);
  const auto full = put(b, n.full_membership);
  const auto changing = put(b, n.changing_membership);
  const auto codes = put(b, n.leave_codes);
  return {fb::Notification::Subscription,
          fb::CreateSubscription(b, n.type, state, full, changing, codes, n.seqnum).Union()};
}
NotificationBody body(Builder& b, const DelayedErrorNotification& n) {
  const auto request = body(b, n.failing_request);
  const auto attributes = put(b, n.group_attributes);
  return {fb::Notification::DelayedError,
          fb::CreateDelayedError(b, n.protocol, n.rc, request.kind, request.value, attributes).Union()};
}

// ----------------------------------------------------------------------------- notifications of the domain

using DomainBody = Body<fb::DomainNotification>;

DomainBody body(Builder& b, const NodesNotification& n) {
  const auto current = put_structs<fb::DomainNode>(b, n.current);
  const auto added = put_structs<fb::DomainNode>(b, n.added);
  const auto removed = put_structs<fb::DomainNode>(b, n.removed);
  return {fb::DomainNotification::Nodes, fb::CreateNodes(b, current, added, removed).Union()};
}
DomainBody body(Builder& b, const MasterNotification& n) {
  const auto master = pack(n.master);
  return {fb::DomainNotification::Master, fb::CreateMaster(b, &master, n.size).Union()};
}
DomainBody body(Builder& b, const QuorumNotification& n) {
  return {fb::DomainNotification::Quorum, fb::CreateQuorum(b, n.sequence, n.before, n.now, n.seqnum).Union()};
}
DomainBody body(Builder& b, const QuorumErrorNotification& n) {
  return {fb::DomainNotification::QuorumError, fb::CreateQuorumError(b, n.sequence, n.rc).Union()};
}

// ---------------------------------------------------------------------------------------- server messages

using ServerBody = Body<fb::ServerBody>;

ServerBody body(Builder& b, const Welcome& m) {
  return {fb::ServerBody::Welcome, fb::CreateWelcome(b, m.node_number, m.session_number, m.cookie).Union()};
}
ServerBody body(Builder& b, const Answer& m) {
  return {fb::ServerBody::Answer, fb::CreateAnswer(b, m.rc).Union()};
}
ServerBody body(Builder& b, const NodeInfo& m) {
  return {fb::ServerBody::NodeInfo, fb::CreateNodeInfo(b, m.node_number, m.domain_master_node).Union()};
}
ServerBody body(Builder& b, const Notify& m) {
  const auto what = std::visit([&b](const auto& n) { return body(b, n); }, *m.what);
  return {fb::ServerBody::Notify, fb::CreateNotify(b, what.kind, what.value).Union()};
}
ServerBody body(Builder& b, const Ping& m) { return {fb::ServerBody::Ping, fb::CreatePing(b, m.number).Union()}; }
ServerBody body(Builder& b, const Farewell&) { return {fb::ServerBody::Farewell, fb::CreateFarewell(b).Union()}; }
ServerBody body(Builder& b, const Fanout& m) {
  const auto tokens = b.CreateVector(m.tokens);
  return {fb::ServerBody::Fanout, fb::CreateFanout(b, tokens).Union()};
}
ServerBody body(Builder& b, const FanoutEnd&) {
  return {fb::ServerBody::FanoutEnd, fb::CreateFanoutEnd(b).Union()};
}
ServerBody body(Builder& b, const DomainControl& m) {
  const auto what = std::visit([&b](const auto& n) { return body(b, n); }, *m.what);
  return {fb::ServerBody::DomainControl, fb::CreateDomainControl(b, what.kind, what.value).Union()};
}
ServerBody body(Builder& b, const NodeAdapters& m) {
  const auto adapters = put_adapters(b, m.adapters);
  return {fb::ServerBody::NodeAdapters, fb::CreateNodeAdapters(b, m.node, adapters).Union()};
}
ServerBody body(Builder& b, const Report& m) {
  return {fb::ServerBody::Report, fb::CreateReport(b, put(b, m.report)).Union()};
}

}  // namespace

void build(flatbuffers::FlatBufferBuilder& builder, const ClientMessage& message) {
  const auto whole = std::visit([&builder](const auto& m) { return body(builder, m); }, message);
  builder.Finish(fb::CreateClientMessage(builder, whole.kind, whole.value), kClientMessageId);
}

void build(flatbuffers::FlatBufferBuilder& builder, const ServerMessage& message) {
  const auto whole = std::visit([&builder](const auto& m) { return body(builder, m); }, message);
  builder.Finish(fb::CreateServerMessage(builder, whole.kind, whole.value), kServerMessageId);
}

Body<fb::Request> put_request(flatbuffers::FlatBufferBuilder& builder, const Request& request) {
  return body(builder, request);
}

flatbuffers::Offset<FbAdapters> put_adapters(flatbuffers::FlatBufferBuilder& builder, const Adapters& adapters) {
  std::vector<Offset<fb::Adapter>> offsets;
  offsets.reserve(adapters.size());
  for (const Adapter& adapter : adapters) {
    const auto name = builder.CreateString(adapter.name);
    const auto address = builder.CreateVector(adapter.address.data(), adapter.address.size());
    offsets.push_back(fb::CreateAdapter(builder, name, address));
  }
  return builder.CreateVector(offsets);
}

}  // namespace gs::wire::detail
