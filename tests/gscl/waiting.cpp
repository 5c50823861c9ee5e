// Waiting for notifications: what a wait reports, when it waits on, whose block is whose.
#include <atomic>
#include <thread>

#include "peek.h"
#include "recording_api.h"

namespace {

using namespace recording;
using peek::eventually;
using peek::inMillis;

constexpr wyx_notification_type_t kUntouched = WYX_NOTIFICATION_RESERVED_1;
constexpr int kMinute = 60000;
constexpr int kPast = -1000;

struct Outcome {
  GSWaitForRC rc;
  wyx_notification_type_t type = kUntouched;
  wyx_notification_summary_t summary = {kUntouched,          WYX_INTERNAL_REQUEST,   WYX_PROPOSED_MEMBERSHIP,
                                        WYX_PROVIDER_FAILED, WYX_SUBSCRIPTION_STATE, WYX_EXISTS};
};

Outcome waitFor(GSClient& client, long millis, int where = GS_TRIGGER_AFTER_CALLBACK) {
  Outcome out;
  const timespec until = inMillis(millis);
  out.rc = client.waitForNotification(static_cast<GSWaitForTriggerType>(where), &until, &out.type, &out.summary);
  return out;
}

class Waiting : public ClientTest {
 protected:
  Waiting() { GSSetDebugLevel(GSCL_TRC_DETAIL); }

  void change(GSProvider& provider) { provider.changeStateValue(kNoValue, WYX_1_PHASE, 0); }

  /// A thread that requests, waits for a minute and is asleep when this returns.
  std::thread startWaiter(Outcome& out) {
    std::thread waiter([this, &out] {
      change(member);
      out = waitFor(member, kMinute);
    });
    EXPECT_TRUE(looked("NOT_OK2"));
    return waiter;
  }
  /// Every look of a wait says how it went, before it sleeps.
  bool looked(const char* result) {
    return eventually([&] {
      const Lines lines = api.take();
      return std::any_of(lines.begin(), lines.end(), [&](auto& l) { return l.find(result) != l.npos; });
    });
  }
};

TEST_F(Waiting, UnsupportedForms_touchNothing) {
  member.joinGroup();
  for (int form : {0x1, 0x3, 0x202, 0x302, 0x201, 0x200}) {
    const Outcome out = waitFor(member, kPast, form);
    EXPECT_EQ(out.rc, GS_WAITFOR_NOT_SUPPORTED) << form;
    EXPECT_EQ(out.type, kUntouched);
    EXPECT_EQ(out.summary.gs_notification_type, kUntouched);
  }
  EXPECT_EQ(waitFor(member, kPast, 0x102).rc, GS_WAITFOR_PENDING);
  GSSetDebugLevel(GSCL_TRC_API);
  api.take();
  waitFor(member, kPast, 0x302);
  EXPECT_EQ(api.take(), Lines{"A waitFor where_what=202 not supported"});
}

TEST_F(Waiting, WithoutARequestOrADeadlineThatMakesSense_isAnError) {
  const timespec bad = {0, -1};
  const Outcome out = waitFor(member, kMinute);
  EXPECT_EQ(out.rc, GS_WAITFOR_ERROR);
  EXPECT_EQ(out.type, -1);
  EXPECT_EQ(member.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, nullptr, nullptr, nullptr), GS_WAITFOR_ERROR);
  member.joinGroup();
  EXPECT_EQ(member.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, &bad, nullptr, nullptr), GS_WAITFOR_EINVAL);
}

TEST_F(Waiting, Provider_waitsThroughThePhasesOfItsProtocol) {
  joined(member);
  Outcome out;
  std::thread waiter = startWaiter(out);
  phase(WYX_STATE_VALUE_CHANGE);
  EXPECT_TRUE(looked("NOT_OK3")) << "woken by the phase and asleep again";
  reject(WYX_STATE_VALUE_CHANGE);
  waiter.join();
  EXPECT_EQ(out.rc, GS_WAITFOR_RECEIVED);
  EXPECT_EQ(out.type, WYX_REJECTED_NOTIFICATION);
}

TEST_F(Waiting, ClientThatBecomesIdle_endsTheWaitAtItsNextWakeUp) {
  joined(member);
  Outcome out;
  std::thread waiter = startWaiter(out);
  // The waiter's block is answered with a phase, which does not satisfy it, of a leave, which makes the client
  // idle.
  phase(WYX_LEAVE);
  waiter.join();
  EXPECT_EQ(out.rc, GS_WAITFOR_NOT_A_MEMBER);
  EXPECT_EQ(out.type, -1);
}

