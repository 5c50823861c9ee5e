#include <algorithm>

#include "engine/enumerations.h"
#include "gs_generated.h"
#include "wire/codec.h"
#include "wire/coherence.h"
#include "wire/fb_codec.h"

namespace gs::wire::detail {
namespace {

using FbBytes = flatbuffers::Vector<std::uint8_t>;
using FbProviders = flatbuffers::Vector<const fb::ProviderId*>;
using FbLeaveCodes = flatbuffers::Vector<const fb::LeaveCode*>;
using FbVoteResults = flatbuffers::Vector<flatbuffers::Offset<fb::VoteResult>>;

/// Turns a verified FlatBuffer into values. The first thing wrong is kept; what is read after it is not to be
/// used.
class Reader {
 public:
  explicit Reader(std::size_t message_size) : left_(message_size) {}

  const char* problem() const { return problem_; }
  void fail(const char* why) {
    if (problem_ == nullptr) problem_ = why;
  }

  /// Parts of a FlatBuffer may lie in one another, and little could grow to more than there is memory. True: the
  /// parts read so far are no larger than their message.
  bool take(std::size_t size) {
    if (size > left_) fail("parts that lie in one another");
    left_ -= std::min(size, left_);
    return problem_ == nullptr;
  }

  template <typename E>
  E enumeration(int value) {
    if (known(static_cast<E*>(nullptr), value)) return static_cast<E>(value);
    fail("a number that is no value of its enumeration");
    return E();
  }

  std::uint32_t flags(std::uint32_t value, std::uint32_t known_bits) {
    if ((value & ~known_bits) != 0) fail("flags that do not exist");
    return value;
  }

  std::uint32_t node_number(std::uint32_t value) {
    if (value > kMaxNodeNumber) fail("a number that no node has");
    return value;
  }

  std::string name(const flatbuffers::String* text) {
    if (!take(text->size())) return {};
    if (text->size() > kMaxWireName) {
      fail("a name over the limit");
      return {};
    }
    std::string value = text->str();
    if (value.find('\0') != std::string::npos) fail("a name with a NUL in it");
    return value;
  }

  Bytes bytes(const FbBytes* data) {
    if (!take(data->size())) return {};
    return {reinterpret_cast<const char*>(data->data()), data->size()};
  }
  std::optional<Bytes> optional_bytes(const FbBytes* data) {
    return data == nullptr ? std::nullopt : std::optional<Bytes>(bytes(data));
  }
  SharedBytes shared_bytes(const FbBytes* data) {
    return data == nullptr ? nullptr : std::make_shared<const Bytes>(bytes(data));
  }

  static ProviderId value(const fb::ProviderId* id) { return {id->instance(), id->node()}; }
  ProtocolTerms value(const fb::Terms* terms) {
    return {enumeration<wyx_num_phases_t>(terms->num_phases()), terms->time_limit()};
  }

  Membership members(const FbProviders* ids) {
    Membership result;
    if (!take(ids->size() * sizeof(fb::ProviderId))) return result;
    result.reserve(ids->size());
    std::transform(ids->begin(), ids->end(), std::back_inserter(result), [](auto* id) { return value(id); });
    return result;
  }
  SharedMembership shared_members(const FbProviders* ids) {
    return ids == nullptr ? nullptr : std::make_shared<const Membership>(members(ids));
  }

  /// One for each of `changing`, or none.
  SharedLeaveCodes leave_codes(const FbLeaveCodes* codes, const FbProviders* changing) {
    if (codes == nullptr) return {};
    if (changing == nullptr || codes->size() != changing->size()) fail("leave codes that match no providers");
    if (codes->size() == 0 || !take(codes->size() * sizeof(fb::LeaveCode))) return {};
    std::vector<LeaveCode> result;
    result.reserve(codes->size());
    for (const fb::LeaveCode* code : *codes) {
      result.push_back({flags(code->voluntary_or_failure(), kLeaveCodeBits), code->voluntary_code()});
    }
    return std::make_shared<const std::vector<LeaveCode>>(std::move(result));
  }

