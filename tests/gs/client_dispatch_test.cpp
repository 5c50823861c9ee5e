// When and on which thread notifications are handed out, and what may be done meanwhile.

#include <pthread.h>

#include <atomic>
#include <cerrno>
#include <future>
#include <latch>
#include <thread>

#include "support/client_fixture.h"

namespace test_support {
namespace {

class ClientDispatch : public ClientTest {
 protected:
  wyx_token_t joined(const std::string& group_name, short instance = 1) {
    Group group(group_name);
    wyx_token_t token = -1;
    EXPECT_EQ(join(group, instance, &token), WYX_OK);
    EXPECT_TRUE(dispatch_until(fd(), [&] { return recorder().count(token, WYX_APPROVED_NOTIFICATION) == 1; }));
    recorder().reset();
    return token;
  }
  bool all_arrive(wyx_token_t token, std::size_t count) {
    return dispatch_until(fd(), [&] { return recorder().of(token).size() == count; });
  }
};

TEST_P(ClientDispatch, Descriptor_isReadableWhenThereIsSomethingAndOnlyThen) {
  EXPECT_FALSE(readable(fd()));
  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_OK);
  const wyx_token_t token = joined("readable");
  EXPECT_FALSE(readable(fd()));
  for (std::size_t round = 1; round <= 20; ++round) {
    ASSERT_EQ(send_message(token, "x"), WYX_OK);
    ASSERT_TRUE(readable(fd(), 60000));
    EXPECT_EQ(recorder().of(token).size(), round - 1) << "handed out before any dispatch";
    ASSERT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_OK);
    EXPECT_EQ(recorder().of(token).size(), round);
    EXPECT_FALSE(readable(fd()));
  }
}

TEST_P(ClientDispatch, PhaseEndedEarly_itsTimeLimitWakesNobody) {
  const wyx_token_t token = joined("early");
  ASSERT_EQ(change_state(token, "x", WYX_N_PHASE, 1), WYX_OK);
  ASSERT_TRUE(all_arrive(token, 1));
  ASSERT_EQ(vote(token, WYX_VOTE_APPROVE), WYX_OK);
  ASSERT_TRUE(all_arrive(token, 2));
  EXPECT_FALSE(readable(fd(), 1500));
}

TEST_P(ClientDispatch, Blocking_waitsUntilACallbackHasBeenCalled) {
  Group group("blocking");
  auto waiter = std::async(std::launch::async, [] { return wyx_dispatch(WYX_BLOCKING); });
  wyx_token_t token = -1;
  ASSERT_EQ(join(group, 1, &token), WYX_OK);
  EXPECT_EQ(waiter.get(), WYX_OK);
  EXPECT_EQ(recorder().count(), 1u);
}

TEST_P(ClientDispatch, Blocking_cancelledWhileItWaits_leavesNothingHeld) {
  std::thread waiter([] { wyx_dispatch(WYX_BLOCKING); });
  pthread_cancel(waiter.native_handle());
  waiter.join();
  const wyx_token_t token = joined("cancelled");
  EXPECT_EQ(send_message(token, "x"), WYX_OK);
  EXPECT_TRUE(all_arrive(token, 1));
}

TEST_P(ClientDispatch, WhileACallbackRuns_othersRequestAndAreCancelledFreely) {
  const wyx_token_t token = joined("busy");
  std::latch inside(1), release(1);
  recorder().set_hook([&](const Seen&) {
    inside.count_down();
    release.wait();
  });
  ASSERT_EQ(send_message(token, "x"), WYX_OK);
  ASSERT_TRUE(readable(fd(), 60000));
  std::thread dispatcher([] { wyx_dispatch(WYX_NON_BLOCKING); });
  inside.wait();

  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_OK);
  Group other("other");
  wyx_token_t second = -1;
  EXPECT_EQ(join(other, 1, &second), WYX_OK);
  std::thread waiter([] { wyx_dispatch(WYX_BLOCKING); });  // for its turn
  pthread_cancel(waiter.native_handle());
  waiter.join();
  EXPECT_EQ(recorder().count(), 1u);

  recorder().set_hook(nullptr);
  release.count_down();
  dispatcher.join();
  EXPECT_TRUE(all_arrive(second, 1));
}

TEST_P(ClientDispatch, EntryPoints_areNoCancellationPointsAndKeepErrno) {
  const wyx_token_t token = joined("entry");
  std::atomic<int> results = 0;
  int kept = 0;
  std::thread requester([&] {
    pthread_cancel(pthread_self());
    errno = 77;
    results += send_message(token, "x") == WYX_OK;
    results += wyx_dispatch(WYX_NON_BLOCKING) == WYX_OK;
    int node = 0;
    results += wyx_get_node_number(&node) == WYX_OK;
    results += wyx_vote(token, WYX_VOTE_APPROVE, nullptr, nullptr, WYX_NULL_VOTE) == WYX_VOTE_NOT_EXPECTED;
    kept = errno;
    pthread_testcancel();
    results = -1;
  });
  requester.join();
  EXPECT_EQ(results, 4);
  EXPECT_EQ(kept, 77);
}

// The records of an outer callback, before and after a dispatch nested in it.
struct Nested {
  static inline int depth = 0;
  static inline std::string before, after, inner;
  static void approved(const wyx_approved_notification_t* n) {
    if (n->gs_protocol_type != WYX_PROVIDER_MESSAGE) return;
    if (depth++ > 0) {
      inner = *copy(n->gs_proposal->gs_provider_message);
      return;
    }
    before = *copy(n->gs_proposal->gs_provider_message);
    EXPECT_EQ(send_message(n->gs_provider_token, "second"), WYX_OK);
    EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_OK);
    after = *copy(n->gs_proposal->gs_provider_message);
  }
};

