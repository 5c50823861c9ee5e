// What a client does when its daemon dies or says what it should not: over a daemon that the test plays, and the
// real one.

#include <fcntl.h>
#include <signal.h>

#include <future>

#include "gs/same.h"
#include "gs/wire_samples.h"
#include "support/client_fixture.h"
#include "support/fake_gsd.h"

namespace test_support {
namespace {

using namespace gs;

class ClientOfAFake : public SessionTest {
 protected:
  void SetUp() override {
    setenv("GSD_ENDPOINT", fake.endpoint().c_str(), 1);
    recorder().reset();
    open_with_fake();
  }
  void TearDown() override {
    session.close();
    SessionTest::TearDown();
  }

  void open_with_fake() {
    auto accepted = std::async(std::launch::async, [this] { return fake.accept_session(); });
    open();
    session = accepted.get();
  }
  /// The result of a request that the fake answers so.
  template <typename Ask>
  wyx_rc_t answered(Ask ask, wyx_rc_t rc = WYX_OK) {
    auto asking = std::async(std::launch::async, ask);
    session.request.receive<wire::Call>();
    session.request.send(wire::Answer{rc});
    return asking.get();
  }
  wyx_token_t provider() {
    wyx_token_t token = -1;
    Group group("group");
    EXPECT_EQ(answered([&] { return join(group, 1, &token); }), WYX_OK);
    return token;
  }
  wyx_token_t subscriber() {
    wyx_token_t token = -1;
    EXPECT_EQ(answered([&] { return subscribe("group", WYX_SUBSCRIBE_STATE, &token); }), WYX_OK);
    return token;
  }
  static wire::Notify notify(wyx_token_t token, Notification what) {
    return {token, std::make_shared<const Notification>(std::move(what))};
  }
  static wire::Notify state_for(wyx_token_t token, const Bytes& state) {
    SubscriptionNotification n;
    n.type = WYX_SUBSCRIPTION_STATE;
    n.state = std::make_shared<const Bytes>(state);
    return notify(token, n);
  }
  void dispatch_next() {
    ASSERT_TRUE(readable(fd(), 60000));
    EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_OK);
  }
  void expect_quiet_end() {
    EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_NO_INIT);
    EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_NO_INIT);
    EXPECT_NE(fcntl(fd(), F_GETFD), -1);
    EXPECT_FALSE(readable(fd()));
  }

  FakeGsd fake;
  FakeSession session;
};

// ------------------------------------------------------------------------------------------------- how it ends

TEST_F(ClientOfAFake, RequestsUnderWay_allComeBackWhenTheDaemonDies) {
  const wyx_token_t token = provider();
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

  dispatch_next();
  ASSERT_EQ(recorder().count(), 1u) << "a join that was refused is nobody's";
  EXPECT_EQ(told(token), "died\n");
  expect_quiet_end();
  EXPECT_EQ(wyx_goodbye(token), WYX_NO_INIT);
}

TEST_F(ClientOfAFake, DispatchesThatWait_comeBackWhenTheDaemonDies) {
  std::vector<std::future<wyx_rc_t>> waiting;
  for (int i = 0; i < 3; ++i)
    waiting.push_back(std::async(std::launch::async, [] { return wyx_dispatch(WYX_BLOCKING); }));
  session.request.close();  // one channel is enough
  for (auto& one : waiting) EXPECT_EQ(one.get(), WYX_NO_INIT);
  expect_quiet_end();
}

TEST_F(ClientOfAFake, WhatHadArrived_isHandedOutBeforeTheEnd) {
  const wyx_token_t member = provider(), watcher = subscriber();
  session.event.send(state_for(watcher, "last words"));
  session.close();
  EXPECT_EQ(send_message(member, "x"), WYX_NO_INIT);
  EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_OK);
  EXPECT_EQ(told(watcher), "subscription {state}, state 'last words'\ndied\n");
  EXPECT_EQ(told(member), "died\n");
  expect_quiet_end();
}

