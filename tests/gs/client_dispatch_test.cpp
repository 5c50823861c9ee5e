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

class ClientDispatch : public ClientTest {};

TEST_P(ClientDispatch, Descriptor_isReadableWhenThereIsSomethingAndOnlyThen) {
  EXPECT_FALSE(readable(fd()));
  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_OK);
  const wyx_token_t token = joined(Group("readable"));
  EXPECT_FALSE(readable(fd()));
  for (std::size_t round = 1; round <= 20; ++round) {
    ASSERT_EQ(send_message(token, "x"), WYX_OK);
    ASSERT_TRUE(readable(fd(), 60000));
    EXPECT_EQ(recorder().count(), round - 1) << "handed out before any dispatch";
    ASSERT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_OK);
    EXPECT_EQ(recorder().count(), round);
    EXPECT_FALSE(readable(fd()));
  }
}

TEST_P(ClientDispatch, PhaseEndedEarly_itsTimeLimitWakesNobody) {
  const wyx_token_t token = joined(Group("early"));
  ASSERT_EQ(change_state(token, "x", WYX_N_PHASE, 1), WYX_OK);
  ASSERT_TRUE(all_arrive(token, 1));
  ASSERT_EQ(vote(token, WYX_VOTE_APPROVE), WYX_OK);
  ASSERT_TRUE(all_arrive(token, 2));
  EXPECT_FALSE(readable(fd(), 1500));
}

TEST_P(ClientDispatch, Blocking_waitsUntilACallbackHasBeenCalledOrIsCancelled) {
  std::thread cancelled([] { wyx_dispatch(WYX_BLOCKING); });
  pthread_cancel(cancelled.native_handle());
  cancelled.join();

  auto waiter = std::async(std::launch::async, [] { return wyx_dispatch(WYX_BLOCKING); });
  Group group("blocking");
  wyx_token_t token = -1;
  ASSERT_EQ(join(group, 1, &token), WYX_OK);
  EXPECT_EQ(waiter.get(), WYX_OK);
  EXPECT_EQ(recorder().count(), 1u);
}