  GroupAttributes value(const fb::Attributes* a) {
    GroupAttributes result;
    result.client_version = a->client_version();
    result.batch_control = enumeration<wyx_batch_ctrl_t>(a->batch_control());
    result.num_phases = enumeration<wyx_num_phases_t>(a->num_phases());
    result.source_reflection_num_phases = enumeration<wyx_num_phases_t>(a->source_reflection_num_phases());
    result.default_vote = enumeration<wyx_vote_value_t>(a->default_vote());
    result.merge_control = enumeration<wyx_merge_ctrl_t>(a->merge_control());
    result.time_limit = a->time_limit();
    result.source_reflection_time_limit = a->source_reflection_time_limit();
    result.group_name = name(a->group_name());
    result.source_group_name = name(a->source_group_name());
    return result;
  }
  std::shared_ptr<const GroupAttributes> shared_value(const fb::Attributes* a) {
    return a == nullptr ? nullptr : std::make_shared<const GroupAttributes>(value(a));
  }

  // ---------------------------------------------------------------------------------------------- requests

  Request value(const fb::Join* r) {
    return JoinRequest{r->token(), value(r->attributes()), r->instance(), name(r->local_name())};
  }
  Request value(const fb::StateChange* r) {
    return StateChangeRequest{r->token(), value(r->terms()), bytes(r->new_state())};
  }
  Request value(const fb::Message* r) {
    return MessageRequest{r->token(), value(r->terms()), bytes(r->message())};
  }
  Request value(const fb::Leave* r) { return LeaveRequest{r->token(), value(r->terms()), r->leave_code()}; }
  Request value(const fb::Expel* r) {
    return ExpelRequest{r->token(), value(r->terms()), members(r->expelled()), r->deactivate_phase(),
                        bytes(r->deactivate_flag())};
  }
  Request value(const fb::AttributeChange* r) {
    return AttributeChangeRequest{r->token(), value(r->terms()), value(r->attributes())};
  }
  Request value(const fb::Vote* r) {
    return VoteRequest{r->token(), enumeration<wyx_vote_value_t>(r->vote()), optional_bytes(r->proposed_state()),
                       optional_bytes(r->message()), enumeration<wyx_vote_value_t>(r->default_vote())};
  }
  Request value(const fb::Subscribe* r) {
    return SubscribeRequest{r->token(), r->control(), name(r->group_name())};
  }

  /// `table` is the union's member, of the type that `kind` says.
  Request request(fb::Request kind, const void* table) {
    switch (kind) {
      case fb::Request::Join:
        return value(static_cast<const fb::Join*>(table));
      case fb::Request::StateChange:
        return value(static_cast<const fb::StateChange*>(table));
      case fb::Request::Message:
        return value(static_cast<const fb::Message*>(table));
      case fb::Request::Leave:
        return value(static_cast<const fb::Leave*>(table));
      case fb::Request::Expel:
        return value(static_cast<const fb::Expel*>(table));
      case fb::Request::AttributeChange:
        return value(static_cast<const fb::AttributeChange*>(table));
      case fb::Request::Goodbye:
        return GoodbyeRequest{static_cast<const fb::Goodbye*>(table)->token()};
      case fb::Request::Vote:
        return value(static_cast<const fb::Vote*>(table));
      case fb::Request::Subscribe:
        return value(static_cast<const fb::Subscribe*>(table));
      case fb::Request::Unsubscribe:
        return UnsubscribeRequest{static_cast<const fb::Unsubscribe*>(table)->token()};
      case fb::Request::NONE:
        break;
    }
    fail("a request of an unknown kind");
    return {};
  }

  // ----------------------------------------------------------------------------------------- notifications

