#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>

#include "common/access.h"
#include "daemon/session_layer.h"
#include "gs/daemon_memory.h"

namespace gs::daemon {
namespace {

using namespace std::chrono_literals;

class DaemonSession : public testing::Test {
 protected:
  /// The survivors' last approved notification says that `gone` failed.
  static void expect_failure_leave(MemoryClient& survivor, ProviderId gone) {
    const auto last = survivor.last_of<ProtocolNotification>();
    ASSERT_TRUE(last);
    const auto& n = std::get<ProtocolNotification>(*last);
    EXPECT_EQ(n.type, WYX_APPROVED_NOTIFICATION);
    EXPECT_EQ(n.protocol, WYX_FAILURE_LEAVE);
    EXPECT_THAT(*n.proposal.changing_providers, testing::ElementsAre(gone));
  }

  MemoryDaemon daemon_;
};

// ------------------------------------------------------------------------------------------------ the handshake

TEST_F(DaemonSession, HelloOfAnotherProtocolVersion_IsToldSoAndClosed) {
  const ConnectionId id = daemon_.open();
  daemon_.say(id, wire::Hello{wire::kProtocolVersion + 1, 0, 0, "future"});
  EXPECT_EQ(std::get<wire::Answer>(daemon_.transport.take(id).at(0)).rc, WYX_NOT_SUPPORTED);
  EXPECT_TRUE(daemon_.closed(id));
}

TEST_F(DaemonSession, AttachThatIsNotItsOwn_IsClosedAndTheSessionLivesOn) {
  const ConnectionId request = daemon_.open(1000);
  daemon_.say(request, wire::Hello{wire::kProtocolVersion, 0, 0, "a"});
  const auto welcome = std::get<wire::Welcome>(daemon_.transport.take(request).at(0));
  const ConnectionId guess = daemon_.open(1000);
  daemon_.say(guess, wire::Attach{welcome.session_number, welcome.cookie + 1});
  const ConnectionId other_user = daemon_.open(1001);
  daemon_.say(other_user, wire::Attach{welcome.session_number, welcome.cookie});
  const ConnectionId own = daemon_.open(1000);
  daemon_.say(own, wire::Attach{welcome.session_number, welcome.cookie});
  const ConnectionId second = daemon_.open(1000);
  daemon_.say(second, wire::Attach{welcome.session_number, welcome.cookie});
  EXPECT_TRUE(daemon_.closed(guess));
  EXPECT_TRUE(daemon_.closed(other_user));
  EXPECT_TRUE(daemon_.closed(second));
  EXPECT_FALSE(daemon_.closed(own));
  EXPECT_FALSE(daemon_.closed(request));
}

TEST_F(DaemonSession, ConnectionsThatDoNotFinishTheHandshake_AreClosedAfterItsLimit) {
  const ConnectionId silent = daemon_.open();
  const ConnectionId unattached = daemon_.open();
  daemon_.say(unattached, wire::Hello{wire::kProtocolVersion, 0, 0, "a"});
  MemoryClient complete(daemon_);
  daemon_.pass(9'999ms);
  EXPECT_FALSE(daemon_.closed(silent));
  EXPECT_FALSE(daemon_.closed(unattached));
  daemon_.pass(1ms);
  EXPECT_TRUE(daemon_.closed(silent));
  EXPECT_TRUE(daemon_.closed(unattached));
  daemon_.pass(3'600'000ms);
  EXPECT_FALSE(complete.closed());
}

// ------------------------------------------------------------------------------------------------- bad messages

TEST_F(DaemonSession, EveryMessageOutOfOrder_ClosesItsClientAndNobodyElse) {
  MemoryClient bystander(daemon_);
  ASSERT_EQ(bystander.join(1, 1), WYX_OK);
  const std::vector<wire::ClientMessage> not_first = {wire::Call{GoodbyeRequest{1}}, wire::SetResponsiveness{},
                                                      wire::PingAnswer{}, wire::Quit{}};
  for (const auto& message : not_first) {
    const ConnectionId id = daemon_.open();
    daemon_.say(id, message);
    EXPECT_TRUE(daemon_.closed(id)) << "kind " << message.index();
  }
  for (const wire::ClientMessage& message :
       {wire::ClientMessage(wire::Hello{}), wire::ClientMessage(wire::Attach{}),
        wire::ClientMessage(wire::PingAnswer{})}) {
    MemoryClient client(daemon_);
    daemon_.say(client.request, message);
    EXPECT_TRUE(client.closed()) << "kind " << message.index();
  }
  for (const wire::ClientMessage& message :
       {wire::ClientMessage(wire::Hello{}), wire::ClientMessage(wire::Attach{}), wire::ClientMessage(wire::Quit{}),
        wire::ClientMessage(wire::QueryNode{}), wire::ClientMessage(wire::Call{GoodbyeRequest{1}})}) {
    MemoryClient client(daemon_);
    daemon_.say(client.event, message);
    EXPECT_TRUE(client.closed()) << "kind " << message.index();
  }
  const ConnectionId unattached = daemon_.open();
  daemon_.say(unattached, wire::Hello{wire::kProtocolVersion, 0, 0, "a"});
  daemon_.say(unattached, wire::Call{SubscribeRequest{1, WYX_SUBSCRIBE_STATE, "group"}});
  EXPECT_TRUE(daemon_.closed(unattached)) << "a request before its event channel";
  EXPECT_TRUE(daemon_.logged("closed: out of order"));
  EXPECT_FALSE(bystander.closed());
  EXPECT_EQ(daemon_.layer.sessions(), 1u);
}

TEST_F(DaemonSession, TextWithControlCharacters_CannotForgeLogLines) {
  MemoryClient client(daemon_);
  ASSERT_EQ(client.join(1, 1), WYX_OK);
  ASSERT_EQ(client.ask(wire::Call{MessageRequest{1, {WYX_1_PHASE, 0}, "x\n2026 info forged"}}), WYX_OK);
  EXPECT_TRUE(daemon_.logged("msg 'x?2026 info forged', #2"));
  const ConnectionId id = daemon_.open();
  daemon_.say(id, wire::Hello{wire::kProtocolVersion, 0, 0, "x\n2026 info forged"});
  daemon_.layer.lost(id, "gone");
  EXPECT_TRUE(daemon_.logged("(\"x?2026 info forged\", pid 4711, uid 1000)"));
}

// -------------------------------------------------------------------------------------------------- how it ends

TEST_F(DaemonSession, EveryEnd_FailsItsProvidersForTheSurvivors) {
  MemoryClient survivor(daemon_);
  ASSERT_EQ(survivor.join(1, 1), WYX_OK);
  const std::vector<std::function<void(MemoryClient&)>> ends = {
      [&](MemoryClient& c) { daemon_.layer.lost(c.request, "end of file"); },
      [&](MemoryClient& c) { daemon_.layer.lost(c.event, "end of file"); },
      [&](MemoryClient& c) { EXPECT_EQ(c.ask(wire::Quit{}), WYX_OK); },
      [&](MemoryClient& c) { daemon_.layer.received(c.request, wire::Packet(100, std::byte{0x55})); },
      [&](MemoryClient& c) {  // found gone while a notification is sent
        c.event_wire().gone = true;
        EXPECT_EQ(survivor.call(MessageRequest{1, {}, "to all"}), WYX_OK);
      }};
  std::int16_t instance = 2;
  for (const auto& end : ends) {
    MemoryClient dying(daemon_);
    ASSERT_EQ(dying.join(1, instance), WYX_OK);
    end(dying);
    EXPECT_TRUE(dying.closed()) << instance;
    expect_failure_leave(survivor, {instance++, 1});
  }
}

TEST_F(DaemonSession, Farewell_IsTheLastThingAClientIsSent) {
  MemoryClient a(daemon_);
  MemoryClient b(daemon_);
  ASSERT_EQ(a.join(1, 1), WYX_OK);
  ASSERT_EQ(b.join(1, 2), WYX_OK);
  a.event_wire().full = true;
  ASSERT_EQ(b.call(MessageRequest{1, {}, "before"}), WYX_OK);
  daemon_.layer.say_farewell();
  EXPECT_FALSE(daemon_.layer.drained());
  daemon_.layer.lost(b.request, "gone");
  a.event_wire().full = false;
  daemon_.layer.writable(a.event);
  EXPECT_TRUE(daemon_.layer.drained());
  const auto events = a.events();
  ASSERT_GE(events.size(), 2u);
  EXPECT_TRUE(std::holds_alternative<wire::Farewell>(events.back()));
  EXPECT_TRUE(std::holds_alternative<wire::Notify>(events[events.size() - 2]));
}

// --------------------------------------------------------------------------------------------------- slow clients

TEST_F(DaemonSession, ClientThatStalls_GetsEverythingInOrderOnceItTakesAgain) {
  MemoryClient sender(daemon_);
  MemoryClient slow(daemon_);
  ASSERT_EQ(sender.join(1, 1), WYX_OK);
  ASSERT_EQ(slow.join(1, 2), WYX_OK);
  slow.events();
  slow.event_wire().full = true;
  for (char c = 'a'; c <= 'e'; ++c) ASSERT_EQ(sender.call(MessageRequest{1, {}, Bytes(60'000, c)}), WYX_OK);
  EXPECT_EQ(sender.events().size(), 7u) << "two joins and five messages, the stalled client notwithstanding";
  EXPECT_TRUE(slow.event_wire().wants_writable);
  slow.event_wire().full = false;
  daemon_.layer.writable(slow.event);
  std::string seen;
  for (const auto& event : slow.events()) {
    seen += std::get<ProtocolNotification>(*std::get<wire::Notify>(event).what).proposal.message->at(0);
  }
  EXPECT_EQ(seen, "abcde");
}

TEST_F(DaemonSession, ClientOverItsQueueBound_IsClosedAndItsProvidersFail) {
  MemoryClient sender(daemon_);
  MemoryClient slow(daemon_);
  ASSERT_EQ(sender.join(1, 1), WYX_OK);
  ASSERT_EQ(slow.join(1, 2), WYX_OK);
  slow.event_wire().full = true;
  int sent = 0;
  while (!slow.closed() && sent < 1000) {
    ASSERT_EQ(sender.call(MessageRequest{1, {}, Bytes(60'000, 'm')}), WYX_OK);
    ++sent;
  }
  EXPECT_EQ(sent, (1 << 20) / 60'500 + 1) << "as many as the bound holds, and the one too many";
  EXPECT_TRUE(daemon_.logged("does not drain its notifications"));
  expect_failure_leave(sender, {2, 1});
}

TEST(DaemonQueue, OneMessageOverTheBound_PassesWhenNothingElseWaits) {
  OutQueue queue;
  const auto large = wire::encode(wire::ServerMessage(wire::Notify{
      1, std::make_shared<const Notification>(SubscriptionNotification{
             WYX_SUBSCRIPTION_STATE, std::make_shared<const Bytes>(100'000, 's'), nullptr, nullptr, {}, 1})}));
  EXPECT_TRUE(queue.push(large, 1, 1000));
  EXPECT_FALSE(queue.push(large, 1, 1000));
}

// ------------------------------------------------------------------------------------------------------- pings

class DaemonPings : public DaemonSession {
 protected:
  static constexpr wire::SetResponsiveness kEveryTenLimitThree{WYX_PING_RESPONSIVENESS, 10, 3};

  std::vector<std::uint64_t> pings() {
    std::vector<std::uint64_t> numbers;
    for (const auto& event : client_.events()) {
      if (const auto* ping = std::get_if<wire::Ping>(&event)) numbers.push_back(ping->number);
    }
    return numbers;
  }
  /// The summary of the announcement that the other member has had since the last look; 0: none.
  std::uint32_t announced() {
    const auto last = other_.last_of<AnnouncementNotification>();
    return last ? std::get<AnnouncementNotification>(*last).summary : 0;
  }
  void SetUp() override {
    ASSERT_EQ(client_.join(1, 1), WYX_OK);
    ASSERT_EQ(other_.join(1, 2), WYX_OK);
  }

  MemoryClient client_{daemon_};
  MemoryClient other_{daemon_};
};

TEST_F(DaemonPings, AnsweredPings_GoOnByTheIntervalAndAnnounceNothing) {
  ASSERT_EQ(client_.ask(kEveryTenLimitThree), WYX_OK);
  for (std::uint64_t n = 1; n <= 3; ++n) {
    daemon_.pass(10s);
    EXPECT_THAT(pings(), testing::ElementsAre(n));
    daemon_.say(client_.event, wire::PingAnswer{n, true});
  }
  EXPECT_EQ(announced(), 0u);
}

TEST_F(DaemonPings, NoAnswerInTime_IsAnnouncedOnceAndAgainWhenTheAnswerComes) {
  ASSERT_EQ(client_.ask(kEveryTenLimitThree), WYX_OK);
  daemon_.pass(12'999ms);
  EXPECT_EQ(announced(), 0u);
  daemon_.pass(1ms);
  EXPECT_EQ(announced(), WYX_RESPONSIVENESS_NO_RESPONSE);
  daemon_.pass(60s);
  EXPECT_EQ(announced(), 0u);
  EXPECT_EQ(pings().size(), 1u) << "a client that does not answer is not flooded";
  daemon_.say(client_.event, wire::PingAnswer{1, true});
  EXPECT_EQ(announced(), WYX_RESPONSIVENESS_RESPONSE);
  EXPECT_FALSE(client_.closed());
}

TEST_F(DaemonPings, ClientThatAskedToBeClosedWhenSlow_IsAnnouncedAndClosed) {
  ASSERT_EQ(client_.ask(wire::SetResponsiveness{WYX_PING_RESPONSIVENESS | WYX_CLOSE_CLIENT_SOCKET, 1, 1}), WYX_OK);
  other_.events();
  daemon_.pass(2s);
  EXPECT_TRUE(client_.closed());
  const auto events = other_.events();
  ASSERT_EQ(events.size(), 2u);
  const auto first = std::get<wire::Notify>(events[0]).what, second = std::get<wire::Notify>(events[1]).what;
  EXPECT_EQ(std::get<AnnouncementNotification>(*first).summary, WYX_RESPONSIVENESS_NO_RESPONSE);
  EXPECT_EQ(std::get<ProtocolNotification>(*second).protocol, WYX_FAILURE_LEAVE);
}

TEST_F(DaemonPings, SettingsThatCannotBe_AreRefusedAndChangeNothing) {
  ASSERT_EQ(client_.ask(kEveryTenLimitThree), WYX_OK);
  EXPECT_EQ(client_.ask(wire::SetResponsiveness{WYX_PING_RESPONSIVENESS, 0, 3}), WYX_BAD_PARAMETER);
  EXPECT_EQ(client_.ask(wire::SetResponsiveness{0x40000000, 1, 1}), WYX_BAD_PARAMETER);
  EXPECT_EQ(client_.ask(wire::SetResponsiveness{WYX_COUNTER_RESPONSIVENESS, 1, 1}), WYX_NOT_SUPPORTED);
  daemon_.pass(10s);
  EXPECT_EQ(pings().size(), 1u);
}

TEST_F(DaemonPings, SwitchedOff_StopsPingsAndTakesBackTheAnnouncement) {
  ASSERT_EQ(client_.ask(kEveryTenLimitThree), WYX_OK);
  daemon_.pass(13s);
  EXPECT_EQ(announced(), WYX_RESPONSIVENESS_NO_RESPONSE);
  ASSERT_EQ(client_.ask(wire::SetResponsiveness{}), WYX_OK);
  EXPECT_EQ(announced(), WYX_RESPONSIVENESS_RESPONSE);
  pings();
  daemon_.pass(100s);
  EXPECT_THAT(pings(), testing::IsEmpty());
}

// ------------------------------------------------------------------------------------------------- engine timers

TEST_F(DaemonSession, GroupsThatAreGoneLongBeforeTheirTimeLimit_LeaveNoTimersBehind) {
  MemoryClient client(daemon_);
  JoinRequest join;
  join.token = 1;
  join.attributes.num_phases = WYX_N_PHASE;
  join.attributes.time_limit = 60000;
  for (int i = 0; i < 1000; ++i) {
    join.attributes.group_name = "group " + std::to_string(i);
    ASSERT_EQ(client.call(join), WYX_OK);
    ASSERT_EQ(client.call(GoodbyeRequest{1}), WYX_OK);
  }
  EXPECT_LT(daemon_.layer.phase_timers(), 100u);
}

// ------------------------------------------------------------------------------------------------------- access

TEST(DaemonAccess, OwnerRootAndGroupMembers_AreAllowedAndNobodyElse) {
  const platform::AccessRule owner_only{1000, std::nullopt};
  const platform::AccessRule with_group{1000, 50};
  EXPECT_TRUE(owner_only.allows({1, 1000, 1, {}}));
  EXPECT_TRUE(owner_only.allows({1, 0, 0, {}}));
  EXPECT_FALSE(owner_only.allows({1, 1001, 50, {50}}));
  EXPECT_TRUE(with_group.allows({1, 1001, 50, {}}));
  EXPECT_TRUE(with_group.allows({1, 1001, 1, {2, 50}}));
  EXPECT_FALSE(with_group.allows({1, 1001, 1, {2, 51}}));
}

}  // namespace
}  // namespace gs::daemon