TEST_P(ClientDispatch, WhileACallbackRuns_othersRequestAndAreCancelledFreely) {
  const wyx_token_t token = joined(Group("busy"));
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
  const wyx_token_t token = joined(Group("entry"));
  std::atomic<int> results = 0;
  int kept = 0;
  std::thread requester([&] {
    pthread_cancel(pthread_self());
    errno = 77;
    int node = 0;
    results += send_message(token, "x") == WYX_OK;
    results += wyx_dispatch(WYX_NON_BLOCKING) == WYX_OK;
    results += wyx_get_node_number(&node) == WYX_OK;
    results += vote(token, WYX_VOTE_APPROVE) == WYX_VOTE_NOT_EXPECTED;
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
  static inline std::string read;
  static void approved(const wyx_approved_notification_t* n) {
    if (n->gs_protocol_type != WYX_PROVIDER_MESSAGE) return;
    read += value(*n->gs_proposal->gs_provider_message) + " ";
    if (depth++ > 0) return;
    EXPECT_EQ(send_message(n->gs_provider_token, "second"), WYX_OK);
    EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_OK);
    read += value(*n->gs_proposal->gs_provider_message);
  }
};

TEST_P(ClientDispatch, NestedInACallback_handsOutWhatFollowsAndSparesTheOuterRecords) {
  Nested::depth = 0;
  Nested::read.clear();
  Group group("nested");
  std::string local = "n";
  wyx_proposal_info_t info = join_info(group, 1, local);
  info._gs_protocol_info._gs_join_request.gs_protocol_approved_callback = Nested::approved;
  wyx_token_t token = -1;
  ASSERT_EQ(wyx_join(&token, &info), WYX_OK);
  ASSERT_EQ(send_message(token, "first"), WYX_OK);
  ASSERT_TRUE(dispatch_until(fd(), [] { return Nested::depth == 2; }));
  EXPECT_EQ(Nested::read, "first second first");
}

TEST_P(ClientDispatch, RequestsOfSeveralThreadsAndOfCallbacks_allArriveInOrder) {
  constexpr std::size_t kThreads = 4, kMessages = 50;
  const auto text_of = [](const Seen& seen) { return *seen.protocol().proposal.message; };
  std::vector<wyx_token_t> tokens;
  for (std::size_t i = 0; i < kThreads; ++i) tokens.push_back(joined(Group("group" + std::to_string(i))));
  recorder().set_hook([&](const Seen& seen) {
    if (!text_of(seen).starts_with("ask")) return;
    EXPECT_EQ(send_message(seen.token, "echo" + text_of(seen).substr(3)), WYX_OK);
  });
  const auto all_here = [&] { return recorder().count() == 2 * kThreads * kMessages; };
  std::vector<std::thread> threads;
  for (const wyx_token_t token : tokens) {
    threads.emplace_back([token] {
      for (std::size_t i = 0; i < kMessages; ++i)
        EXPECT_EQ(send_message(token, "ask" + std::to_string(i)), WYX_OK);
    });
  }
  threads.emplace_back([&] { dispatch_until(fd(), all_here); });
  EXPECT_TRUE(dispatch_until(fd(), all_here));
  for (std::thread& thread : threads) thread.join();

  for (const wyx_token_t token : tokens) {
    std::map<std::string, int> next;  // of the asked and the echoed
    std::uint64_t seqnum = recorder().of(token).front().protocol().seqnum;
    for (const Seen& seen : recorder().of(token)) {
      const std::string kind = text_of(seen).starts_with("echo") ? "echo" : "ask";
      EXPECT_EQ(seen.protocol().seqnum, seqnum++);
      EXPECT_EQ(text_of(seen), kind + std::to_string(next[kind]++));
    }
  }
}

TEST_P(ClientDispatch, Quit_insideACallback_endsTheDispatchAndAllowsANewSession) {
  const wyx_token_t token = joined(Group("quitter"));
  recorder().set_hook([](const Seen&) { EXPECT_EQ(wyx_quit(), WYX_OK); });
  ASSERT_EQ(send_message(token, "x"), WYX_OK);
  ASSERT_EQ(send_message(token, "y"), WYX_OK);
  ASSERT_TRUE(readable(fd(), 60000));
  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_OK);
  EXPECT_EQ(recorder().count(), 1u) << "nothing is handed out after it";
  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_NO_INIT);
  EXPECT_EQ(send_message(token, "x"), WYX_NO_INIT);
  EXPECT_EQ(wyx_quit(), WYX_NO_INIT);
  open();
  EXPECT_EQ(send_message(token, "x"), WYX_BAD_MEMBER_TOKEN);
}

TEST_P(ClientDispatch, Quit_whileOthersWait_bringsThemBack) {
  joined(Group("left"));
  std::vector<std::future<wyx_rc_t>> waiters;
  for (int i = 0; i < 3; ++i)
    waiters.push_back(std::async(std::launch::async, [] { return wyx_dispatch(WYX_BLOCKING); }));
  EXPECT_EQ(wyx_quit(), WYX_OK);
  for (auto& waiter : waiters) EXPECT_EQ(waiter.get(), WYX_NO_INIT);
  EXPECT_EQ(recorder().count(), 0u) << "nobody is told of an end that the application wanted";
}

TEST_P(ClientDispatch, Pings_areAnsweredByTheCallbacksResult) {
  wyx_responsiveness_t settings = {};
  settings.gs_responsiveness_type = WYX_PING_RESPONSIVENESS;
  settings.gs_responsiveness_interval = 1;
  settings.gs_responsiveness_response_time_limit = 30;
  const wyx_token_t token = joined(Group("pinged"));
  recorder().set_ping_result(WYX_CALLBACK_NOT_OK);
  ASSERT_EQ(wyx_change_responsiveness(&settings), WYX_OK);
  EXPECT_EQ(told(token), "announcement <no-response> 1\n");
  EXPECT_EQ(recorder().all()[0].type, WYX_RESPONSIVENESS_NOTIFICATION);
  EXPECT_EQ(recorder().all()[0].ping.gs_responsiveness_interval, 1u);
  recorder().set_ping_result(WYX_CALLBACK_OK);
  EXPECT_EQ(told(token, 2), "announcement <no-response> 1\nannouncement <response> 1\n");
}

INSTANTIATE_TEST_SUITE_P(Endpoints, ClientDispatch, kEndpoints, endpoint_name);

}  // namespace
}  // namespace test_support
