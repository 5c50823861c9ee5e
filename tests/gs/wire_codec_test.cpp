#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <random>

#include "gs/wire_equal.h"
#include "gs/wire_samples.h"
#include "support/wire_packets.h"
#include "wire/codec.h"
#include "wire/fb_codec.h"

namespace gs::wire {
namespace {

using testing::HasSubstr;
using testing::IsEmpty;

std::optional<ClientMessage> take(Assembler& a, std::string* error, const ClientMessage*) {
  return a.take_client_message(error);
}
std::optional<ServerMessage> take(Assembler& a, std::string* error, const ServerMessage*) {
  return a.take_server_message(error);
}

template <typename Message>
std::optional<Message> receive(const std::vector<Packet>& packets, std::string* error,
                               std::size_t limit = kMaxServerMessage) {
  Assembler assembler(limit);
  for (const Packet& packet : packets) {
    if (!assembler.add(packet, error)) return std::nullopt;
  }
  if (!assembler.complete()) {
    *error = "incomplete";
    return std::nullopt;
  }
  return take(assembler, error, static_cast<Message*>(nullptr));
}

template <typename Message>
void expect_round_trip(const Message& message) {
  std::string error;
  const auto back = receive<Message>(packets_of(message), &error);
  ASSERT_TRUE(back) << "kind " << message.index() << ": " << error;
  EXPECT_TRUE(same(message, *back)) << "kind " << message.index();
}

template <typename Message>
std::optional<Message> receive_built(const Message& message, std::string* error) {
  flatbuffers::FlatBufferBuilder builder;
  detail::build(builder, message);
  const auto payload = std::as_bytes(std::span(builder.GetBufferPointer(), builder.GetSize()));
  if constexpr (std::is_same_v<Message, ClientMessage>)
    return detail::parse_client_message(payload, error);
  else
    return detail::parse_server_message(payload, -1, error);
}

TEST(WireCodec, EveryMessage_ThereAndBack_IsTheSame) {
  for (const ClientMessage& message : samples::client_messages()) expect_round_trip(message);
  for (const ServerMessage& message : samples::server_messages()) expect_round_trip(message);
}

TEST(WireCodec, MessageOverOnePacket_IsSlicedIntoFullPacketsAndPutTogether) {
  const auto what = std::make_shared<const Notification>(samples::full_protocol(kMaxStateValue));
  const ServerMessage message = Notify{12, what};
  const auto packets = packets_of(message);
  ASSERT_EQ(packets.size(), 3u);
  EXPECT_EQ(packets[0].size(), kMaxPacket);
  EXPECT_EQ(packets[1].size(), kMaxPacket);
  expect_round_trip(message);
  expect_round_trip(ClientMessage(Call{VoteRequest{1, WYX_VOTE_APPROVE, Bytes(kMaxStateValue, 'a'),
                                                   Bytes(kMaxProviderMessage, 'b'), WYX_NULL_VOTE}}));
}

TEST(WireCodec, OneEncodedNotification_ServesReceiversWithTheirOwnTokens) {
  const auto what = std::make_shared<const Notification>(samples::full_protocol());
  const Encoded encoded = encode(Notify{-1, what});
  for (const Token token : {0, 5, 2'000'000'000}) {
    std::string error;
    const auto back = receive<ServerMessage>(packets_of(encoded, token), &error);
    ASSERT_TRUE(back) << error;
    EXPECT_EQ(std::get<Notify>(*back).token, token);
  }
}

TEST(WireCodec, RequestOverAnEngineLimit_StillPassesForTheEngineToAnswer) {
  JoinRequest join{1, samples::attributes(), 1, std::string(kMaxLocalName + 1, 'l')};
  join.attributes.group_name = std::string(kMaxGroupName + 1, 'g');
  expect_round_trip(ClientMessage(Call{join}));
  expect_round_trip(ClientMessage(Call{StateChangeRequest{1, {}, Bytes(kMaxStateValue + 1, 's')}}));
  expect_round_trip(ClientMessage(Call{ExpelRequest{1, {}, Membership(kMaxExpelList + 1), 0, ""}}));
}

TEST(WireCodec, RequestThatTheDaemonWouldRefuse_IsNamedAndNotEncoded) {
  auto join = [](auto change) {
    JoinRequest r{1, samples::attributes(), 1, "name"};
    change(r);
    return Request(r);
  };
  const Request bad[] = {
      join([](JoinRequest& r) { r.attributes.group_name = std::string(kMaxWireName + 1, 'g'); }),
      join([](JoinRequest& r) { r.local_name = std::string("a\0b", 3); }),
      join([](JoinRequest& r) { r.attributes.merge_control = static_cast<wyx_merge_ctrl_t>(7); }),
      VoteRequest{1, static_cast<wyx_vote_value_t>(4), {}, {}, WYX_NULL_VOTE},
      LeaveRequest{1, {static_cast<wyx_num_phases_t>(3), 0}, 0},
      MessageRequest{1, {}, Bytes(kMaxClientMessage, 'm')}};
  for (const Request& request : bad) {
    EXPECT_NE(problem_with(request), "") << "kind " << request.index();
    EXPECT_FALSE(encode(ClientMessage(Call{request})));
    std::string error;
    const auto forced = receive_built(ClientMessage(Call{request}), &error);
    const bool only_too_large = std::holds_alternative<MessageRequest>(request);
    EXPECT_EQ(forced.has_value(), only_too_large) << "kind " << request.index();
  }
  for (const Request& request : samples::requests()) EXPECT_EQ(problem_with(request), "");
}

TEST(WireCodec, NotificationWithValuesThatDoNotExist_IsMalformed) {
  std::vector<Notification> bad;
  auto protocol = [&bad](auto change) {
    ProtocolNotification n = samples::full_protocol();
    change(n);
    bad.push_back(n);
  };
  protocol([](auto& n) { n.type = WYX_MERGE_NOTIFICATION; });
  protocol([](auto& n) { n.protocol = static_cast<wyx_request_t>(12); });
  protocol([](auto& n) { n.summary = 0x80000; });
  protocol([](auto& n) { n.proposal.whats_changed = 0x40000; });
  protocol([](auto& n) { n.proposal.leave_codes.push_back({}); });
  protocol([](auto& n) { n.proposal.changing_providers = nullptr; });
  protocol([](auto& n) { n.proposal.current_vote_results[0].vote = static_cast<wyx_vote_value_t>(128); });
  bad.push_back(DelayedErrorNotification{WYX_JOIN, static_cast<wyx_rc_t>(38), GoodbyeRequest{}, nullptr});
  bad.push_back(SubscriptionNotification{0x400, nullptr, nullptr, nullptr, {}, 1});
  for (const Notification& n : bad) {
    std::string error;
    const ServerMessage message = Notify{-1, std::make_shared<const Notification>(n)};
    EXPECT_FALSE(receive_built(message, &error)) << "kind " << n.index();
    EXPECT_THAT(error, testing::Not(IsEmpty()));
  }
}

TEST(WireCodec, NotificationOverTheMessageLimit_IsNotEncoded) {
  ProtocolNotification n = samples::full_protocol();
  const VoteResult large{{1, 1}, WYX_VOTE_APPROVE, 0, 0, Bytes(kMaxStateValue, 's'), Bytes(kMaxStateValue, 'm')};
  n.proposal.current_vote_results.assign(kMaxServerMessage / (2 * kMaxStateValue), large);
  EXPECT_FALSE(encode(ServerMessage(Notify{1, std::make_shared<const Notification>(n)})));
}

TEST(WireCodec, MessageOfTheOtherDirection_IsMalformed) {
  std::string error;
  EXPECT_FALSE(receive<ClientMessage>(packets_of(ServerMessage(Farewell{})), &error));
  EXPECT_FALSE(receive<ServerMessage>(packets_of(ClientMessage(Quit{})), &error));
}

// ------------------------------------------------------------------------------------------------- packets

class WireAssembler : public testing::Test {
 protected:
  static std::vector<Packet> three_packets() {
    return packets_of(
        ServerMessage(Notify{12, std::make_shared<const Notification>(samples::full_protocol(kMaxStateValue))}));
  }
  std::string refusal(const Packet& packet) {
    std::string error;
    EXPECT_FALSE(assembler_.add(packet, &error));
    return error;
  }
  bool accepts(const Packet& packet) {
    std::string error;
    return assembler_.add(packet, &error);
  }

  Assembler assembler_{kMaxServerMessage};
};

TEST_F(WireAssembler, PacketsInTheWrongOrder_AreRefusedForGood) {
  const auto packets = three_packets();
  EXPECT_THAT(refusal(packets[1]), HasSubstr("out of order"));
  EXPECT_THAT(refusal(packets[0]), HasSubstr("after a malformed one"));
}

TEST_F(WireAssembler, NewMessageInsideAnother_IsRefused) {
  const auto packets = three_packets();
  ASSERT_TRUE(accepts(packets[0]));
  EXPECT_THAT(refusal(packets[0]), HasSubstr("out of order"));
}

TEST_F(WireAssembler, ContinuationWithAnotherToken_IsRefused) {
  auto packets = three_packets();
  ASSERT_TRUE(accepts(packets[0]));
  packets[1][8] ^= std::byte{1};
  EXPECT_THAT(refusal(packets[1]), HasSubstr("does not belong"));
}

TEST_F(WireAssembler, PacketAfterAWholeMessage_WaitsUntilItIsTaken) {
  const auto packets = packets_of(ServerMessage(Ping{1}));
  ASSERT_TRUE(accepts(packets[0]));
  ASSERT_TRUE(assembler_.complete());
  std::string error;
  ASSERT_TRUE(assembler_.take_server_message(&error));
  EXPECT_FALSE(assembler_.complete());
  ASSERT_TRUE(accepts(packets[0]));
  EXPECT_THAT(refusal(packets[0]), HasSubstr("waits to be taken"));
}

TEST_F(WireAssembler, MessageOverItsLimit_IsRefusedAtTheFirstPacket) {
  Assembler small(100 * 1024);
  std::string error;
  EXPECT_FALSE(small.add(three_packets()[0], &error));
  EXPECT_THAT(error, HasSubstr("over the limit"));
}

TEST_F(WireAssembler, TokenOnAMessageWithout_IsMalformed) {
  std::string error;
  EXPECT_FALSE(receive<ClientMessage>(packets_of(encode(ClientMessage(Quit{})), 3), &error));
  EXPECT_FALSE(receive<ServerMessage>(packets_of(encode(ServerMessage(Ping{})), 3), &error));
}

// Whatever happens to a packet on its way, it is either refused or gives some message; nothing else.
template <typename Message>
void damage(const std::vector<Message>& messages) {
  std::mt19937 random(20240607);
  for (const Message& message : messages) {
    const auto whole = packets_of(message);
    for (std::size_t length = 0; length < whole[0].size(); ++length) {
      std::string error;
      EXPECT_FALSE(receive<Message>({Packet(whole[0].begin(), whole[0].begin() + length)}, &error));
    }
    for (std::size_t bit = 0; bit < whole[0].size() * 8; ++bit) {
      auto flipped = whole;
      flipped[0][bit / 8] ^= std::byte(1u << (bit % 8));
      std::string error;
      receive<Message>(flipped, &error);
      flipped[0][random() % whole[0].size()] = std::byte(random());
      receive<Message>(flipped, &error);
    }
  }
}

TEST(WireDamage, EveryTruncationAndBitFlip_IsRefusedOrDecodedAndNeverCrashes) {
  damage(samples::client_messages());
  damage(samples::server_messages());
}

}  // namespace
}  // namespace gs::wire
