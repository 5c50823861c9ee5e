#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>

#include "common/access.h"
#include "gs/daemon_memory.h"
#include "gs/engine_text.h"
#include "gs/wire_samples.h"
#include "tests/support/allocations.h"

namespace gs::daemon {
namespace {

using namespace std::chrono_literals;
using testing::ElementsAre;
using testing::IsEmpty;

class DaemonSession : public testing::Test {
 protected:
  /// What a client has been sent since the last look, a line each; pings and the farewell by name.
  static std::vector<std::string> told(MemoryClient& client) {
    std::vector<std::string> lines;
    for (const auto& event : client.events()) {
      if (const auto* notify = std::get_if<wire::Notify>(&event)) lines.push_back(test::brief(*notify->what));
      if (const auto* ping = std::get_if<wire::Ping>(&event))
        lines.push_back("ping " + std::to_string(ping->number));
      if (std::holds_alternative<wire::Farewell>(event)) lines.emplace_back("farewell");
    }
    return lines;
  }
  /// A connection that has said Hello.
  std::pair<ConnectionId, wire::Welcome> greeted() {
    const ConnectionId id = daemon_.open(1000);
    daemon_.say(id, wire::Hello{wire::kProtocolVersion, 0, 0, "a"});
    return {id, std::get<wire::Welcome>(daemon_.transport.take(id).at(0))};
  }

