#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <random>

#include "gs/same.h"
#include "gs/wire_samples.h"
#include "support/wire_packets.h"
#include "wire/fb_codec.h"

namespace gs::wire {
namespace {

using testing::HasSubstr;

std::optional<ClientMessage> take(Assembler& a, std::string* error, const ClientMessage*) {
  return a.take_client_message(error);
}
std::optional<ServerMessage> take(Assembler& a, std::string* error, const ServerMessage*) {
  return a.take_server_message(error);
}

template <typename Message>
std::optional<Message> receive(const std::vector<Packet>& packets, std::string* error) {
  Assembler assembler(kMaxServerMessage);
  for (const Packet& packet : packets)
    if (!assembler.add(packet, error)) return std::nullopt;
  return take(assembler, error, static_cast<Message*>(nullptr));
}

template <typename Message>
void expect_round_trip(const Message& message) {
  std::string error;
  const auto back = receive<Message>(packets_of(message), &error);
  ASSERT_TRUE(back) << "kind " << message.index() << ": " << error;
  EXPECT_TRUE(same(message, *back)) << "kind " << message.index();
}

/// As a peer might write it that does not check what it says. Returns what is wrong with it; empty: nothing.
template <typename Message>
std::string problem_of_built(const Message& message) {
  flatbuffers::FlatBufferBuilder builder;
  detail::build(builder, message);
  const auto payload = std::as_bytes(std::span(builder.GetBufferPointer(), builder.GetSize()));
  std::string error;
  if constexpr (std::is_same_v<Message, ClientMessage>)
    return detail::parse_client_message(payload, &error) ? "" : error;
  else
    return detail::parse_server_message(payload, -1, &error) ? "" : error;
}

TEST(WireCodec, EveryMessage_ThereAndBack_IsTheSame) {
  for (const ClientMessage& message : samples::client_messages()) expect_round_trip(message);
  for (const ServerMessage& message : samples::server_messages()) expect_round_trip(message);
  for (const Request& request : samples::requests()) EXPECT_EQ(problem_with(request), nullptr);
}

TEST(WireCodec, LargeMessages_AreSlicedIntoFullPacketsAndPutTogether_AlsoOverTheEnginesLimits) {
  const auto what = std::make_shared<const Notification>(samples::full_protocol(kMaxStateValue));
  const auto packets = packets_of(ServerMessage(Notify{12, what}));
  ASSERT_EQ(packets.size(), 3u);
  EXPECT_EQ(packets[0].size(), kMaxPacket);
  EXPECT_EQ(packets[1].size(), kMaxPacket);
  expect_round_trip(ServerMessage(Notify{12, what}));

  JoinRequest join{1, samples::attributes(), 1, std::string(kMaxLocalName + 1, 'l')};
  join.attributes.group_name = std::string(kMaxGroupName + 1, 'g');
  const Bytes state(kMaxStateValue + 1, 'a'), message(kMaxProviderMessage, 'b');
  for (const Request& request : {Request(join), Request(StateChangeRequest{1, {}, state}),
                                 Request(VoteRequest{1, WYX_VOTE_APPROVE, state, message, WYX_NULL_VOTE}),
                                 Request(ExpelRequest{1, {}, Membership(kMaxExpelList + 1), 0, ""})})
    expect_round_trip(ClientMessage(Call{request}));
}

TEST(WireCodec, OneEncodedNotification_ServesReceiversWithTheirOwnTokens) {
  const Encoded encoded = encode(Notify{-1, std::make_shared<const Notification>(samples::full_protocol())});
  for (const Token token : {0, 5, 2'000'000'000}) {
    std::string error;
    const auto back = receive<ServerMessage>(packets_of(encoded, token), &error);
    ASSERT_TRUE(back) << error;
    EXPECT_EQ(std::get<Notify>(*back).token, token);
  }
}

TEST(WireCodec, RequestThatTheDaemonWouldRefuse_IsNamedAndNotEncoded) {
  JoinRequest long_name{1, samples::attributes(), 1, "name"}, with_nul = long_name, no_merge = long_name;
  long_name.attributes.group_name = std::string(kMaxWireName + 1, 'g');
  with_nul.local_name = std::string("a\0b", 3);
  no_merge.attributes.merge_control = static_cast<wyx_merge_ctrl_t>(7);
  const MessageRequest too_large{1, {}, Bytes(kMaxClientMessage, 'm')};
  const Request bad[] = {long_name,
                         with_nul,
                         no_merge,
                         VoteRequest{1, static_cast<wyx_vote_value_t>(4), {}, {}, WYX_NULL_VOTE},
                         LeaveRequest{1, {static_cast<wyx_num_phases_t>(3), 0}, 0},
                         too_large};
  for (const Request& request : bad) {
    EXPECT_NE(problem_with(request), nullptr) << "kind " << request.index();
    EXPECT_FALSE(encode(ClientMessage(Call{request})));
    const bool only_too_large = std::holds_alternative<MessageRequest>(request);
    EXPECT_EQ(problem_of_built(ClientMessage(Call{request})).empty(), only_too_large)
        << "kind " << request.index();
  }
}

TEST(WireCodec, NotificationThatCannotBe_IsMalformed_OneOverTheLimitNotEncoded) {
  using N = ProtocolNotification;
  const std::function<void(N&)> changes[] = {
      [](N& n) { n.type = WYX_MERGE_NOTIFICATION; },
      [](N& n) { n.protocol = static_cast<wyx_request_t>(12); },
      [](N& n) { n.summary = 0x80000; },
      [](N& n) { n.proposal.whats_changed = 0x40000; },
      [](N& n) { n.proposal.leave_codes = samples::list(std::vector<LeaveCode>(2)); },
      [](N& n) { n.proposal.changing_providers = nullptr; },
      [](N& n) { n.protocol = WYX_SUBSCRIPTION; },
      [](N& n) { n.proposal.phase = 0; },
      [](N& n) { n.proposal.current_providers = nullptr; },
      [](N& n) { n.proposal.expel_info.reset(); },
      [](N& n) { n.proposal.whats_changed |= WYX_MERGE_GROUP_INFO; },
      [](N& n) {
        n.proposal.current_vote_results =
            samples::list<VoteResult>({{{1, 2}, static_cast<wyx_vote_value_t>(128), 0, 0, nullptr, nullptr}});
      }};
  std::vector<Notification> bad = {
      DelayedErrorNotification{WYX_JOIN, static_cast<wyx_rc_t>(38), JoinRequest{}, nullptr},
      DelayedErrorNotification{WYX_JOIN, WYX_COLLIDE, VoteRequest{}, nullptr},
      DelayedErrorNotification{WYX_JOIN, WYX_OK, JoinRequest{}, nullptr},
      AnnouncementNotification{WYX_GROUP_DISSOLVED | WYX_RESPONSIVENESS_RESPONSE, nullptr},
      AnnouncementNotification{WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY, nullptr}};
  for (const int type :
       {0x400, +WYX_SUBSCRIPTION_GS_HAS_DIED, +WYX_SUBSCRIPTION_STATE, +WYX_SUBSCRIPTION_MEMBERSHIP,
        +WYX_SUBSCRIPTION_DELTA_JOIN, WYX_SUBSCRIPTION_DISSOLVED | WYX_SUBSCRIPTION_PERSISTENT})
    bad.push_back(SubscriptionNotification{static_cast<std::uint32_t>(type), nullptr, nullptr, nullptr, {}, 1});
  for (const auto& change : changes) change(std::get<N>(bad.emplace_back(samples::full_protocol())));
  for (std::size_t i = 0; i < bad.size(); ++i)
    EXPECT_NE(problem_of_built(ServerMessage(Notify{-1, std::make_shared<const Notification>(bad[i])})), "") << i;
  EXPECT_NE(problem_of_built(ServerMessage(Welcome{0x8000, 1, 1})), "");
  const DomainNotification bad_news[] = {
      NodesNotification{{{2, 1}, {1, 2}}, {}, {}},
      NodesNotification{{{0x8000, 1}}, {}, {}},
      NodesNotification{DomainNodes(kMaxHosts + 1), {}, {}},
      MasterNotification{{1, 1}, 0},
      QuorumNotification{1, static_cast<wyx_quorum_state_t>(3), WYX_QUORUM_STATE_HAS, 1},
      QuorumErrorNotification{1, WYX_OK}};
  for (const auto& news : bad_news)
    EXPECT_NE(problem_of_built(ServerMessage(DomainControl{std::make_shared<const DomainNotification>(news)})),
              "");
  for (const Adapters& bad_ones : {Adapters(kMaxAdapters + 1, samples::adapters()[0]), Adapters{{"", {}}},
                                   Adapters{{"sixteen-letters-", {}}}, Adapters{{std::string("a\0b", 3), {}}}})
    EXPECT_NE(problem_of_built(ServerMessage(NodeAdapters{1, bad_ones})), "");

  for (const auto& tokens : {std::vector<Token>{1}, std::vector<Token>{1, -1}, std::vector<Token>(kMaxFanout + 1)})
    EXPECT_NE(problem_of_built(ServerMessage(Fanout{tokens})), "") << tokens.size();

  N huge = samples::full_protocol();
  const auto value = std::make_shared<const Bytes>(kMaxStateValue, 'v');
  const VoteResult large{{1, 1}, WYX_VOTE_APPROVE, 0, 0, value, value};
  huge.proposal.current_vote_results =
      samples::list(std::vector<VoteResult>(kMaxServerMessage / (2 * kMaxStateValue), large));
  EXPECT_FALSE(encode(ServerMessage(Notify{1, std::make_shared<const Notification>(huge)})));
}

// --------------------------------------------------------------------------------------------------- packets

TEST(WireAssembler, PacketsThatDoNotFitTogether_AreRefusedForGood) {
  const auto large = packets_of(
      ServerMessage(Notify{12, std::make_shared<const Notification>(samples::full_protocol(kMaxStateValue))}));
  auto other_token = large[1], short_slice = large[0];
  other_token[8] ^= std::byte{1};
  short_slice.resize(large[0].size() / 2);
  const auto ping = packets_of(ServerMessage(Ping{1}))[0];
  const struct {
    std::vector<Packet> packets;  // the last one is refused
    const char* why;
    std::size_t limit = kMaxServerMessage;
  } cases[] = {{{large[1]}, "out of order"},
               {{large[0], large[0]}, "out of order"},
               {{large[0], other_token}, "does not belong"},
               {{short_slice}, "not what its header says"},
               {{ping, ping}, "waits to be taken"},
               {{large[0]}, "over the limit", 100 * 1024}};
  for (const auto& c : cases) {
    Assembler assembler(c.limit);
    std::string error;
    for (std::size_t i = 0; i + 1 < c.packets.size(); ++i)
      ASSERT_TRUE(assembler.add(c.packets[i], &error)) << c.why;
    EXPECT_FALSE(assembler.add(c.packets.back(), &error));
    EXPECT_THAT(error, HasSubstr(c.why));
    EXPECT_FALSE(assembler.add(ping, &error));
    EXPECT_THAT(error, HasSubstr("after a malformed one"));
  }
}

TEST(WireAssembler, MessageOfTheOtherDirectionOrWithATokenItMustNotHave_IsMalformed) {
  std::string error;
  EXPECT_FALSE(receive<ClientMessage>(packets_of(ServerMessage(Farewell{})), &error));
  EXPECT_FALSE(receive<ServerMessage>(packets_of(ClientMessage(Quit{})), &error));
  EXPECT_FALSE(receive<ClientMessage>(packets_of(encode(ClientMessage(Quit{})), 3), &error));
  EXPECT_FALSE(receive<ServerMessage>(packets_of(encode(ServerMessage(Ping{})), 3), &error));
}

// Whatever happens to a packet on its way, it is either refused or gives some message; nothing else.
template <typename Message>
void damage(const std::vector<Message>& messages) {
  std::mt19937 random(20240607);
  std::string error;
  for (const Message& message : messages) {
    const Packet whole = packets_of(message)[0];
    for (std::size_t length = 0; length < whole.size(); ++length)
      EXPECT_FALSE(receive<Message>({Packet(whole.begin(), whole.begin() + length)}, &error));
    for (std::size_t bit = 0; bit < whole.size() * 8; ++bit) {
      Packet flipped = whole;
      flipped[bit / 8] ^= std::byte(1u << (bit % 8));
      receive<Message>({flipped}, &error);
      flipped[random() % whole.size()] = std::byte(random());
      receive<Message>({flipped}, &error);
    }
  }
}

TEST(WireDamage, EveryTruncationAndBitFlip_IsRefusedOrDecodedAndNeverCrashes) {
  damage(samples::client_messages());
  damage(samples::server_messages());
}

}  // namespace
}  // namespace gs::wire
