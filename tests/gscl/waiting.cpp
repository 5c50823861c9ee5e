// Waiting for notifications: what a wait reports, when it waits on, whose block is whose.
#include <atomic>
#include <thread>

#include "lock_peek.h"
#include "recording_api.h"

namespace {

using namespace recording;
using lock_peek::eventually;
using lock_peek::inMillis;
using Lines = std::vector<std::string>;

constexpr wyx_notification_type_t kUntouched = WYX_NOTIFICATION_RESERVED_1;
constexpr int kMinute = 60000;

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

// A thread's number of requests so far in this process, read off the trace.
class Waiting : public testing::Test {
 protected:
  RecordingApi api{GSCL_TRC_DETAIL};
  GSController controller;
  Member member{"g", 3, nullptr};
  Watcher watcher{"g", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP};

  void approve(wyx_request_t protocol, wyx_provider_t by = ownId(), int changed = 0) {
    Proposal proposal(by, changed);
    const auto n = proposal.approved(protocol);
    GSController::stub_approvedCb(&n);
  }
  bool waiterAsleep() {
    // Every wait says so at its first look, before it sleeps.
    for (const std::string& line : api.take()) {
      if (line.find("NOT_OK2") != line.npos) return true;
    }
    return false;
  }
};

TEST_F(Waiting, NotificationBeforeTheWait_isNotLostAndNotReportedTwice) {
  member.joinGroup();
  approve(WYX_JOIN, ownId(), WYX_UPDATED_MEMBERSHIP);
  const Outcome first = waitFor(member, kMinute);
  EXPECT_EQ(first.rc, GS_WAITFOR_RECEIVED);
  EXPECT_EQ(first.type, WYX_APPROVED_NOTIFICATION);
  EXPECT_EQ(first.summary.gs_notification_type, WYX_APPROVED_NOTIFICATION);
  EXPECT_EQ(first.summary.gs_protocol_type, WYX_JOIN);
  EXPECT_EQ(first.summary.gs_whats_changed, WYX_UPDATED_MEMBERSHIP);
  EXPECT_EQ(first.summary.gs_summary_code, WYX_EXPLICIT_APPROVE);
  EXPECT_EQ(first.summary.gs_subscription_type, 0);
  EXPECT_EQ(first.summary.gs_delayed_return_code, WYX_OK);
  const Outcome second = waitFor(member, -1000);
  EXPECT_EQ(second.rc, GS_WAITFOR_PENDING);
  EXPECT_EQ(second.type, -1);
  EXPECT_EQ(second.summary.gs_notification_type, -1);
  EXPECT_EQ(second.summary.gs_protocol_type, -1);
  EXPECT_EQ(second.summary.gs_whats_changed, WYX_PROPOSED_MEMBERSHIP) << "left alone";
  approve(WYX_STATE_VALUE_CHANGE);
  EXPECT_EQ(waitFor(member, -1000).rc, GS_WAITFOR_PENDING) << "a satisfied block records nothing";
}

TEST_F(Waiting, SummaryByNotification) {
  joined(member);
  member.leaveGroup(0, WYX_1_PHASE, 0);
  const auto error = delayedError(WYX_LEAVE, WYX_COLLIDE);
  GSController::stub_delayedErrorCb(&error);
  Outcome out = waitFor(member, kMinute);
  EXPECT_EQ(out.summary.gs_protocol_type, WYX_LEAVE);
  EXPECT_EQ(out.summary.gs_delayed_return_code, WYX_COLLIDE);
  EXPECT_EQ(out.summary.gs_summary_code, 0);

  member.leaveGroup(0, WYX_1_PHASE, 0);
  const auto gone = announcement(WYX_GROUP_DISSOLVED);
  GSController::stub_announcementCb(&gone);
  out = waitFor(member, kMinute);
  EXPECT_EQ(out.rc, GS_WAITFOR_RECEIVED) << "recorded, so it counts although the client is idle";
  EXPECT_EQ(out.type, WYX_ANNOUNCEMENT_NOTIFICATION);
  EXPECT_EQ(out.summary.gs_protocol_type, -1);
  EXPECT_EQ(out.summary.gs_summary_code, WYX_GROUP_DISSOLVED);

  watcher.subscribeGroup();
  const auto n = subscription(WYX_SUBSCRIPTION_STATE | WYX_SUBSCRIPTION_MEMBERSHIP);
  GSController::stub_subscribeCb(&n);
  out = waitFor(watcher, kMinute);
  EXPECT_EQ(out.summary.gs_protocol_type, WYX_SUBSCRIPTION);
  EXPECT_EQ(out.summary.gs_subscription_type, 0x9);
}

TEST_F(Waiting, UnsupportedForms_touchNothing) {
  member.joinGroup();
  for (int form : {0x1, 0x3, 0x202, 0x302, 0x201, 0x200}) {
    const Outcome out = waitFor(member, -1000, form);
    EXPECT_EQ(out.rc, GS_WAITFOR_NOT_SUPPORTED) << form;
    EXPECT_EQ(out.type, kUntouched);
    EXPECT_EQ(out.summary.gs_notification_type, kUntouched);
  }
  EXPECT_EQ(waitFor(member, -1000, 0x102).rc, GS_WAITFOR_PENDING);
  GSSetDebugLevel(GSCL_TRC_API);
  api.take();
  waitFor(member, -1000, 0x302);
  EXPECT_EQ(api.take(), Lines{"A waitFor where_what=202 not supported"});
}

TEST_F(Waiting, WithoutARequest_isAnError) {
  const Outcome out = waitFor(member, kMinute);
  EXPECT_EQ(out.rc, GS_WAITFOR_ERROR);
  EXPECT_EQ(out.type, -1);
  EXPECT_EQ(out.summary.gs_protocol_type, -1);
  EXPECT_EQ(member.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, nullptr, nullptr, nullptr), GS_WAITFOR_ERROR);
}