TEST_F(Waiting, ClientThatBecameIdleUnnoticed_saysSoAtTheDeadline) {
  bool in_time = false;
  for (long millis = 50; !in_time; millis *= 2) {
    joined(member);
    const timespec until = inMillis(millis);
    GSWaitForRC rc = GS_WAITFOR_ERROR;
    std::thread waiter([&] {
      change(member);
      rc = member.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, &until, nullptr, nullptr);
    });
    EXPECT_TRUE(looked("NOT_OK2"));
    member.send_message({0, nullptr}, WYX_1_PHASE, 0);  // takes the wait mutex: the waiter has looked
    member.goodbyeGroup();                              // wakes nobody
    const timespec now = inMillis(0);
    in_time = now.tv_sec < until.tv_sec || (now.tv_sec == until.tv_sec && now.tv_nsec < until.tv_nsec);
    waiter.join();
    EXPECT_TRUE(!in_time || rc == GS_WAITFOR_NOT_A_MEMBER) << rc;
  }
}

TEST_F(Waiting, OnlyOwnProtocols_areRecordedInTheBlocks) {
  joined(member);
  change(member);
  approve(WYX_STATE_VALUE_CHANGE, {.by = kOther});
  approve(WYX_FAILURE_LEAVE);
  announce(WYX_RESPONSIVENESS_NO_RESPONSE);
  EXPECT_EQ(waitFor(member, kPast).rc, GS_WAITFOR_PENDING);
  member.action = [&] {
    member.action = nullptr;
    member.leaveGroup(0, WYX_1_PHASE, 0);
  };
  approve(WYX_STATE_VALUE_CHANGE);
  EXPECT_EQ(waitFor(member, kMinute).summary.gs_protocol_type, WYX_STATE_VALUE_CHANGE)
      << "the request of the callback has a new block, which gets the record that follows";
}

// Requests from threads of their own that go on when they are told to, so that all ids stay distinct.
class Requester {
 public:
  explicit Requester(GSProvider& provider)
      : thread_([&provider, this] {
          provider.changeStateValue(kNoValue, WYX_1_PHASE, 0);
          for (int done = 1;; ++done) {
            done_ = done;
            EXPECT_TRUE(eventually([&] { return go_on_ >= done; }));
            if (finish_) return;
            result_ = waitFor(provider, kPast).rc;
          }
        }) {
    EXPECT_TRUE(eventually([&] { return done_ == 1; }));
  }
  ~Requester() {
    finish_ = true;
    ++go_on_;
    thread_.join();
  }
  GSWaitForRC wait() {
    const int next = ++go_on_ + 1;
    EXPECT_TRUE(eventually([&] { return done_ == next; }));
    return result_;
  }

 private:
  std::atomic<int> done_{0}, go_on_{0};
  std::atomic<bool> finish_{false};
  std::atomic<GSWaitForRC> result_{GS_WAITFOR_NOT_REQUESTED};
  std::thread thread_;
};

TEST_F(Waiting, FifthThread_takesTheSatisfiedBlockElseTheOldest) {
  joined(member);  // this thread has the oldest block
  Requester a(member), b(member), c(member);
  approve(WYX_STATE_VALUE_CHANGE);
  EXPECT_EQ(b.wait(), GS_WAITFOR_RECEIVED);
  Requester d(member);  // takes b's block, the only satisfied one
  Requester e(member);  // takes the oldest, this thread's
  EXPECT_EQ(b.wait(), GS_WAITFOR_ERROR) << "has no block any more";
  EXPECT_EQ(waitFor(member, kPast).rc, GS_WAITFOR_ERROR);
  EXPECT_EQ(d.wait(), GS_WAITFOR_PENDING);
  EXPECT_EQ(e.wait(), GS_WAITFOR_PENDING);
  EXPECT_EQ(a.wait(), GS_WAITFOR_RECEIVED);
  EXPECT_EQ(c.wait(), GS_WAITFOR_RECEIVED);
}

TEST_F(Waiting, CancelledWait_givesTheMutexBack) {
  member.joinGroup();
  peek::CancellableThread thread([&] {
    member.joinGroup();
    member.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, nullptr, nullptr, nullptr);
  });
  ASSERT_TRUE(looked("NOT_OK2"));
  thread.cancel();
  EXPECT_TRUE(thread.join());
  approve(WYX_JOIN);
  EXPECT_EQ(waitFor(member, kMinute).rc, GS_WAITFOR_RECEIVED);
}

TEST_F(Waiting, CallbackThatThrows_endsTheWaitAllTheSame) {
  member.joinGroup();
  member.action = [] { throw 7; };
  EXPECT_THROW(approve(WYX_JOIN), int);
  EXPECT_EQ(waitFor(member, kPast).rc, GS_WAITFOR_RECEIVED);
}

TEST_F(Waiting, SequenceNumbers_areOfTheProcess) {
  static int last;
  GSSetTraceRtn([](int, char* text) { sscanf(text, "PassNotify (seq=%d", &last); });
  GSProvider other("h", 1, nullptr);
  int numbers[2];
  for (GSProvider* provider : {static_cast<GSProvider*>(&member), &other}) {
    api.token = provider == &member ? 12 : 13;
    joined(*provider);
    numbers[provider == &other] = last;
  }
  EXPECT_EQ(numbers[1], numbers[0] + 1);
}

}  // namespace