TEST_F(ClientOfAFake, NewSessionBeforeTheEndWasTold_tellsItFirst) {
  const wyx_token_t member = provider(), watcher = subscriber();
  session.close();
  EXPECT_EQ(send_message(member, "x"), WYX_NO_INIT);
  open_with_fake();
  EXPECT_EQ(send_message(member, "x"), WYX_BAD_MEMBER_TOKEN);
  const wyx_token_t after = provider();
  EXPECT_NE(after, member);
  recorder().set_hook([](const Seen&) { wyx_dispatch(WYX_NON_BLOCKING); });  // nested, to the end of the old one
  dispatch_next();
  EXPECT_EQ(told(member) + told(watcher), "died\ndied\n");
  EXPECT_EQ(recorder().count(), 2u);
  EXPECT_FALSE(readable(fd()));
  session.event.send(notify(after, AnnouncementNotification{WYX_RESPONSIVENESS_RESPONSE, nullptr}));
  dispatch_next();
  session.close();
  dispatch_next();
  EXPECT_EQ(told(after), "announcement <response>\ndied\n");
  expect_quiet_end();
}

TEST_F(ClientOfAFake, SetupThatFails_leavesTheDeadSessionToTellItsClients) {
  const wyx_token_t token = provider();
  session.close();
  auto refused = std::async(std::launch::async, [this] {
    FakePeer peer = fake.accept();
    peer.receive<wire::Hello>();
    peer.send(wire::Answer{WYX_NO_MEMORY});
  });
  EXPECT_EQ(setup().rc, WYX_NO_MEMORY);
  refused.get();
  EXPECT_THAT(last_failure(), testing::StartsWith("hello-refused-5-"));
  auto closed = std::async(std::launch::async, [this] { fake.accept().receive<wire::Hello>(); });
  EXPECT_EQ(setup().rc, WYX_CONNECT_FAILED);
  closed.get();
  EXPECT_THAT(last_failure(), testing::StartsWith("hello-closed-104-"));
  for (int i = 0; i < 20; ++i) {  // closed before Hello, or after it
    auto turned_away = std::async(std::launch::async, [this] { fake.accept().send(wire::Answer{WYX_NO_MEMORY}); });
    EXPECT_EQ(setup().rc, WYX_NO_MEMORY);
    turned_away.get();
  }
  dispatch_next();
  EXPECT_EQ(told(token), "died\n");
}

TEST_F(ClientOfAFake, Quit_saysSoAndComesBackAlsoWhenTheDaemonHangsOnARequest) {
  auto quitting = std::async(std::launch::async, [] { return wyx_quit(); });
  session.request.receive<wire::Quit>();
  session.request.send(wire::Answer{WYX_OK});
  EXPECT_EQ(quitting.get(), WYX_OK);
  EXPECT_EQ(fcntl(fd(), F_GETFD), -1);

  open_with_fake();
  const wyx_token_t token = provider();
  auto sending = std::async(std::launch::async, [&] { return send_message(token, "x"); });
  session.request.receive<wire::Call>();
  EXPECT_EQ(wyx_quit(), WYX_OK);
  EXPECT_EQ(sending.get(), WYX_NO_INIT);
}

TEST_F(ClientOfAFake, AnswerThatDoesNotCome_endsTheSessionAtTheLimit) {
  session.close();
  setenv("GSD_REQUEST_LIMIT", "1", 1);
  open_with_fake();
  unsetenv("GSD_REQUEST_LIMIT");
  const wyx_token_t token = provider();
  session.event.send(notify(token, AnnouncementNotification{WYX_RESPONSIVENESS_RESPONSE, nullptr}));
  EXPECT_EQ(send_message(token, "x"), WYX_NO_INIT);
  EXPECT_THAT(last_failure(), testing::StartsWith("request-timeout-110-"));
  dispatch_next();
  EXPECT_EQ(told(token, 2), "announcement <response>\ndied\n");
  expect_quiet_end();
}

// --------------------------------------------------------------------------------------- what the daemon says

TEST_F(ClientOfAFake, Nonsense_endsTheSessionAndIsCaptured) {
  const wyx_token_t token = provider();
  session.event.send_bytes("nonsense");
  dispatch_next();
  EXPECT_EQ(told(token), "died\n");
  EXPECT_EQ(send_message(token, "x"), WYX_NO_INIT);
  expect_quiet_end();
  EXPECT_THAT(last_failure(), testing::StartsWith("event-malformed-"));
}