TEST_F(Waiting, BadDeadline_isReportedAsSuch) {
  member.joinGroup();
  const timespec bad = {0, -1};
  EXPECT_EQ(member.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, &bad, nullptr, nullptr), GS_WAITFOR_EINVAL);
}

TEST_F(Waiting, Provider_waitsThroughThePhasesOfItsProtocol) {
  joined(member);
  std::atomic<bool> done{false};
  Outcome out;
  std::thread waiter([&] {
    member.changeStateValue(wyx_state_value_t{0, nullptr}, WYX_N_PHASE, 0);
    out = waitFor(member, kMinute);
    done = true;
  });
  ASSERT_TRUE(eventually([&] { return waiterAsleep(); }));
  Proposal proposal(ownId());
  const auto phase = proposal.phase(WYX_STATE_VALUE_CHANGE, 1);
  GSController::stub_nPhaseCb(&phase);
  ASSERT_TRUE(eventually([&] {
    const Lines lines = api.take();
    return std::any_of(lines.begin(), lines.end(), [](auto& l) { return l.find("NOT_OK3") != l.npos; });
  })) << "woken by the phase and asleep again";
  EXPECT_FALSE(done);
  const auto rejected = proposal.rejected(WYX_STATE_VALUE_CHANGE);
  GSController::stub_rejectedCb(&rejected);
  waiter.join();
  EXPECT_EQ(out.rc, GS_WAITFOR_RECEIVED);
  EXPECT_EQ(out.type, WYX_REJECTED_NOTIFICATION);
}

TEST_F(Waiting, ClientThatBecomesIdle_endsTheWaitAtItsNextWakeUp) {
  joined(member);
  Outcome out;
  std::thread waiter([&] {
    member.changeStateValue(wyx_state_value_t{0, nullptr}, WYX_1_PHASE, 0);
    out = waitFor(member, kMinute);
  });
  ASSERT_TRUE(eventually([&] { return waiterAsleep(); }));
  // The waiter's block is answered with a phase, which does not satisfy it, of a leave, which makes the client
  // idle.
  Proposal proposal(ownId());
  const auto phase = proposal.phase(WYX_LEAVE, 1);
  GSController::stub_nPhaseCb(&phase);
  waiter.join();
  EXPECT_EQ(out.rc, GS_WAITFOR_NOT_A_MEMBER);
  EXPECT_EQ(out.type, -1);
}

