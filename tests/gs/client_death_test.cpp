// What a client does when its daemon dies or says what it should not: over a daemon that the test plays, and the
// real one.

#include <fcntl.h>
#include <signal.h>

#include <future>
#include <thread>

#include "support/client_fixture.h"
#include "support/fake_gsd.h"

namespace test_support {
namespace {

using namespace gs;

class ClientOfAFake : public testing::Test {
 protected:
  void SetUp() override {
    setenv("GSD_ENDPOINT", fake.endpoint().c_str(), 1);
    recorder().reset();
    open();
  }
  void TearDown() override {
    session.close();
    wyx_quit();
  }
  static Recorder& recorder() { return Recorder::get(); }

  void open() {
    auto accepted = std::async(std::launch::async, [this] { return fake.accept_session(); });
    const SetupResult opened = setup();
    ASSERT_EQ(opened.rc, WYX_OK);
    session = accepted.get();
    fd = opened.descriptor;
  }
  /// Answers the next request.
  Request answer(wyx_rc_t rc) {
    const auto call = session.request.receive<wire::Call>();
    session.request.send(wire::Answer{rc});
    return call.request;
  }
  wyx_token_t accepted_join(const std::string& name) {
    wyx_token_t token = -1;
    auto joining = std::async(std::launch::async, [&] {
      Group group(name);
      return join(group, 1, &token);
    });
    answer(WYX_OK);
    EXPECT_EQ(joining.get(), WYX_OK);
    return token;
  }
  wyx_token_t accepted_subscription(const std::string& name) {
    wyx_token_t token = -1;
    auto subscribing =
        std::async(std::launch::async, [&] { return subscribe(name, WYX_SUBSCRIBE_STATE, &token); });
    answer(WYX_OK);
    EXPECT_EQ(subscribing.get(), WYX_OK);
    return token;
  }
  template <typename T>
  void notify(wyx_token_t token, const T& notification) {
    session.event.send(wire::Notify{token, std::make_shared<const Notification>(notification)});
  }
  void dispatch_next() {
    ASSERT_TRUE(readable(fd, 60000));
    EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_OK);
  }
  void expect_quiet_end() {
    EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_NO_INIT);
    EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_NO_INIT);
    EXPECT_NE(fcntl(fd, F_GETFD), -1);
    EXPECT_FALSE(readable(fd));
  }

  FakeGsd fake;
  FakeSession session;
  int fd = -1;
};

TEST_F(ClientOfAFake, RequestsUnderWay_allComeBackWhenTheDaemonDies) {
  const wyx_token_t token = accepted_join("group");
  std::vector<std::future<wyx_rc_t>> waiting;
  for (int i = 0; i < 4; ++i) {
    waiting.push_back(std::async(std::launch::async, [token] { return send_message(token, "x"); }));
    waiting.push_back(std::async(std::launch::async, [i] {
      Group group("more" + std::to_string(i));
      wyx_token_t unused = -1;
      return join(group, 1, &unused);
    }));
  }
  session.request.receive<wire::Call>();  // one is under way, the others behind it
  session.close();
  for (auto& one : waiting) EXPECT_EQ(one.get(), WYX_NO_INIT);
  EXPECT_EQ(wyx_goodbye(token), WYX_NO_INIT);

  dispatch_next();
  ASSERT_EQ(recorder().count(), 1u) << "a join that was refused is nobody's";
  EXPECT_EQ(recorder().of(token)[0].summary, static_cast<unsigned>(WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY));
  expect_quiet_end();
  EXPECT_EQ(wyx_goodbye(token), WYX_NO_INIT);
}

TEST_F(ClientOfAFake, DispatchesThatWait_comeBackWhenTheDaemonDies) {
  std::vector<std::future<wyx_rc_t>> waiting;
  for (int i = 0; i < 3; ++i) {
    waiting.push_back(std::async(std::launch::async, [] { return wyx_dispatch(WYX_BLOCKING); }));
  }
  session.request.close();  // one channel is enough
  for (auto& one : waiting) EXPECT_EQ(one.get(), WYX_NO_INIT);
  expect_quiet_end();
}