TEST_F(ClientOfAFake, AnAnswerOfTheWrongKind_endsTheSession) {
  auto asking = std::async(std::launch::async, [] {
    int node = -1;
    return wyx_get_domain_master_node_number(&node);
  });
  session.request.receive<wire::QueryNode>();
  session.request.send(wire::Ping{1});
  EXPECT_EQ(asking.get(), WYX_NO_INIT);
  EXPECT_TRUE(readable(fd()));
  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_NO_INIT);
}

TEST_F(ClientOfAFake, PartOfAMessage_isNotHandedOutUntilTheRestIsThere) {
  const wyx_token_t token = subscriber();
  const auto packets = wire::packets_of(state_for(token, Bytes(200'000, 's')));
  ASSERT_GT(packets.size(), 2u);
  for (const auto& packet : packets) {
    EXPECT_EQ(recorder().count(), 0u);
    session.event.send(packet);
    dispatch_next();
  }
  EXPECT_EQ(*std::get<SubscriptionNotification>(recorder().of(token).at(0).what).state, Bytes(200'000, 's'));
}

TEST_F(ClientOfAFake, NotificationBeforeTheAnswer_findsItsClient_thoseForNobodyAreDropped) {
  wyx_token_t token = -1;
  auto subscribing = std::async(std::launch::async, [&] { return subscribe("g", WYX_SUBSCRIBE_STATE, &token); });
  const Token chosen = std::get<SubscribeRequest>(session.request.receive<wire::Call>().request).token;
  session.event.send(state_for(chosen + 1, "nobody's"));
  session.event.send(state_for(chosen, "first"));
  EXPECT_EQ(told(chosen), "subscription {state}, state 'first'\n");
  session.request.send(wire::Answer{WYX_OK});
  EXPECT_EQ(subscribing.get(), WYX_OK);
  EXPECT_EQ(token, chosen);

  EXPECT_EQ(answered([&] { return wyx_unsubscribe(token); }, WYX_COLLIDE), WYX_COLLIDE);
  EXPECT_EQ(answered([&] { return wyx_unsubscribe(token); }), WYX_OK) << "a refusal changes nothing";
  session.event.send(state_for(token, "late"));
  dispatch_next();
  EXPECT_EQ(recorder().count(), 1u);
}

/// What a callback's record can hold of the notification.
Notification as_recorded(wyx_token_t token, Notification n) {
  auto* protocol = std::get_if<ProtocolNotification>(&n);
  if (protocol != nullptr && protocol->type != WYX_N_PHASE_NOTIFICATION) protocol->time_limit = 0;
  auto* error = std::get_if<DelayedErrorNotification>(&n);
  if (error == nullptr) return n;
  std::visit([token](auto& r) { r.token = token; }, error->failing_request);
  const bool no_record = std::holds_alternative<VoteRequest>(error->failing_request) ||
                         std::holds_alternative<UnsubscribeRequest>(error->failing_request);
  if (no_record) error->failing_request = GoodbyeRequest{token};
  return n;
}

TEST_F(ClientOfAFake, EveryNotification_isHandedOutWithAllItsParts) {
  std::vector<Notification> all = wire::samples::notifications();
  for (const auto type : {WYX_N_PHASE_NOTIFICATION, WYX_APPROVED_NOTIFICATION}) {
    all.push_back(wire::samples::full_protocol());
    std::get<ProtocolNotification>(all.back()).type = type;
  }
  for (const Notification& n : all) {
    const auto* error = std::get_if<DelayedErrorNotification>(&n);
    const bool to_subscriber = std::holds_alternative<SubscriptionNotification>(n) ||
                               (error && (std::holds_alternative<SubscribeRequest>(error->failing_request) ||
                                          std::holds_alternative<UnsubscribeRequest>(error->failing_request)));
    const wyx_token_t token = to_subscriber ? subscriber() : provider();
    session.event.send(notify(token, n));
    dispatch_next();
    ASSERT_EQ(recorder().of(token).size(), 1u) << text(n);
    const Notification seen = recorder().of(token)[0].what;
    EXPECT_TRUE(same(as_recorded(token, n), seen)) << text(n) << "\n" << text(seen);
  }
}

TEST_F(ClientOfAFake, RefusedJoin_endsWithItsDelayedError) {
  const wyx_token_t token = provider();
  session.event.send(
      notify(token, DelayedErrorNotification{WYX_PROVIDER_MESSAGE, WYX_COLLIDE, MessageRequest{}, nullptr}));
  dispatch_next();
  EXPECT_EQ(answered([&] { return send_message(token, "x"); }), WYX_OK);
  session.event.send(notify(token, DelayedErrorNotification{WYX_JOIN, WYX_COLLIDE, {}, nullptr}));
  dispatch_next();
  EXPECT_EQ(send_message(token, "x"), WYX_BAD_MEMBER_TOKEN);
}

TEST_F(ClientOfAFake, NotificationForTheOtherKindOfClient_isDropped) {
  const wyx_token_t member = provider(), watcher = subscriber();
  session.event.send(notify(watcher, DelayedErrorNotification{WYX_JOIN, WYX_COLLIDE, JoinRequest{}, nullptr}));
  session.event.send(state_for(member, "x"));
  dispatch_next();
  EXPECT_EQ(recorder().count(), 0u);
  session.event.send(state_for(watcher, "y"));
  EXPECT_EQ(told(watcher), "subscription {state}, state 'y'\n") << "it is still there";
}

TEST_F(ClientOfAFake, Pings_areAnsweredInsideDispatchOnly) {
  session.event.send(wire::Ping{7});
  ASSERT_TRUE(readable(fd(), 60000));
  EXPECT_EQ(recorder().count(), 0u);
  recorder().set_ping_result(WYX_CALLBACK_NOT_OK);
  dispatch_next();
  const auto answer = session.event.receive<wire::PingAnswer>();
  EXPECT_EQ(answer.number, 7u);
  EXPECT_FALSE(answer.ok);
}

TEST_F(ClientOfAFake, NotificationForSeveral_keepsTheDescriptorReadableUntilAllHaveIt) {
  const wyx_token_t first = subscriber(), second = subscriber();
  session.event.send(wire::Fanout{{first, second}});
  session.event.send(state_for(-1, "shared"));
  session.event.send(wire::FanoutEnd{});
  recorder().set_hook([this](const Seen&) { EXPECT_TRUE(readable(fd())); });
  dispatch_next();
  for (const wyx_token_t token : {first, second}) EXPECT_EQ(told(token), "subscription {state}, state 'shared'\n");
  EXPECT_FALSE(readable(fd()));
}

TEST_F(ClientOfAFake, NotificationForSeveralThatMakesNoSense_endsTheSession) {
  const wire::ServerMessage fanout = wire::Fanout{{1, 2}}, end = wire::FanoutEnd{}, shared = state_for(-1, "s"),
                            own = state_for(1, "s"), ping = wire::Ping{1};
  for (const auto& messages : std::vector<std::vector<wire::ServerMessage>>{{shared},
                                                                            {end},
                                                                            {fanout, fanout},
                                                                            {fanout, own},
                                                                            {fanout, end},
                                                                            {fanout, ping},
                                                                            {fanout, shared, shared},
                                                                            {fanout, shared, ping}}) {
    for (const auto& message : messages) session.event.send(message);
    EXPECT_TRUE(dispatch_until(fd(), [] { return wyx_dispatch(WYX_NON_BLOCKING) == WYX_NO_INIT; }));
    session.close();
    wyx_quit();
    open_with_fake();
  }
}

// ---------------------------------------------------------------------------------------------- the real daemon

class ClientOfADaemon : public SessionTest, public testing::WithParamInterface<int> {};

TEST_P(ClientOfADaemon, DaemonGone_everyClientIsToldAndANewDaemonServes) {
  GsdProcess daemon;
  setenv("GSD_ENDPOINT", daemon.endpoint().c_str(), 1);
  recorder().reset();
  open();
  Group group("mourning");
  const wyx_token_t first = joined(group, 1), second = joined(group, 2);
  wyx_token_t watcher = -1;
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
    EXPECT_TRUE(dispatch_until(fd(), [&] { return told(token, 0).ends_with("died\n"); }));
  }
  EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_NO_INIT);
  EXPECT_FALSE(readable(fd()));
  EXPECT_EQ(setup().rc, WYX_CONNECT_FAILED);
  daemon.restart();
  open();
  EXPECT_GT(joined(group), watcher);
}

INSTANTIATE_TEST_SUITE_P(Signals, ClientOfADaemon, testing::Values(SIGKILL, SIGTERM),
                         [](const auto& signal) { return signal.param == SIGKILL ? "Killed" : "Stopped"; });

}  // namespace
}  // namespace test_support
