// Requests, waits, dispatch, construction and destruction of clients on many threads at once; what that shows
// beyond its expectations it shows under the thread and address sanitizers. And no allocation in steady state.
#include <atomic>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "peek.h"
#include "recording_api.h"
#include "tests/support/allocations.h"

namespace {

using namespace zelt_gscl_V1;
using recording::kNoValue;
using zelt_gscl::GS_WAITFOR_RECEIVED;

constexpr int kWorkers = 4;
constexpr int kRounds = 60;

/// A base API that answers like a daemon: a request is accepted and its notification queued; dispatch hands queued
/// notifications to the callbacks. It allocates nothing once its tables have grown. One at a time.
class FakeDaemon {
 public:
  FakeDaemon() : table_before_(GSAPIRtns) {
    using Info = const wyx_proposal_info_t*;
    the_daemon = this;
    queue_.reserve(1 << 16);
    table_.wyx_join = [](wyx_token_t* t, Info) { return enter(t, WYX_JOIN); };
    table_.wyx_subscribe = [](wyx_token_t* t, Info) { return enter(t, WYX_SUBSCRIPTION); };
    table_.wyx_change_state_value = [](wyx_token_t t, Info) { return post(t, WYX_STATE_VALUE_CHANGE); };
    table_.wyx_send_message = [](wyx_token_t t, Info) { return post(t, WYX_PROVIDER_MESSAGE); };
    table_.wyx_leave = [](wyx_token_t t, Info) { return post(t, WYX_LEAVE); };
    table_.wyx_goodbye = table_.wyx_unsubscribe = [](wyx_token_t) { return WYX_OK; };
    table_.wyx_vote = [](auto...) { return WYX_OK; };
    table_.wyx_dispatch = [](wyx_dispatch_flag_t) { return dispatch(); };
    GSAPIRtns = &table_;
  }
  ~FakeDaemon() { GSAPIRtns = table_before_; }
  FakeDaemon(const FakeDaemon&) = delete;
  FakeDaemon& operator=(const FakeDaemon&) = delete;

 private:
  struct Event {
    wyx_token_t token;
    wyx_request_t protocol;  // WYX_SUBSCRIPTION for a subscription notification
  };

  static wyx_rc_t enter(wyx_token_t* token, wyx_request_t protocol) {
    static std::atomic<wyx_token_t> last{0};
    return post(*token = ++last, protocol);
  }
  static wyx_rc_t post(wyx_token_t token, wyx_request_t protocol) {
    std::lock_guard<std::mutex> lock(the_daemon->mutex_);
    the_daemon->queue_.push_back({token, protocol});
    return WYX_OK;
  }
  static wyx_rc_t dispatch() {
    FakeDaemon& d = *the_daemon;
    std::unique_lock<std::mutex> lock(d.mutex_);
    if (d.head_ == d.queue_.size()) {
      d.queue_.clear();
      d.head_ = 0;
      return WYX_NOT_OK;
    }
    const Event event = d.queue_[d.head_++];
    lock.unlock();
    deliver(event);
    return WYX_OK;
  }
  static void deliver(const Event& event) {
    thread_local recording::Says says = {.changed = WYX_UPDATED_MEMBERSHIP,
                                         .current = std::string(64, 'v'),
                                         .members = std::vector<wyx_provider_t>(8)};
    says.to = event.token;
    says.by = wyx_provider_t{{1, static_cast<short>(event.token)}};
    if (event.protocol != WYX_SUBSCRIPTION) return recording::approve(event.protocol, says);
    recording::subscription(WYX_SUBSCRIPTION_MEMBERSHIP | WYX_SUBSCRIPTION_STATE, says);
  }