  MemoryDaemon daemon_;
};

// ------------------------------------------------------------------------------------- handshake, bad messages

TEST_F(DaemonSession, HelloOfAnotherProtocolVersion_IsToldSoAndClosed) {
  const ConnectionId id = daemon_.open();
  daemon_.say(id, wire::Hello{wire::kProtocolVersion + 1, 0, 0, "future"});
  EXPECT_EQ(std::get<wire::Answer>(daemon_.transport.take(id).at(0)).rc, WYX_NOT_SUPPORTED);
  EXPECT_TRUE(daemon_.closed(id));
}

TEST_F(DaemonSession, AttachThatIsNotItsOwn_IsClosedAndTheSessionLivesOn) {
  const auto [request, welcome] = greeted();
  const struct {
    std::uint32_t uid;
    int pid;
    std::uint64_t cookie;
    bool closed;
    const char* what;
  } attempts[] = {{1000, 4711, welcome.cookie + 1, true, "a guess"},
                  {1001, 4711, welcome.cookie, true, "another user"},
                  {1000, 4712, welcome.cookie, true, "another process"},
                  {1000, 4711, welcome.cookie, false, "its own"},
                  {1000, 4711, welcome.cookie, true, "a second one"}};
  for (const auto& attempt : attempts) {
    const ConnectionId id = daemon_.open(attempt.uid, attempt.pid);
    daemon_.say(id, wire::Attach{welcome.session_number, attempt.cookie});
    EXPECT_EQ(daemon_.closed(id), attempt.closed) << attempt.what;
  }
  EXPECT_FALSE(daemon_.closed(request));
}

TEST_F(DaemonSession, ConnectionsThatDoNotFinishTheHandshake_AreClosedAfterItsLimit) {
  const ConnectionId silent = daemon_.open();
  const ConnectionId unattached = greeted().first;
  MemoryClient complete(daemon_);
  daemon_.pass(9'999ms);
  EXPECT_FALSE(daemon_.closed(silent) || daemon_.closed(unattached));
  daemon_.pass(1ms);
  EXPECT_TRUE(daemon_.closed(silent) && daemon_.closed(unattached));
  daemon_.pass(3'600'000ms);
  EXPECT_FALSE(complete.closed());
}

TEST_F(DaemonSession, EveryMessageOutOfOrder_ClosesItsClientAndNobodyElse) {
  MemoryClient bystander(daemon_);
  ASSERT_EQ(bystander.join(1, 1), WYX_OK);
  const wire::ClientMessage hello = wire::Hello{}, attach = wire::Attach{}, pong = wire::PingAnswer{},
                            quit = wire::Quit{}, node = wire::QueryNode{}, settings = wire::SetResponsiveness{},
                            call = wire::Call{GoodbyeRequest{1}}, quorum = wire::QuorumAnswer{1},
                            adapters = wire::QueryAdapters{}, inspect = wire::Inspect{"\x01no question"};
  for (const auto& message : {call, settings, pong, quit, attach, quorum, inspect}) {
    const ConnectionId id = daemon_.open();
    daemon_.say(id, message);
    EXPECT_TRUE(daemon_.closed(id)) << "first, kind " << message.index();
  }
  for (const auto& message : {hello, attach, pong, inspect}) {
    MemoryClient client(daemon_);
    daemon_.say(client.request, message);
    EXPECT_TRUE(client.closed()) << "request channel, kind " << message.index();
  }
  for (const auto& message : {hello, attach, quit, node, call, settings, quorum, adapters}) {
    MemoryClient client(daemon_);
    daemon_.say(client.event, message);
    EXPECT_TRUE(client.closed()) << "event channel, kind " << message.index();
  }
  const ConnectionId unattached = greeted().first;
  daemon_.say(unattached, wire::Call{SubscribeRequest{1, WYX_SUBSCRIBE_STATE, "group"}});
  EXPECT_TRUE(daemon_.closed(unattached)) << "a request before its event channel";
  EXPECT_TRUE(daemon_.logged("closed: out of order"));
  EXPECT_FALSE(bystander.closed());
  EXPECT_EQ(daemon_.layer.sessions(), 1u);
}

TEST_F(DaemonSession, HostsThatComeAndGo_AreToldInOrderToWhoAsked_AndTheirAdaptersAreKnown) {
  MemoryClient listener(daemon_, 1000, WYX_ENABLE_DOMAIN_EVENT),
      quorum(daemon_, 1000, WYX_ENABLE_OPQUORUM_CALLBACK);
  EXPECT_EQ(listener.greeting.size(), 3u);
  EXPECT_EQ(quorum.greeting.size(), 2u);
  ASSERT_EQ(listener.join(1, 1), WYX_OK);
  RequestEvent join{{0, 1}, JoinRequest{1, {}, 1, "p"}};
  std::get<JoinRequest>(join.request).attributes.group_name = "group";
  listener.events();
  daemon_.ordering.submit(HostCameEvent{0});
  daemon_.ordering.submit(AdaptersEvent{0, wire::samples::adapters()});
  daemon_.ordering.submit(join);
  const auto ask = [&](const wire::QueryAdapters& query) {
    daemon_.say(quorum.request, query);
    return std::get<wire::NodeAdapters>(daemon_.transport.take(quorum.request).at(0));
  };
  const Adapters known = wire::samples::adapters();
  EXPECT_EQ(ask({0, {}}).adapters, known);
  EXPECT_EQ(ask({7, known[1].address}).adapters, Adapters{known[1]});
  const ConnectionId stranger = daemon_.open();
  daemon_.say(stranger, wire::QueryNode{});
  EXPECT_EQ(std::get<wire::NodeInfo>(daemon_.transport.take(stranger).at(0)).domain_master_node, 0u);

  daemon_.ordering.submit(HostGoneEvent{0});
  EXPECT_EQ(ask({0, {}}).adapters, Adapters());
  EXPECT_EQ(ask({0, known[1].address}).adapters, Adapters());
  std::string told;
  for (const auto& message : listener.events()) {
    const auto* news = std::get_if<wire::DomainControl>(&message);
    if (news == nullptr)
      told += "group ";
    else if (const auto* nodes = std::get_if<NodesNotification>(news->what.get()))
      told += "nodes:" + std::to_string(nodes->current.size()) + " ";
    else
      told += "master:" + std::to_string(std::get<MasterNotification>(*news->what).master.number) + " ";
  }
  EXPECT_EQ(told, "nodes:2 master:0 group nodes:1 master:1 group ") << "the failure comes behind its reason";
  EXPECT_TRUE(quorum.events().empty());
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
  for (const auto& end : ends) {
    MemoryClient dying(daemon_);
    ASSERT_EQ(dying.join(1, 2), WYX_OK);
    end(dying);
    EXPECT_TRUE(dying.closed());
    EXPECT_EQ(told(survivor).back(), "approved failure by 2 <approve>, members 1, changing 2(died)");
  }
}

TEST_F(DaemonSession, ClientThatStalls_GetsEverythingInOrderOnceItTakesAgain_TheFarewellLast) {
  MemoryClient sender(daemon_), slow(daemon_);
  ASSERT_EQ(sender.join(1, 1), WYX_OK);
  ASSERT_EQ(slow.join(1, 2), WYX_OK);
  told(slow);
  slow.event_wire().full = true;
  for (char c = 'a'; c <= 'e'; ++c) ASSERT_EQ(sender.call(MessageRequest{1, {}, Bytes(60'000, c)}), WYX_OK);
  EXPECT_EQ(told(sender).size(), 7u) << "two joins and five messages, the stalled client notwithstanding";
  EXPECT_TRUE(slow.event_wire().wants_writable);
  daemon_.layer.say_farewell();
  EXPECT_THAT(told(sender), ElementsAre("farewell"));
  EXPECT_FALSE(daemon_.layer.drained());
  daemon_.layer.lost(sender.request, "gone");
  slow.read_again();
  EXPECT_TRUE(daemon_.layer.drained());
  std::string order;
  for (const std::string& line : told(slow))
    order += line == "farewell" ? line : line.substr(line.find("msg '") + 5, 1);
  EXPECT_EQ(order, "abcdefarewell");
}

// --------------------------------------------------------------------------------------------- bounds and limits

/// Messages of 64 KiB into a group that only this client is in.
void talk_to_itself(MemoryClient& client, const std::string& group, int messages) {
  ASSERT_EQ(client.join(1, static_cast<std::int16_t>(client.event), group), WYX_OK);
  for (int i = 0; i < messages; ++i) {
    ASSERT_EQ(client.call(MessageRequest{1, {}, Bytes(1024 * 64, 'm')}), WYX_OK);
  }
}

TEST_F(DaemonSession, ClientOverTheQueueBound_IsClosedOnlyIfItIsStillOverItAfterTheDrainTime) {
  MemoryClient client(daemon_), idle(daemon_);
  client.event_wire().full = true;
  talk_to_itself(client, "a", 32);
  daemon_.pass(9'999ms);
  client.read_again(20);
  EXPECT_THAT(client.events().size(), testing::Le(24u)) << "a turn is bounded";
  client.event_wire().full = true;
  daemon_.pass(3600s);
  EXPECT_FALSE(client.closed()) << "under the bound it may wait for ever";

  ASSERT_EQ(client.call(GoodbyeRequest{1}), WYX_OK);
  talk_to_itself(client, "b", 16);
  daemon_.pass(9'999ms);
  EXPECT_FALSE(client.closed());
  daemon_.pass(1ms);
  EXPECT_TRUE(client.closed() && daemon_.logged("does not drain its notifications"));
  EXPECT_FALSE(idle.closed());
}

TEST(DaemonBounds, UserOrAllOverTheirBound_LoseWhoHoldsTheMost_RootAndOtherUsersLoseNobody) {
  ClientLimits limits;
  limits.user_queue_bound = 4 << 20;
  MemoryDaemon daemon({1 << 20}, limits);
  MemoryClient root(daemon, 0), other(daemon, 1), modest(daemon, 2), greedy(daemon, 2);
  for (MemoryClient* client : {&root, &other, &modest, &greedy}) client->event_wire().full = true;
  talk_to_itself(root, "root", 80);
  talk_to_itself(other, "other", 48);
  talk_to_itself(modest, "modest", 16);
  ASSERT_EQ(greedy.join(1, 1, "greedy"), WYX_OK);
  for (int i = 0; i < 70; ++i) greedy.call(MessageRequest{1, {}, Bytes(60'000, 'm')});
  EXPECT_FALSE(greedy.closed()) << "it may be about to read";
  daemon.pass(1s);
  greedy.call(MessageRequest{1, {}, "one more"});
  EXPECT_TRUE(greedy.closed() && daemon.logged("its user is over user-queue-bound and it reads nothing"));

  limits.total_queue_bound = 8 << 20;
  MemoryDaemon full({1 << 20}, limits);
  MemoryClient served(full, 0), most(full, 3), less(full, 4), last(full, 5);
  for (MemoryClient* client : {&served, &most, &less, &last}) client->event_wire().full = true;
  talk_to_itself(served, "root", 8);
  talk_to_itself(most, "most", 48);
  talk_to_itself(less, "less", 32);
  full.pass(1s);
  talk_to_itself(last, "last", 32);
  EXPECT_TRUE(most.closed() && full.logged("all are over total-queue-bound"));
  EXPECT_FALSE(root.closed() || other.closed() || modest.closed());
  EXPECT_FALSE(served.closed() || less.closed() || last.closed());
}

class DaemonBurst : public testing::Test {
 protected:
  static ClientLimits bounds() {
    ClientLimits limits;
    limits.user_queue_bound = 3 << 20;
    return limits;
  }
  void SetUp() override {
    ASSERT_EQ(sender_.join(1, 1), WYX_OK);
    for (std::int16_t i = 2; i < 7; ++i) {
      readers_.push_back(std::make_unique<MemoryClient>(daemon_));
      ASSERT_EQ(readers_.back()->join(1, i), WYX_OK);
      readers_.back()->event_wire().full = true;
    }
  }
  long closed_after(int messages) {
    for (int i = 0; i < messages; ++i)
      EXPECT_EQ(sender_.call(MessageRequest{1, {}, Bytes(1024 * 64, 'm')}), WYX_OK);
    return std::ranges::count_if(readers_, [](const auto& reader) { return reader->closed(); });
  }

  MemoryDaemon daemon_{{1 << 20}, bounds()};
  MemoryClient sender_{daemon_, 0};
  std::vector<std::unique_ptr<MemoryClient>> readers_;
};

TEST_F(DaemonBurst, ForManyReaders_CountsOnceForTheirUser) {
  EXPECT_EQ(closed_after(32), 0);
  for (const auto& reader : readers_) {
    reader->read_again();
    EXPECT_THAT(reader->events().size(), testing::Ge(32u));
  }
  EXPECT_TRUE(daemon_.layer.drained());
}

// To close one of several who are equally behind frees nothing: the others keep their drain time.
TEST_F(DaemonBurst, WhoseReadersAllStall_LosesOne_AndTheRestAtTwiceTheBoundOnly) {
  EXPECT_EQ(closed_after(56), 0);
  daemon_.pass(1s);
  EXPECT_EQ(closed_after(1), 1);
  daemon_.pass(1s);
  EXPECT_EQ(closed_after(1), 1);
  EXPECT_EQ(closed_after(40), 5);
  EXPECT_FALSE(sender_.closed());
}

TEST(DaemonBounds, MessagesThatAreNeverFinished_AreBoundedInTimeAndInBytesOfTheirUser) {
  ClientLimits limits;
  limits.user_queue_bound = 1 << 20;
  MemoryDaemon daemon({1 << 20}, limits);
  const auto packets =
      wire::packets_of(wire::ClientMessage(wire::Call{StateChangeRequest{1, {}, Bytes(200'000, 's')}}));
  MemoryClient slow(daemon, 2), first(daemon, 1), second(daemon, 1);
  daemon.layer.received(slow.request, packets[0]);
  daemon.pass(9'999ms);
  daemon.layer.received(slow.request, packets[1]);
  EXPECT_FALSE(slow.closed());
  daemon.pass(1ms);
  EXPECT_TRUE(slow.closed() && daemon.logged("has not finished its message in time"));
  for (const ConnectionId id : {first.request, second.request}) {
    for (std::size_t i = 0; i < 3; ++i) daemon.layer.received(id, packets[i]);
  }
  EXPECT_TRUE(second.closed() && daemon.logged("its user has too many messages half sent"));
  daemon.layer.received(first.request, packets[3]);
  daemon.pass(3600s);
  EXPECT_FALSE(first.closed());
}

TEST(DaemonBounds, SessionsAndSilentConnectionsOverTheirLimit_AreToldSo_RootIsLetIn) {
  ClientLimits limits;
  limits.max_sessions = 6;
  limits.user_sessions = 2;
  limits.root_sessions = 1;
  MemoryDaemon daemon({1 << 20}, limits);
  const auto hello = [&](std::uint32_t uid) {
    const ConnectionId id = daemon.open(uid);
    daemon.say(id, wire::Hello{});
    const auto answer = daemon.transport.take(id).at(0);
    EXPECT_EQ(daemon.closed(id), answer.index() != 0);
    return answer.index() == 0 ? WYX_OK : std::get<wire::Answer>(answer).rc;
  };
  for (const auto& [uid, rc] : std::vector<std::pair<std::uint32_t, wyx_rc_t>>{{1, WYX_OK},
                                                                               {1, WYX_OK},
                                                                               {1, WYX_NO_MEMORY},
                                                                               {2, WYX_OK},
                                                                               {2, WYX_OK},
                                                                               {3, WYX_OK},
                                                                               {4, WYX_NO_MEMORY},
                                                                               {0, WYX_OK},
                                                                               {0, WYX_NO_MEMORY}})
    EXPECT_EQ(hello(uid), rc) << uid;
  ConnectionId last = 0;
  for (int i = 0; i < 300; ++i) last = daemon.open(5);
  EXPECT_TRUE(daemon.closed(last));
  EXPECT_EQ(std::get<wire::Answer>(daemon.transport.take(last).at(0)).rc, WYX_NO_MEMORY);
  EXPECT_FALSE(daemon.closed(daemon.open(6)) || daemon.closed(daemon.open(0)));
}

TEST_F(DaemonSession, SeveralEndpointsOfOneSession_ShareTheNotification_EachInItsOrder) {
  MemoryClient many(daemon_), single(daemon_);
  ASSERT_EQ(many.join(0, 0), WYX_OK);
  ASSERT_EQ(single.join(9, 9), WYX_OK);
  for (std::int16_t i = 1; i < 3; ++i) ASSERT_EQ(many.join(i, i), WYX_OK);
  many.events();
  many.event_wire().full = true;
  ASSERT_EQ(single.call(MessageRequest{9, {}, "first"}), WYX_OK);
  ASSERT_EQ(many.call(GoodbyeRequest{1}), WYX_OK);
  many.event_wire().full = false;
  daemon_.layer.writable(many.event);
  const auto events = many.events();
  ASSERT_EQ(events.size(), 6u);
  EXPECT_THAT(std::get<wire::Fanout>(events[0]).tokens, ElementsAre(0, 1, 2));
  EXPECT_EQ(std::get<wire::Notify>(events[1]).token, -1);
  EXPECT_THAT(std::get<wire::Fanout>(events[3]).tokens, ElementsAre(0, 2));
  EXPECT_TRUE(std::holds_alternative<wire::FanoutEnd>(events[5]));
  EXPECT_EQ(std::get<wire::Notify>(single.events().back()).token, 9);
}

// An allocation fails anywhere in an event: some may be closed, and the daemon goes on with the others.
TEST(DaemonBounds, MemoryThatRunsOutAnywhere_ClosesSessionsAndServesTheNextOne) {
  if (!allocations::kControlled) GTEST_SKIP() << "the sanitizer allocates";
  for (int after = 0; after < 120; ++after) {
    MemoryDaemon daemon;
    MemoryClient first(daemon), second(daemon);
    ASSERT_EQ(first.join(1, 1), WYX_OK);
    ASSERT_EQ(second.join(1, 2), WYX_OK);
    const auto packets = wire::packets_of(wire::ClientMessage(wire::Call{LeaveRequest{1, {WYX_1_PHASE, 0}, 0}}));
    try {
      const allocations::Refuse refuse(after);
      daemon.layer.received(first.request, packets[0]);
    } catch (const std::bad_alloc&) {
      daemon.layer.failed(first.request, "out of memory");
    }
    MemoryClient next(daemon);
    ASSERT_EQ(next.join(1, 3), WYX_OK) << after;
    EXPECT_TRUE(second.closed() || second.call(MessageRequest{1, {}, "there"}) == WYX_OK) << after;
  }
}

// -------------------------------------------------------------------------------------------------------- pings

class DaemonPings : public DaemonSession {
 protected:
  static constexpr wire::SetResponsiveness kEveryTenLimitThree{WYX_PING_RESPONSIVENESS, 10, 3};
  static constexpr const char* kSilent = "announcement <no-response> 1";
  static constexpr const char* kBack = "announcement <response> 1";

  void SetUp() override {
    ASSERT_EQ(client_.join(1, 1), WYX_OK);
    ASSERT_EQ(other_.join(1, 2), WYX_OK);
    ASSERT_EQ(client_.ask(kEveryTenLimitThree), WYX_OK);
    told(client_);
    told(other_);
  }

  MemoryClient client_{daemon_};
  MemoryClient other_{daemon_};
};

TEST_F(DaemonPings, AnsweredPings_GoOnByTheIntervalAndAnnounceNothing_WrongSettingsNotwithstanding) {
  const std::pair<wire::SetResponsiveness, wyx_rc_t> wrong[] = {
      {{WYX_PING_RESPONSIVENESS, 0, 3}, WYX_BAD_PARAMETER},
      {{0x40000000, 1, 1}, WYX_BAD_PARAMETER},
      {{WYX_COUNTER_RESPONSIVENESS, 1, 1}, WYX_NOT_SUPPORTED}};
  for (const auto& [settings, rc] : wrong) EXPECT_EQ(client_.ask(settings), rc);
  for (std::uint64_t n = 1; n <= 3; ++n) {
    daemon_.pass(10s);
    EXPECT_THAT(told(client_), ElementsAre("ping " + std::to_string(n)));
    daemon_.say(client_.event, wire::PingAnswer{n, true});
  }
  EXPECT_THAT(told(other_), IsEmpty());
}

TEST_F(DaemonPings, NoAnswerInTime_IsAnnouncedOnceAndAgainWhenTheAnswerComesOrNoneIsWanted) {
  daemon_.pass(12'999ms);
  EXPECT_THAT(told(other_), IsEmpty());
  daemon_.pass(1ms);
  EXPECT_THAT(told(other_), ElementsAre(kSilent));
  daemon_.pass(60s);
  EXPECT_THAT(told(other_), IsEmpty());
  EXPECT_THAT(told(client_), ElementsAre("ping 1", kSilent)) << "a client that does not answer is not flooded";
  daemon_.say(client_.event, wire::PingAnswer{1, true});
  EXPECT_THAT(told(other_), ElementsAre(kBack));

  daemon_.pass(13s);
  ASSERT_EQ(client_.ask(wire::SetResponsiveness{}), WYX_OK);
  EXPECT_THAT(told(other_), ElementsAre(kSilent, kBack));
  EXPECT_THAT(told(client_), ElementsAre(kBack, "ping 2", kSilent, kBack));
  daemon_.pass(100s);
  EXPECT_THAT(told(client_), IsEmpty()) << "switched off";
}

TEST_F(DaemonPings, ClientThatAskedToBeClosedWhenSlow_IsAnnouncedAndClosed) {
  ASSERT_EQ(client_.ask(wire::SetResponsiveness{WYX_PING_RESPONSIVENESS | WYX_CLOSE_CLIENT_SOCKET, 1, 1}), WYX_OK);
  daemon_.pass(2s);
  EXPECT_TRUE(client_.closed());
  EXPECT_THAT(told(other_), ElementsAre(kSilent, "approved failure by 1 <approve>, members 2, changing 1(died)"));
}

// ------------------------------------------------------------------------------------------------ timers, access

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

TEST_F(DaemonSession, PhaseThatWaitsAMinute_IsWarnedOfOnceWithTheFirstOfThoseWhoAreMissing) {
  MemoryClient client(daemon_);
  for (std::int16_t i = 1; i <= 11; ++i) ASSERT_EQ(client.join(i, i), WYX_OK);
  ASSERT_EQ(client.call(MessageRequest{1, {WYX_N_PHASE, 0}, "m"}), WYX_OK);
  ASSERT_EQ(client.call(VoteRequest{1, WYX_VOTE_APPROVE, {}, {}}), WYX_OK);
  daemon_.pass(59s);
  EXPECT_FALSE(daemon_.logged("has waited"));
  daemon_.pass(3600s);
  const std::string warning = "group \"group\": phase 1 of a message protocol has waited 60 s for the votes of ";
  EXPECT_TRUE(daemon_.logged(warning + "\"\" (2@1, session 1 (\"client\", pid 4711, uid 1000)), \"\" (3@1"));
  EXPECT_TRUE(daemon_.logged("and 2 more\n"));
  EXPECT_EQ(daemon_.log.str().find(warning), daemon_.log.str().rfind(warning));
}

TEST_F(DaemonSession, ClientWithProvidersInManyGroupsDies_OthersAreServedBeforeAllIsTold) {
  MemoryClient survivor(daemon_), dying(daemon_);
  for (std::int16_t i = 1; i <= 1000; ++i) {
    ASSERT_EQ(survivor.join(i, 1, "g" + std::to_string(i)), WYX_OK);
    ASSERT_EQ(dying.join(i, 2, "g" + std::to_string(i)), WYX_OK);
  }
  told(survivor);
  daemon_.layer.lost(dying.event, "gone");
  std::size_t heard = told(survivor).size();
  EXPECT_LT(heard, 1000u);
  ASSERT_EQ(survivor.call(SubscribeRequest{5000, WYX_SUBSCRIBE_STATE, "g1"}), WYX_OK);
  EXPECT_EQ(told(survivor).size(), 1u);
  while (daemon_.continue_work()) heard += told(survivor).size();
  EXPECT_EQ(heard, 1000u);
}

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