TEST_F(Waiting, ClientThatBecameIdleUnnoticed_saysSoAtTheDeadline) {
  for (long millis = 50;; millis *= 2) {
    joined(member);
    const timespec until = inMillis(millis);
    GSWaitForRC rc = GS_WAITFOR_ERROR;
    std::thread waiter([&] {
      member.changeStateValue(wyx_state_value_t{0, nullptr}, WYX_1_PHASE, 0);
      rc = member.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, &until, nullptr, nullptr);
    });
    ASSERT_TRUE(eventually([&] { return waiterAsleep(); }));
    member.send_message({0, nullptr}, WYX_1_PHASE, 0);  // takes the wait mutex: the waiter has looked
    member.goodbyeGroup();                              // wakes nobody
    const timespec now = inMillis(0);
    const bool in_time = now.tv_sec < until.tv_sec || (now.tv_sec == until.tv_sec && now.tv_nsec < until.tv_nsec);
    waiter.join();
    if (!in_time) continue;
    EXPECT_EQ(rc, GS_WAITFOR_NOT_A_MEMBER);
    return;
  }
}

TEST_F(Waiting, OthersProtocols_leaveTheBlocksAlone) {
  joined(member);
  member.changeStateValue(wyx_state_value_t{0, nullptr}, WYX_1_PHASE, 0);
  approve(WYX_STATE_VALUE_CHANGE, otherId());
  approve(WYX_FAILURE_LEAVE, ownId());
  const auto ordinary = announcement(WYX_RESPONSIVENESS_NO_RESPONSE);
  GSController::stub_announcementCb(&ordinary);
  EXPECT_EQ(waitFor(member, -1000).rc, GS_WAITFOR_PENDING);
}

TEST_F(Waiting, CallbackThatRequestsAgain_getsTheAfterRecordInItsNewBlock) {
  joined(member);
  member.action = [&] {
    member.action = nullptr;
    member.leaveGroup(0, WYX_1_PHASE, 0);
  };
  approve(WYX_STATE_VALUE_CHANGE);
  EXPECT_EQ(waitFor(member, kMinute).summary.gs_protocol_type, WYX_STATE_VALUE_CHANGE);
}

// Requests from threads of their own, each waiting until it is told to go on, so that all ids stay distinct.
class Requester {
 public:
  Requester(GSProvider& provider, bool wait_for_it)
      : thread_([&provider, wait_for_it, this] {
          provider.changeStateValue(wyx_state_value_t{0, nullptr}, WYX_1_PHASE, 0);
          requested_ = true;
          while (!go_on_) std::this_thread::sleep_for(std::chrono::milliseconds(1));
          if (wait_for_it) first_ = waitFor(provider, -1000).rc;
          waited_ = true;
          while (!finish_) std::this_thread::sleep_for(std::chrono::milliseconds(1));
          last_ = waitFor(provider, -1000).rc;
        }) {
    EXPECT_TRUE(eventually([&] { return requested_.load(); }));
  }
  GSWaitForRC waitNow() {
    go_on_ = true;
    EXPECT_TRUE(eventually([&] { return waited_.load(); }));
    return first_;
  }
  GSWaitForRC finish() {
    go_on_ = finish_ = true;
    thread_.join();
    return last_;
  }

 private:
  std::atomic<bool> requested_{false}, go_on_{false}, waited_{false}, finish_{false};
  std::atomic<GSWaitForRC> first_{GS_WAITFOR_NOT_REQUESTED}, last_{GS_WAITFOR_NOT_REQUESTED};
  std::thread thread_;
};