  static inline FakeDaemon* the_daemon = nullptr;
  std::mutex mutex_;
  std::vector<Event> queue_;  // oldest at head_
  size_t head_ = 0;
  GSAPIRtnCollection_t table_ = {};
  GSAPIRtnCollection_t* table_before_;
};

zelt_gscl::GSWaitForRC waitFor(GSClient& client, wyx_notification_type_t* type = nullptr) {
  const timespec until = peek::inMillis(60000);
  return client.waitForNotification(zelt_gscl::GS_TRIGGER_AFTER_CALLBACK, &until, type, nullptr);
}

/// Dispatches on several threads until it is destroyed.
class Dispatchers {
 public:
  explicit Dispatchers(GSController& controller) {
    for (std::jthread& thread : threads_) {
      thread = std::jthread([&controller](std::stop_token stop) {
        while (!stop.stop_requested()) {
          if (controller.dispatch(WYX_NON_BLOCKING) != WYX_OK) std::this_thread::yield();
        }
      });
    }
  }

 private:
  std::jthread threads_[3];
};

// Destroyed from within its own callback, when its state value changes.
class Vanishing : public GSProvider {
 public:
  using GSProvider::GSProvider;
  void approvedCb(const wyx_approved_notification_t* n) override {
    if (n->gs_protocol_type != WYX_STATE_VALUE_CHANGE) return;
    ++vanished;
    delete this;
  }
  static inline std::atomic<int> vanished{0};
};

// Of a class of its own, destroyed on another thread when its last notification has been waited for.
class Counting : public GSProvider {
 public:
  using GSProvider::GSProvider;
  void approvedCb(const wyx_approved_notification_t*) override { ++approved; }
  int approved = 0;  // ordered by dispatch and wait
};

void lifeOfACounter(short instance) {
  Counting provider("storm", instance, nullptr);
  EXPECT_EQ(provider.joinGroup(), WYX_OK);
  EXPECT_EQ(waitFor(provider), GS_WAITFOR_RECEIVED);
  EXPECT_EQ(provider.changeStateValue(kNoValue, WYX_1_PHASE, 0), WYX_OK);
  EXPECT_EQ(waitFor(provider), GS_WAITFOR_RECEIVED);
  EXPECT_EQ(provider.approved, 2);
}

void lifeOfAMember(short instance, int round) {
  GSProvider provider("storm", instance, nullptr);
  wyx_notification_type_t type;
  EXPECT_EQ(provider.joinGroup(), WYX_OK);
  EXPECT_EQ(waitFor(provider), GS_WAITFOR_RECEIVED);
  EXPECT_EQ(provider.getMemberCount(), 8);
  EXPECT_EQ(provider.changeStateValue(kNoValue, WYX_1_PHASE, 0), WYX_OK);
  if (round % 4 == 1) return;  // gone with a notification on its way
  EXPECT_EQ(waitFor(provider, &type), GS_WAITFOR_RECEIVED);
  EXPECT_EQ(type, WYX_APPROVED_NOTIFICATION);
  GSStateValue value;
  EXPECT_EQ(provider.getCurrentStateValue(value), 1);
  if (round % 4 == 2) {
    EXPECT_EQ(provider.goodbyeGroup(), WYX_OK);
  } else if (round % 4 == 3) {
    EXPECT_EQ(provider.leaveGroup(0, WYX_1_PHASE, 0), WYX_OK);
    // The leave makes the client idle before it is reported; either is an end.
    EXPECT_THAT(waitFor(provider), testing::AnyOf(GS_WAITFOR_RECEIVED, zelt_gscl::GS_WAITFOR_NOT_A_MEMBER));
  }
}

void lifeOfASubscriber(int round) {
  GSSubscriber subscriber("storm", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP);
  EXPECT_EQ(subscriber.subscribeGroup(), WYX_OK);
  if (round % 3 == 0) return;  // still subscribing: the destructor takes the subscription back
  EXPECT_EQ(waitFor(subscriber), GS_WAITFOR_RECEIVED);
  GSMembershipList members;
  EXPECT_EQ(subscriber.getMembers(members), 1);
  EXPECT_EQ(members.count(), 8);
}

TEST(ClientStorm, EverythingAtOnce) {
  const gscl_tracef_rtn before = GSSetTraceRtn([](int, char*) {});  // every line is made, then dropped
  GSSetDebugLevel(GSCL_TRC_API | GSCL_TRC_DETAIL | GSCL_TRC_WARNING);
  FakeDaemon daemon;
  GSController controller;
  {
    Dispatchers dispatchers(controller);
    std::vector<std::thread> workers;
    for (int worker = 0; worker < kWorkers; ++worker) {
      workers.emplace_back([worker] {
        for (int round = 0; round < kRounds; ++round) {
          lifeOfAMember(static_cast<short>(worker), round);
          lifeOfASubscriber(round);
          lifeOfACounter(static_cast<short>(worker));
        }
      });
    }
    // Waits until it is joined, then asks for its own end and touches it no more.
    for (int i = 0; i < kRounds; ++i) {
      auto* vanishing = new Vanishing("storm", 100, nullptr);
      EXPECT_EQ(vanishing->joinGroup(), WYX_OK);
      EXPECT_EQ(waitFor(*vanishing), GS_WAITFOR_RECEIVED);
      EXPECT_EQ(GSAPIRtns->wyx_change_state_value(vanishing->getToken(), nullptr), WYX_OK);
    }
    for (std::thread& worker : workers) worker.join();
    EXPECT_TRUE(peek::eventually([] { return Vanishing::vanished == kRounds; }));
  }
  GSSetDebugLevel(0);
  GSSetTraceRtn(before);
}

TEST(ClientStorm, OneClient_requestsAndWaitsOfSeveralThreads) {
  FakeDaemon daemon;
  GSController controller;
  GSProvider provider("storm", 1, nullptr);
  Dispatchers dispatchers(controller);
  ASSERT_EQ(provider.joinGroup(), WYX_OK);
  ASSERT_EQ(waitFor(provider), GS_WAITFOR_RECEIVED);
  std::vector<std::thread> workers;
  // The joiner holds one of the four blocks.
  for (int worker = 0; worker < 3; ++worker) {
    workers.emplace_back([&] {
      for (int round = 0; round < 4 * kRounds; ++round) {
        EXPECT_EQ(provider.send_message({0, nullptr}, WYX_1_PHASE, 0), WYX_OK);
        EXPECT_EQ(waitFor(provider), GS_WAITFOR_RECEIVED);
      }
    });
  }
  for (std::thread& worker : workers) worker.join();
  provider.goodbyeGroup();
}

TEST(SteadyState, RequestRoutingAndWaiting_allocateNothing) {
  FakeDaemon daemon;
  GSController controller;
  GSProvider provider("steady", 1, nullptr);
  GSSubscriber subscriber("steady", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP);
  GSMembershipList members;
  GSStateValue value;
  if (!allocations::kControlled) GTEST_SKIP() << "nothing is counted in this build";
  const auto answered = [&](GSClient& client) {
    while (controller.dispatch(WYX_NON_BLOCKING) == WYX_OK) {
    }
    return waitFor(client) == GS_WAITFOR_RECEIVED;
  };
  const auto round = [&] {
    return provider.joinGroup() == WYX_OK && answered(provider) &&
           provider.changeStateValue(kNoValue, WYX_1_PHASE, 0) == WYX_OK && answered(provider) &&
           provider.send_message({0, nullptr}, WYX_1_PHASE, 0) == WYX_OK && answered(provider) &&
           provider.vote(WYX_VOTE_APPROVE, WYX_NULL_VOTE, nullptr, nullptr) == WYX_OK &&
           subscriber.subscribeGroup() == WYX_OK && answered(subscriber) && provider.getMembers(members) == 1 &&
           provider.getCurrentStateValue(value) == 1 && subscriber.unsubscribeGroup() == WYX_OK &&
           provider.goodbyeGroup() == WYX_OK;
  };
  const long first = allocations::count();
  ASSERT_TRUE(round()) << "grows what must grow";
  const long before = allocations::count();
  ASSERT_GT(before, first) << "what the library allocates is counted";
  bool good = true;
  for (int i = 0; i < 100; ++i) good = round() && good;
  EXPECT_EQ(allocations::count(), before);
  EXPECT_TRUE(good);
}

}  // namespace
