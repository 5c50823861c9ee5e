#include <gtest/gtest.h>

#include <cstring>

#include "cluster/codec.h"
#include "cluster/datagram.h"
#include "gs/cluster_samples.h"

namespace gs::cluster {
namespace {

Message ordered(Event event) { return Ordered{1, 1, std::make_shared<const Event>(std::move(event))}; }

TEST(ClusterCodec, EveryMessage_ThereAndBack_IsTheSame_WhereverItLies) {
  for (const Message& message : samples::messages()) {
    auto bytes = encode(message);
    for (int offset = 0; offset < 2; ++offset) {
      std::string error;
      const auto back = decode(std::span(bytes).subspan(offset), &error);
      ASSERT_TRUE(back && same(message, *back)) << "kind " << message.index() << ": " << error;
      bytes.insert(bytes.begin(), std::byte{});
    }
  }
}

TEST(ClusterCodec, NodeThatCannotBe_IsRefusedInEveryPlace) {
  const Node good = samples::kNode, bad = good + 0x8000;
  for (const Message& message : samples::messages()) {
    auto bytes = encode(message);
    std::string error;
    for (std::size_t at = 0; at + sizeof good <= bytes.size(); ++at) {
      if (std::memcmp(&bytes[at], &good, sizeof good) != 0) continue;
      std::memcpy(&bytes[at], &bad, sizeof bad);
      EXPECT_FALSE(decode(bytes, &error)) << "kind " << message.index() << " at " << at;
      EXPECT_EQ(error, "a number that no node has");
      std::memcpy(&bytes[at], &good, sizeof good);
    }
  }
}

TEST(ClusterCodec, MessageOverALimit_IsNotEncoded_OneAtTheLimitIs) {
  const RingId ring{1, 1};
  const std::vector<Process> most(kMaxNodes, Process{1, 1}), over(kMaxNodes + 1, Process{1, 1});
  const std::string address(kMaxAddress, 'a');
  const Message at_limit[] = {
      Begin{{}, ring, most, {{1, kMaxVotes}}, 0, 0},
      Word{{}, 1, 1, {}, address, address},
      Piece{0, 1, std::vector<std::byte>(kMaxPiece)},
      Confirmed{{}, 1, std::vector<Node>(kMaxNodes, 1)},
      ordered(TimerExpiredEvent{{std::string(kMaxGroupName, 'g'), 1, 1}}),
      ordered(AdaptersEvent{1, Adapters(kMaxAdapters, {std::string(kMaxAdapterName, 'a'), {}})})};
  for (const Message& message : at_limit) {
    std::string error;
    EXPECT_TRUE(decode(encode(message), &error)) << "kind " << message.index() << ": " << error;
  }
  const VoteRequest no_vote{1, static_cast<wyx_vote_value_t>(4), {}, {}, WYX_NULL_VOTE};
  const Message refused[] = {Begin{{}, ring, over, {}, 0, 0},
                             Begin{{}, ring, {}, {}, 0, 0},
                             Begin{{}, ring, most, {{1, kMaxVotes + 1}}, 0, 0},
                             Word{{}, 1, 1, {}, "", "", 0, {{1, 0x2000}}},
                             Word{{}, 1, 1, {}, address + "a", ""},
                             Word{{}, 1, 1, {}, std::string("a\0b", 3), ""},
                             Word{{}, 1, 1, {}, "", address + "a"},
                             Piece{1, 1, {}},
                             Piece{0, 1, std::vector<std::byte>(kMaxPiece + 1)},
                             Confirmed{{}, 1, std::vector<Node>(kMaxNodes + 1, 1)},
                             Ordered{},
                             ordered(NumbersEvent{1}),
                             ordered(HostGoneEvent{1}),
                             ordered(AdaptersEvent{1, Adapters(kMaxAdapters + 1, {"a", {}})}),
                             ordered(AdaptersEvent{1, {{std::string(kMaxAdapterName + 1, 'a'), {}}}}),
                             ordered(TimerExpiredEvent{{std::string(kMaxGroupName + 1, 'g'), 1, 1}}),
                             ordered(RequestEvent{{1, 1}, no_vote, true, 0})};
  for (const Message& message : refused) EXPECT_TRUE(encode(message).empty()) << "number " << &message - refused;
}

TEST(ClusterDatagram, WhatAHostHasSealed_OpensWithItsKey_AndNothingElseDoes) {
  const std::string key = new_key(), other = new_key();
  const auto key_of_node = [&](Node node) { return node == 7 ? &key : node == 8 ? &other : nullptr; };
  const Confirmed confirmed{samples::kBegin, 0x100000002, {}};
  auto bytes = seal(confirmed, 7, key);
  const auto back = open(bytes, key_of_node);
  ASSERT_TRUE(back && back->first == 7);
  EXPECT_TRUE(same(confirmed, back->second));

  EXPECT_FALSE(open(seal(confirmed, 8, key), key_of_node)) << "another's key";
  EXPECT_FALSE(open(seal(confirmed, 9, key), key_of_node)) << "a node that has none";
  for (std::size_t bit = 0; bit < bytes.size() * 8; ++bit) {
    bytes[bit / 8] ^= std::byte(1u << (bit % 8));
    EXPECT_FALSE(open(bytes, key_of_node)) << "bit " << bit;
    bytes[bit / 8] ^= std::byte(1u << (bit % 8));
  }
  for (std::size_t length = 0; length < bytes.size(); ++length)
    EXPECT_FALSE(open(std::span(bytes).first(length), key_of_node)) << length;
  EXPECT_TRUE(seal(confirmed, 7, "short").empty());
  EXPECT_TRUE(seal({samples::kBegin, 1, {2}}, 7, key).empty()) << "who asks does so in the order";
}

}  // namespace
}  // namespace gs::cluster