  SharedVoteResults votes(const FbVoteResults* results) {
    // The least that one can be: its offset in the vector, its own to its table's layout, the voter.
    constexpr std::size_t kSmallest = 2 * sizeof(flatbuffers::uoffset_t) + sizeof(fb::ProviderId);
    if (results == nullptr || results->size() == 0 || !take(results->size() * kSmallest)) return {};
    std::vector<VoteResult> values;
    values.reserve(results->size());
    for (const fb::VoteResult* r : *results) {
      values.push_back({value(r->voter()), enumeration<wyx_vote_value_t>(r->vote()),
                        flags(r->summary(), kSummaryBits), flags(r->leave_code(), kLeaveCodeBits),
                        shared_bytes(r->proposed_state()), shared_bytes(r->message())});
    }
    return std::make_shared<const std::vector<VoteResult>>(std::move(values));
  }

  Proposal value(const fb::Proposal* p) {
    Proposal result;
    result.num_phases = p->num_phases();
    result.phase = p->phase();
    result.proposed_by = value(p->proposed_by());
    result.whats_changed = flags(p->whats_changed(), kWhatsChangedBits);
    result.current_providers = shared_members(p->current_providers());
    result.changing_providers = shared_members(p->changing_providers());
    result.leave_codes = leave_codes(p->leave_codes(), p->changing_providers());
    if (const auto* expel = p->expel_info()) {
      result.expel_info = ExpelInfo{expel->deactivate_phase(), bytes(expel->flag())};
    }
    result.current_state = shared_bytes(p->current_state());
    result.proposed_state = shared_bytes(p->proposed_state());
    result.message = shared_bytes(p->message());
    result.new_attributes = shared_value(p->new_attributes());
    result.current_vote_results = votes(p->current_vote_results());
    result.changing_vote_results = votes(p->changing_vote_results());
    return result;
  }

  ProtocolNotification value(const fb::Protocol* n) {
    return {enumeration<wyx_notification_type_t>(n->type()),
            enumeration<wyx_request_t>(n->protocol()),
            flags(n->summary(), kSummaryBits),
            n->time_limit(),
            value(n->proposal()),
            n->seqnum()};
  }
  AnnouncementNotification value(const fb::Announcement* n) {
    return {flags(n->summary(), kSummaryBits), shared_members(n->providers())};
  }
  SubscriptionNotification value(const fb::Subscription* n) {
    return {flags(n->type(), kSubscriptionTypeBits),
            shared_bytes(n->state()),
            shared_members(n->full_membership()),
            shared_members(n->changing_membership()),
            leave_codes(n->leave_codes(), n->changing_membership()),
            n->seqnum()};
  }
  DelayedErrorNotification value(const fb::DelayedError* n) {
    return {enumeration<wyx_request_t>(n->protocol()), enumeration<wyx_rc_t>(n->rc()),
            request(n->failing_request_type(), n->failing_request()), shared_value(n->group_attributes())};
  }

  template <typename Table>
  std::shared_ptr<const Notification> shared_notification(const Table* n) {
    return std::make_shared<const Notification>(value(n));
  }
  /// Null: it is of no kind.
  std::shared_ptr<const Notification> notification(const fb::Notify& m) {
    switch (m.what_type()) {
      case fb::Notification::Protocol:
        return shared_notification(m.what_as_Protocol());
      case fb::Notification::Announcement:
        return shared_notification(m.what_as_Announcement());
      case fb::Notification::Subscription:
        return shared_notification(m.what_as_Subscription());
      case fb::Notification::DelayedError:
        return shared_notification(m.what_as_DelayedError());
      case fb::Notification::NONE:
        break;
    }
    fail("a notification of an unknown kind");
    return nullptr;
  }

  // --------------------------------------------------------------------------- of the domain, of its adapters

  DomainNode value(const fb::DomainNode* node) { return {node_number(node->number()), node->epoch()}; }
  DomainNodes nodes(const flatbuffers::Vector<const fb::DomainNode*>* from) {
    DomainNodes result;
    if (!take(from->size() * sizeof(fb::DomainNode))) return result;
    for (const fb::DomainNode* node : *from) result.push_back(value(node));
    return result;
  }