TEST_F(Waiting, FifthThread_takesTheSatisfiedBlockElseTheOldest) {
  // Joined by a thread that is gone: its block is free for nobody but is the oldest.
  std::thread([&] { joined(member); }).join();
  Requester a(member, false), b(member, true), c(member, false);
  approve(WYX_STATE_VALUE_CHANGE);
  EXPECT_EQ(b.waitNow(), GS_WAITFOR_RECEIVED);
  Requester d(member, false);  // takes b's block, the only satisfied one
  Requester e(member, false);  // takes the oldest, the joiner's
  EXPECT_EQ(b.finish(), GS_WAITFOR_ERROR) << "has no block any more";
  EXPECT_EQ(d.finish(), GS_WAITFOR_PENDING);
  EXPECT_EQ(e.finish(), GS_WAITFOR_PENDING);
  EXPECT_EQ(a.finish(), GS_WAITFOR_RECEIVED);
  EXPECT_EQ(c.finish(), GS_WAITFOR_RECEIVED);
}

TEST_F(Waiting, Lines_ofOneAnsweredRequest) {
  joined(member);
  member.changeStateValue(wyx_state_value_t{0, nullptr}, WYX_1_PHASE, 0);
  api.take();
  waitFor(member, -1000);
  EXPECT_EQ(api.take(),
            (Lines{"D IsAlready(#) NOT_OK2 where_recv=0 wf_where=102",
                   "D IsAlready(#) NOT_OK2 where_recv=0 wf_where=102",
                   "D GSClient::waitFor(Prov[g,Id=3/7,T=12]) where=102, notify=empty-notification is not "
                   "matched..so wait again"}));
  approve(WYX_STATE_VALUE_CHANGE);
  api.take();
  waitFor(member, kMinute);
  EXPECT_EQ(api.take(),
            (Lines{"D IsAlreadySatisfied(#) OK where_recv=2 where=102",
                   "D GSClient::waitFor(Prov[g,Id=3/7,T=12]) where=102, notify=WYX_APPROVED_NOTIFICATION "
                   "sumCode=WYX_EXPLICIT_APPROVE _SATISFIED"}));
  api.token = 13;
  subscribed(watcher);
  waitFor(watcher, kMinute);
  EXPECT_EQ(api.take().front(), "D IsAlreadySatisfied(#) OK...where_recv=2 where=102");
  waitFor(watcher, -1000);
  EXPECT_EQ(api.take().front(), "D IsAlready(#) NOT_OK2 where_recv=0 wf_where=102");
}

TEST_F(Waiting, CancelledWait_givesTheMutexBack) {
  member.joinGroup();
  lock_peek::CancellableThread thread([&] {
    member.joinGroup();
    member.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, nullptr, nullptr, nullptr);
  });
  ASSERT_TRUE(eventually([&] { return waiterAsleep(); }));
  thread.cancel();
  EXPECT_TRUE(thread.join());
  approve(WYX_JOIN);
  EXPECT_EQ(waitFor(member, kMinute).rc, GS_WAITFOR_RECEIVED);
}

TEST(WaitingOnce, SequenceNumbers_areOfTheProcess) {
  RecordingApi api(GSCL_TRC_DETAIL);
  GSController controller;
  GSProvider first("a", 1, nullptr), second("b", 1, nullptr);
  first.joinGroup();
  api.token = 13;
  second.joinGroup();
  const auto numberOf = [&](wyx_token_t token) {
    Proposal proposal(ownId());
    const auto n = proposal.approved(WYX_JOIN, token);
    api.take();
    GSController::stub_approvedCb(&n);
    for (const std::string& line : api.take()) {
      if (line.starts_with("D PassNotify (seq=")) return std::stoi(line.substr(18));
    }
    return -1;
  };
  const int earlier = numberOf(kToken);
  EXPECT_GE(earlier, 1);
  EXPECT_EQ(numberOf(13), earlier + 1);
}

}  // namespace