TEST_F(ClientOfAFake, WhatHadArrived_isHandedOutBeforeTheEnd) {
  const wyx_token_t provider = accepted_join("group");
  const wyx_token_t subscriber = accepted_subscription("group");
  SubscriptionNotification state;
  state.type = WYX_SUBSCRIPTION_STATE;
  state.state = std::make_shared<const Bytes>("last words");
  notify(subscriber, state);
  session.close();
  EXPECT_EQ(send_message(provider, "x"), WYX_NO_INIT);
  EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_OK);
  const auto seen = recorder().all();
  ASSERT_EQ(seen.size(), 3u);
  EXPECT_EQ(seen[0].state, "last words");
  EXPECT_EQ(seen[1].token, provider);
  EXPECT_EQ(seen[2].token, subscriber);
  EXPECT_EQ(seen[2].summary, static_cast<unsigned>(WYX_SUBSCRIPTION_GS_HAS_DIED));
  expect_quiet_end();
}

TEST_F(ClientOfAFake, AfterTheEnd_aNewSessionWorks) {
  const wyx_token_t before = accepted_join("group");
  session.close();
  dispatch_next();
  open();
  EXPECT_EQ(send_message(before, "x"), WYX_BAD_MEMBER_TOKEN);
  EXPECT_FALSE(readable(fd));
  accepted_join("group");
}

TEST_F(ClientOfAFake, NewSessionBeforeTheEndWasTold_tellsItFirst) {
  const wyx_token_t provider = accepted_join("group");
  const wyx_token_t subscriber = accepted_subscription("group");
  session.close();
  EXPECT_EQ(send_message(provider, "x"), WYX_NO_INIT);
  open();
  const wyx_token_t after = accepted_join("group");
  EXPECT_NE(after, provider);
  recorder().set_hook([](const Seen&) { wyx_dispatch(WYX_NON_BLOCKING); });  // nested, to the end of the old one
  dispatch_next();
  EXPECT_EQ(recorder().of(provider).size(), 1u);
  EXPECT_EQ(recorder().of(subscriber).size(), 1u);
  EXPECT_EQ(recorder().count(), 2u);
  EXPECT_FALSE(readable(fd));
  notify(after, AnnouncementNotification{WYX_RESPONSIVENESS_RESPONSE, nullptr});
  dispatch_next();
  EXPECT_EQ(recorder().of(after).size(), 1u);
  session.close();
  dispatch_next();
  EXPECT_EQ(recorder().of(after).size(), 2u);
  expect_quiet_end();
}

TEST_F(ClientOfAFake, SetupThatFails_leavesTheDeadSessionToTellItsClients) {
  const wyx_token_t token = accepted_join("group");
  session.close();
  auto refused = std::async(std::launch::async, [this] {
    FakePeer peer = fake.accept();
    peer.receive<wire::Hello>();
    peer.send(wire::Answer{WYX_NO_MEMORY});
  });
  EXPECT_EQ(setup().rc, WYX_NO_MEMORY);
  refused.get();
  dispatch_next();
  EXPECT_EQ(recorder().of(token).size(), 1u);
}

TEST_F(ClientOfAFake, Nonsense_endsTheSessionAndIsCaptured) {
  const wyx_token_t token = accepted_join("group");
  session.event.send_bytes("nonsense");
  dispatch_next();
  EXPECT_EQ(recorder().of(token).size(), 1u);
  EXPECT_EQ(send_message(token, "x"), WYX_NO_INIT);
  expect_quiet_end();
  char id[64];
  ASSERT_EQ(wyx_get_ffdc_id(id), WYX_OK);
  EXPECT_TRUE(std::string(id).starts_with("malformed-")) << id;
}

TEST_F(ClientOfAFake, AnAnswerOfTheWrongKind_endsTheSession) {
  auto asking = std::async(std::launch::async, [] {
    int node = -1;
    return wyx_get_domain_master_node_number(&node);
  });
  session.request.receive<wire::QueryNode>();
  session.request.send(wire::Ping{1});
  EXPECT_EQ(asking.get(), WYX_NO_INIT);
  EXPECT_TRUE(readable(fd));
  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_NO_INIT);
}