  DomainNotification value(const fb::Nodes* n) {
    return NodesNotification{nodes(n->current()), nodes(n->added()), nodes(n->removed())};
  }
  DomainNotification value(const fb::Master* n) { return MasterNotification{value(n->node()), n->size()}; }
  DomainNotification value(const fb::Quorum* n) {
    return QuorumNotification{n->sequence(), enumeration<wyx_quorum_state_t>(n->before()),
                              enumeration<wyx_quorum_state_t>(n->now()), n->seqnum()};
  }
  DomainNotification value(const fb::QuorumError* n) {
    return QuorumErrorNotification{n->sequence(), enumeration<wyx_rc_t>(n->rc())};
  }

  DomainNotification domain_notification(const fb::DomainControl& m) {
    switch (m.what_type()) {
      case fb::DomainNotification::Nodes:
        return value(m.what_as_Nodes());
      case fb::DomainNotification::Master:
        return value(m.what_as_Master());
      case fb::DomainNotification::Quorum:
        return value(m.what_as_Quorum());
      case fb::DomainNotification::QuorumError:
        return value(m.what_as_QuorumError());
      case fb::DomainNotification::NONE:
        break;
    }
    fail("a notification of an unknown kind");
    return {};
  }

  Adapter::Address address(const FbBytes* from) {
    Adapter::Address result{};
    if (from->size() == result.size())
      std::copy(from->begin(), from->end(), result.begin());
    else
      fail("an address that is none");
    return result;
  }
  Adapters adapters(const FbAdapters& from) {
    Adapters result;
    if (from.size() > kMaxAdapters) {
      fail("more adapters than there may be");
      return result;
    }
    for (const fb::Adapter* adapter : from) {
      result.push_back({name(adapter->name()), address(adapter->address())});
      if (!is_adapter_name(result.back().name)) fail("a name that no adapter has");
    }
    return result;
  }

  // ---------------------------------------------------------------------------------------------- messages

  std::vector<Token> tokens(const flatbuffers::Vector<Token>& values) {
    if (values.size() < 2 || values.size() > kMaxFanout) {
      fail("a fan-out to too few or too many");
      return {};
    }
    std::vector<Token> result(values.begin(), values.end());
    if (std::any_of(result.begin(), result.end(), [](Token token) { return token < 0; })) fail("a token below 0");
    return result;
  }

  ClientMessage client_message(const fb::ClientMessage& m);
  ServerMessage server_message(const fb::ServerMessage& m, Token token);

