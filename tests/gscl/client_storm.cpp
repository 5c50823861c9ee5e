// Requests, waits, dispatch, construction and destruction of clients on many threads at once. What it shows beyond
// its expectations it shows under the thread and address sanitizers.
#include <atomic>
#include <memory>
#include <thread>

#include "fake_daemon.h"
#include "lock_peek.h"

namespace {

using namespace zelt_gscl_V1;
using fake_daemon::FakeDaemon;
using lock_peek::inMillis;

constexpr int kWorkers = 4;
constexpr int kDispatchers = 3;
constexpr int kRounds = 60;
constexpr int kMinute = 60000;

zelt_gscl::GSWaitForRC waitFor(GSClient& client, wyx_notification_type_t* type) {
  const timespec until = inMillis(kMinute);
  return client.waitForNotification(zelt_gscl::GS_TRIGGER_AFTER_CALLBACK, &until, type, nullptr);
}

/// Dispatches on several threads until it is destroyed.
class Dispatchers {
 public:
  explicit Dispatchers(GSController& controller) {
    for (int i = 0; i < kDispatchers; ++i) {
      threads_.emplace_back([this, &controller] {
        while (!stop_) {
          if (controller.dispatch(WYX_NON_BLOCKING) != WYX_OK) std::this_thread::yield();
        }
      });
    }
  }
  ~Dispatchers() {
    stop_ = true;
    for (std::thread& thread : threads_) thread.join();
  }
  Dispatchers(const Dispatchers&) = delete;
  Dispatchers& operator=(const Dispatchers&) = delete;

 private:
  std::atomic<bool> stop_{false};
  std::vector<std::thread> threads_;
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
  static std::atomic<int> vanished;
};
std::atomic<int> Vanishing::vanished{0};

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
  EXPECT_EQ(waitFor(provider, nullptr), zelt_gscl::GS_WAITFOR_RECEIVED);
  EXPECT_EQ(provider.changeStateValue(wyx_state_value_t{0, nullptr}, WYX_1_PHASE, 0), WYX_OK);
  EXPECT_EQ(waitFor(provider, nullptr), zelt_gscl::GS_WAITFOR_RECEIVED);
  EXPECT_EQ(provider.approved, 2);
}

void lifeOfAMember(short instance, int round) {
  GSProvider provider("storm", instance, nullptr);
  wyx_notification_type_t type;
  EXPECT_EQ(provider.joinGroup(), WYX_OK);
  EXPECT_EQ(waitFor(provider, &type), zelt_gscl::GS_WAITFOR_RECEIVED);
  EXPECT_EQ(provider.getMemberCount(), 8);
  EXPECT_EQ(provider.changeStateValue(wyx_state_value_t{0, nullptr}, WYX_1_PHASE, 0), WYX_OK);
  if (round % 4 == 1) return;  // gone with a notification on its way
  EXPECT_EQ(waitFor(provider, &type), zelt_gscl::GS_WAITFOR_RECEIVED);
  EXPECT_EQ(type, WYX_APPROVED_NOTIFICATION);
  GSStateValue value;
  EXPECT_EQ(provider.getCurrentStateValue(value), 1);
  if (round % 4 == 2) {
    EXPECT_EQ(provider.goodbyeGroup(), WYX_OK);
    return;
  }
  EXPECT_EQ(provider.leaveGroup(0, WYX_1_PHASE, 0), WYX_OK);
  // The leave makes the client idle before it is reported; either is an end.
  const auto rc = waitFor(provider, nullptr);
  EXPECT_TRUE(rc == zelt_gscl::GS_WAITFOR_RECEIVED || rc == zelt_gscl::GS_WAITFOR_NOT_A_MEMBER) << rc;
}

void lifeOfASubscriber(int round) {
  GSSubscriber subscriber("storm", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP);
  EXPECT_EQ(subscriber.subscribeGroup(), WYX_OK);
  if (round % 3 == 0) return;  // still subscribing: the destructor takes the subscription back
  EXPECT_EQ(waitFor(subscriber, nullptr), zelt_gscl::GS_WAITFOR_RECEIVED);
  GSMembershipList members;
  EXPECT_EQ(subscriber.getMembers(members), 1);
  EXPECT_EQ(members.count(), 8);
}

/// Every trace line is made, then dropped.
class TraceIntoNothing {
 public:
  TraceIntoNothing() : before_(GSSetTraceRtn([](int, char*) {})) {
    GSSetDebugLevel(GSCL_TRC_API | GSCL_TRC_DETAIL | GSCL_TRC_WARNING);
  }
  ~TraceIntoNothing() {
    GSSetDebugLevel(0);
    GSSetTraceRtn(before_);
  }
  TraceIntoNothing(const TraceIntoNothing&) = delete;
  TraceIntoNothing& operator=(const TraceIntoNothing&) = delete;

 private:
  gscl_tracef_rtn before_;
};

TEST(ClientStorm, EverythingAtOnce) {
  TraceIntoNothing trace;
  FakeDaemon daemon;
  GSController controller;
  Vanishing::vanished = 0;
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
      EXPECT_EQ(waitFor(*vanishing, nullptr), zelt_gscl::GS_WAITFOR_RECEIVED);
      wyx_proposal_info_t proposal = {};
      const wyx_token_t token = vanishing->getToken();
      EXPECT_EQ(GSAPIRtns->wyx_change_state_value(token, &proposal), WYX_OK);
    }
    for (std::thread& worker : workers) worker.join();
    EXPECT_TRUE(lock_peek::eventually([] { return Vanishing::vanished == kRounds; }));
  }
}

TEST(ClientStorm, OneClient_requestsAndWaitsOfSeveralThreads) {
  FakeDaemon daemon;
  GSController controller;
  GSProvider provider("storm", 1, nullptr);
  Dispatchers dispatchers(controller);
  ASSERT_EQ(provider.joinGroup(), WYX_OK);
  ASSERT_EQ(waitFor(provider, nullptr), zelt_gscl::GS_WAITFOR_RECEIVED);
  std::vector<std::thread> workers;
  // The joiner holds one of the four blocks.
  for (int worker = 0; worker < 3; ++worker) {
    workers.emplace_back([&] {
      char text[] = "message";
      for (int round = 0; round < 4 * kRounds; ++round) {
        EXPECT_EQ(provider.send_message({7, text}, WYX_1_PHASE, 0), WYX_OK);
        EXPECT_EQ(waitFor(provider, nullptr), zelt_gscl::GS_WAITFOR_RECEIVED);
      }
    });
  }
  for (std::thread& worker : workers) worker.join();
  provider.goodbyeGroup();
}

}  // namespace