TEST_F(ClientOfAFake, PartOfAMessage_isNotHandedOutUntilTheRestIsThere) {
  const wyx_token_t token = accepted_subscription("group");
  SubscriptionNotification state;
  state.type = WYX_SUBSCRIPTION_STATE;
  state.state = std::make_shared<const Bytes>(200'000, 's');
  const auto packets =
      wire::packets_of(wire::Notify{token, std::make_shared<const Notification>(std::move(state))});
  ASSERT_GT(packets.size(), 2u);
  for (const auto& packet : packets) {
    EXPECT_EQ(recorder().count(), 0u);
    session.event.send_bytes({reinterpret_cast<const char*>(packet.data()), packet.size()});
    dispatch_next();
  }
  EXPECT_EQ(recorder().of(token).at(0).state, std::string(200'000, 's'));
}

TEST_F(ClientOfAFake, NotificationBeforeTheAnswer_findsItsClient) {
  wyx_token_t token = -1;
  auto subscribing = std::async(std::launch::async, [&] { return subscribe("g", WYX_SUBSCRIBE_STATE, &token); });
  const auto call = session.request.receive<wire::Call>();
  const Token chosen = std::get<SubscribeRequest>(call.request).token;
  SubscriptionNotification first;
  first.type = WYX_SUBSCRIPTION_STATE;
  notify(chosen, first);
  dispatch_next();
  EXPECT_EQ(recorder().of(chosen).size(), 1u);
  session.request.send(wire::Answer{WYX_OK});
  EXPECT_EQ(subscribing.get(), WYX_OK);
  EXPECT_EQ(token, chosen);
}

TEST_F(ClientOfAFake, NotificationsForNobody_areDropped) {
  const wyx_token_t token = accepted_subscription("group");
  notify(token + 1, SubscriptionNotification{});
  dispatch_next();
  EXPECT_EQ(recorder().count(), 0u);
  auto leaving = std::async(std::launch::async, [&] { return wyx_unsubscribe(token); });
  answer(WYX_OK);
  EXPECT_EQ(leaving.get(), WYX_OK);
  notify(token, SubscriptionNotification{});
  dispatch_next();
  EXPECT_EQ(recorder().count(), 0u);
}

TEST_F(ClientOfAFake, DelayedErrors_giveTheFailingRequestBack) {
  const wyx_token_t token = accepted_join("group");
  GroupAttributes attributes;
  attributes.group_name = "theirs";
  const auto reason = std::make_shared<const GroupAttributes>(attributes);
  JoinRequest refused_join{token, attributes, 7, "local"};
  AttributeChangeRequest change{token, {}, attributes};
  const std::vector<std::pair<DelayedErrorNotification, std::string>> errors = {
      {{WYX_STATE_VALUE_CHANGE, WYX_COLLIDE, StateChangeRequest{token, {}, "state"}, nullptr}, "state"},
      {{WYX_PROVIDER_MESSAGE, WYX_COLLIDE, MessageRequest{token, {}, "message"}, nullptr}, "message"},
      {{WYX_LEAVE, WYX_COLLIDE, LeaveRequest{token, {}, 42}, nullptr}, "42"},
      {{WYX_EXPEL, WYX_COLLIDE, ExpelRequest{token, {}, {{3, 5}}, 0, "flag"}, nullptr}, "3/flag"},
      {{WYX_GROUP_ATTRIBUTE_CHANGE, WYX_COLLIDE, change, nullptr}, "theirs"},
      {{WYX_STATE_VALUE_CHANGE, WYX_VOTE_NOT_EXPECTED, VoteRequest{token, WYX_VOTE_APPROVE, {}, {}}, nullptr},
       "none"},
      {{WYX_SUBSCRIPTION, WYX_UNKNOWN_GROUP, SubscribeRequest{token, 1, "watched"}, nullptr}, "watched"},
  };
  for (const auto& [error, text] : errors) {
    wyx_token_t to = error.protocol == WYX_SUBSCRIPTION ? accepted_subscription("watched") : token;
    notify(to, error);
    dispatch_next();
    const Seen seen = recorder().all().back();
    EXPECT_EQ(seen.token, to);
    EXPECT_EQ(seen.summary, static_cast<unsigned>(error.rc));
    EXPECT_EQ(seen.request, text);
    EXPECT_EQ(seen.group, "");
  }
  notify(token, DelayedErrorNotification{WYX_JOIN, WYX_BAD_GROUP_ATTRIBUTES, refused_join, reason});
  dispatch_next();
  EXPECT_EQ(recorder().all().back().request, "theirs/local/7/own routine");
  EXPECT_EQ(recorder().all().back().group, "theirs");
  EXPECT_EQ(send_message(token, "x"), WYX_BAD_MEMBER_TOKEN) << "the join has failed";
}

TEST_F(ClientOfAFake, Pings_areAnsweredInsideDispatchOnly) {
  session.event.send(wire::Ping{7});
  ASSERT_TRUE(readable(fd, 60000));
  EXPECT_EQ(recorder().count(), 0u);
  recorder().set_ping_result(WYX_CALLBACK_NOT_OK);
  dispatch_next();
  const auto answer = session.event.receive<wire::PingAnswer>();
  EXPECT_EQ(answer.number, 7u);
  EXPECT_FALSE(answer.ok);
}

TEST_F(ClientOfAFake, Quit_saysSo) {
  auto quitting = std::async(std::launch::async, [] { return wyx_quit(); });
  session.request.receive<wire::Quit>();
  session.request.send(wire::Answer{WYX_OK});
  EXPECT_EQ(quitting.get(), WYX_OK);
  EXPECT_EQ(fcntl(fd, F_GETFD), -1);
}

TEST_F(ClientOfAFake, DaemonHangsOnARequest_quitComesBackAndSoDoesTheRequest) {
  const wyx_token_t token = accepted_join("stuck");
  auto sending = std::async(std::launch::async, [&] { return send_message(token, "x"); });
  session.request.receive<wire::Call>();
  EXPECT_EQ(wyx_quit(), WYX_OK);
  EXPECT_EQ(sending.get(), WYX_NO_INIT);
}

class ClientOfADaemon : public testing::TestWithParam<int> {};

TEST_P(ClientOfADaemon, DaemonGone_everyClientIsToldAndANewDaemonServes) {
  GsdProcess daemon;
  setenv("GSD_ENDPOINT", daemon.endpoint().c_str(), 1);
  Recorder& recorder = Recorder::get();
  recorder.reset();
  const SetupResult opened = setup();
  ASSERT_EQ(opened.rc, WYX_OK);
  Group group("mourning");
  wyx_token_t first = -1, second = -1, watcher = -1;
  ASSERT_EQ(join(group, 1, &first), WYX_OK);
  ASSERT_EQ(join(group, 2, &second), WYX_OK);
  ASSERT_EQ(subscribe(group.name, WYX_SUBSCRIBE_MEMBERSHIP, &watcher), WYX_OK);
  std::vector<std::future<void>> busy;
  for (const wyx_token_t token : {first, second}) {
    busy.push_back(std::async(std::launch::async, [token] {
      while (send_message(token, "x") != WYX_NO_INIT) {
      }
    }));
  }
  daemon.kill(GetParam());
  daemon.wait();
  for (auto& one : busy) one.get();
  for (const wyx_token_t token : {first, second, watcher}) {
    const unsigned last_word =
        token == watcher ? unsigned{WYX_SUBSCRIPTION_GS_HAS_DIED} : unsigned{WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY};
    EXPECT_TRUE(dispatch_until(opened.descriptor, [&] {
      const auto seen = recorder.of(token);
      return !seen.empty() && seen.back().summary == last_word;
    }));
  }
  EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_NO_INIT);
  EXPECT_FALSE(readable(opened.descriptor));
  EXPECT_EQ(setup().rc, WYX_CONNECT_FAILED);
  daemon.restart();
  const SetupResult again = setup();
  ASSERT_EQ(again.rc, WYX_OK);
  recorder.reset();
  ASSERT_EQ(join(group, 1, &first), WYX_OK);
  EXPECT_TRUE(
      dispatch_until(again.descriptor, [&] { return recorder.count(first, WYX_APPROVED_NOTIFICATION) == 1; }));
  EXPECT_EQ(wyx_quit(), WYX_OK);
}

INSTANTIATE_TEST_SUITE_P(Signals, ClientOfADaemon, testing::Values(SIGKILL, SIGTERM),
                         [](const auto& signal) { return signal.param == SIGKILL ? "Killed" : "Stopped"; });

}  // namespace
}  // namespace test_support