 private:
  const char* problem_ = nullptr;
  std::size_t left_;  // bytes of the message that no part has taken
};

ClientMessage Reader::client_message(const fb::ClientMessage& m) {
  switch (m.body_type()) {
    case fb::ClientBody::Hello: {
      const auto* hello = m.body_as_Hello();
      return Hello{hello->protocol_version(), hello->api_version(), hello->socket_control(),
                   name(hello->program())};
    }
    case fb::ClientBody::Attach:
      return Attach{m.body_as_Attach()->session_number(), m.body_as_Attach()->cookie()};
    case fb::ClientBody::Call:
      return Call{request(m.body_as_Call()->request_type(), m.body_as_Call()->request())};
    case fb::ClientBody::SetResponsiveness: {
      const auto* set = m.body_as_SetResponsiveness();
      return SetResponsiveness{set->type(), set->interval(), set->time_limit()};
    }
    case fb::ClientBody::QueryNode:
      return QueryNode{};
    case fb::ClientBody::PingAnswer:
      return PingAnswer{m.body_as_PingAnswer()->number(), m.body_as_PingAnswer()->ok()};
    case fb::ClientBody::Quit:
      return Quit{};
    case fb::ClientBody::QuorumAnswer:
      return QuorumAnswer{m.body_as_QuorumAnswer()->sequence()};
    case fb::ClientBody::QueryAdapters: {
      const auto* query = m.body_as_QueryAdapters();
      QueryAdapters result{node_number(query->node()), {}};
      if (query->address() != nullptr) result.address = address(query->address());
      return result;
    }
    case fb::ClientBody::Inspect:
      return Inspect{bytes(m.body_as_Inspect()->ask())};
    case fb::ClientBody::NONE:
      break;
  }
  fail("a message of an unknown kind");
  return {};
}

ServerMessage Reader::server_message(const fb::ServerMessage& m, Token token) {
  if (token != -1 && m.body_type() != fb::ServerBody::Notify) fail("a token on a message that has none");
  switch (m.body_type()) {
    case fb::ServerBody::Welcome: {
      const auto* welcome = m.body_as_Welcome();
      return Welcome{node_number(welcome->node_number()), welcome->session_number(), welcome->cookie()};
    }
    case fb::ServerBody::Answer:
      return Answer{enumeration<wyx_rc_t>(m.body_as_Answer()->rc())};
    case fb::ServerBody::NodeInfo:
      return NodeInfo{node_number(m.body_as_NodeInfo()->node_number()),
                      node_number(m.body_as_NodeInfo()->domain_master_node())};
    case fb::ServerBody::Notify: {
      if (token < -1) fail("a token below 0");
      auto what = notification(*m.body_as_Notify());
      if (const char* why = what ? contradiction_in(*what) : nullptr; why != nullptr) fail(why);
      return Notify{token, std::move(what)};
    }
    case fb::ServerBody::Ping:
      return Ping{m.body_as_Ping()->number()};
    case fb::ServerBody::Farewell:
      return Farewell{};
    case fb::ServerBody::Fanout:
      return Fanout{tokens(*m.body_as_Fanout()->tokens())};
    case fb::ServerBody::FanoutEnd:
      return FanoutEnd{};
    case fb::ServerBody::DomainControl: {
      auto what = std::make_shared<const DomainNotification>(domain_notification(*m.body_as_DomainControl()));
      if (const char* why = contradiction_in(*what); why != nullptr) fail(why);
      return DomainControl{std::move(what)};
    }
    case fb::ServerBody::NodeAdapters:
      return NodeAdapters{node_number(m.body_as_NodeAdapters()->node()),
                          adapters(*m.body_as_NodeAdapters()->adapters())};
    case fb::ServerBody::Report:
      return Report{bytes(m.body_as_Report()->report())};
    case fb::ServerBody::NONE:
      break;
  }
  fail("a message of an unknown kind");
  return {};
}

/// What `read` reads; nothing where something in it was wrong.
template <typename Read>
auto unless_wrong(const Reader& reader, Read read, std::string* error) {
  std::optional value(read());
  if (reader.problem() == nullptr) return value;
  *error = reader.problem();
  value.reset();
  return value;
}

}  // namespace

std::optional<ClientMessage> parse_client_message(std::span<const std::byte> payload, std::string* error) {
  const auto* root = verified_root<fb::ClientMessage>(payload, kClientMessageId, error);
  if (root == nullptr) return std::nullopt;
  Reader reader(payload.size());
  return unless_wrong(
      reader, [&] { return reader.client_message(*root); }, error);
}

std::optional<ServerMessage> parse_server_message(std::span<const std::byte> payload, Token token,
                                                  std::string* error) {
  const auto* root = verified_root<fb::ServerMessage>(payload, kServerMessageId, error);
  if (root == nullptr) return std::nullopt;
  Reader reader(payload.size());
  return unless_wrong(
      reader, [&] { return reader.server_message(*root, token); }, error);
}

std::optional<Request> read_request(fb::Request kind, const void* table, std::size_t message_size,
                                    std::string* error) {
  Reader reader(message_size);
  return unless_wrong(
      reader, [&] { return reader.request(kind, table); }, error);
}

std::optional<Adapters> read_adapters(const FbAdapters& from, std::size_t message_size, std::string* error) {
  Reader reader(message_size);
  return unless_wrong(
      reader, [&] { return reader.adapters(from); }, error);
}

}  // namespace gs::wire::detail