TEST_P(ClientDispatch, NestedInACallback_handsOutWhatFollowsAndSparesTheOuterRecords) {
  Nested::depth = 0;
  Group group("nested");
  std::string local = "n";
  wyx_proposal_info_t info = join_info(group, 1, local);
  info._gs_protocol_info._gs_join_request.gs_protocol_approved_callback = Nested::approved;
  wyx_token_t token = -1;
  ASSERT_EQ(wyx_join(&token, &info), WYX_OK);
  ASSERT_EQ(send_message(token, "first"), WYX_OK);
  ASSERT_TRUE(dispatch_until(fd(), [] { return !Nested::after.empty(); }));
  EXPECT_EQ(Nested::before, "first");
  EXPECT_EQ(Nested::inner, "second");
  EXPECT_EQ(Nested::after, "first");
}

TEST_P(ClientDispatch, RequestsOfSeveralThreadsAndOfCallbacks_allArriveInOrder) {
  constexpr int kThreads = 4;
  constexpr int kMessages = 50;
  std::vector<wyx_token_t> tokens;
  for (int i = 0; i < kThreads; ++i) tokens.push_back(joined("group" + std::to_string(i)));
  recorder().set_hook([](const Seen& seen) {
    if (!seen.message->starts_with("ask")) return;
    EXPECT_EQ(send_message(seen.token, "echo" + *seen.message), WYX_OK);
  });
  std::vector<std::thread> senders;
  for (const wyx_token_t token : tokens) {
    senders.emplace_back([token] {
      for (int i = 0; i < kMessages; ++i) EXPECT_EQ(send_message(token, "ask" + std::to_string(i)), WYX_OK);
    });
  }
  std::thread second_dispatcher(
      [&] { dispatch_until(fd(), [&] { return recorder().count() == 2 * kThreads * kMessages; }); });
  EXPECT_TRUE(dispatch_until(fd(), [&] { return recorder().count() == 2 * kThreads * kMessages; }));
  for (std::thread& sender : senders) sender.join();
  second_dispatcher.join();

  for (const wyx_token_t token : tokens) {
    const auto seen = recorder().of(token);
    int asked = 0, echoed = 0;
    uint64_t seqnum = seen.empty() ? 0 : seen[0].seqnum;
    for (const Seen& one : seen) {
      EXPECT_EQ(one.seqnum, seqnum++);
      const bool echo = one.message->starts_with("echo");
      EXPECT_EQ(*one.message, echo ? "echoask" + std::to_string(echoed++) : "ask" + std::to_string(asked++));
    }
  }
}

TEST_P(ClientDispatch, Quit_insideACallback_endsTheDispatchAndAllowsANewSession) {
  const wyx_token_t token = joined("quitter");
  recorder().set_hook([](const Seen&) { EXPECT_EQ(wyx_quit(), WYX_OK); });
  ASSERT_EQ(send_message(token, "x"), WYX_OK);
  ASSERT_TRUE(readable(fd(), 60000));
  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_OK);
  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_NO_INIT);
  EXPECT_EQ(send_message(token, "x"), WYX_NO_INIT);
  EXPECT_EQ(wyx_quit(), WYX_NO_INIT);
  EXPECT_EQ(setup().rc, WYX_OK);
  EXPECT_EQ(send_message(token, "x"), WYX_BAD_MEMBER_TOKEN);
}

TEST_P(ClientDispatch, Quit_whileOthersWait_bringsThemBack) {
  joined("left");
  std::vector<std::future<wyx_rc_t>> waiters;
  for (int i = 0; i < 3; ++i) {
    waiters.push_back(std::async(std::launch::async, [] { return wyx_dispatch(WYX_BLOCKING); }));
  }
  EXPECT_EQ(wyx_quit(), WYX_OK);
  for (auto& waiter : waiters) EXPECT_EQ(waiter.get(), WYX_NO_INIT);
  EXPECT_EQ(recorder().count(), 0u) << "nobody is told of an end that the application wanted";
}

TEST_P(ClientDispatch, Pings_areAnsweredByTheCallbacksResult) {
  wyx_responsiveness_t settings = {};
  settings.gs_responsiveness_type = WYX_PING_RESPONSIVENESS;
  settings.gs_responsiveness_interval = 1;
  settings.gs_responsiveness_response_time_limit = 30;
  const wyx_token_t token = joined("pinged");
  recorder().set_ping_result(WYX_CALLBACK_NOT_OK);
  ASSERT_EQ(wyx_change_responsiveness(&settings), WYX_OK);
  ASSERT_TRUE(all_arrive(token, 1));
  EXPECT_EQ(recorder().of(token)[0].summary, static_cast<unsigned>(WYX_RESPONSIVENESS_NO_RESPONSE));
  EXPECT_EQ(recorder().of(token)[0].members, std::vector<int>{1});
  EXPECT_EQ(recorder().all()[0].type, WYX_RESPONSIVENESS_NOTIFICATION);
  EXPECT_EQ(recorder().all()[0].time_limit, 1) << "the interval that was asked for";
  recorder().set_ping_result(WYX_CALLBACK_OK);
  ASSERT_TRUE(all_arrive(token, 2));
  EXPECT_EQ(recorder().of(token)[1].summary, static_cast<unsigned>(WYX_RESPONSIVENESS_RESPONSE));
}

INSTANTIATE_TEST_SUITE_P(Endpoints, ClientDispatch, kEndpoints, endpoint_name);

}  // namespace
}  // namespace test_support
