// What clients hand to the base API, what notifications do to them and whom they are told to, how long a client
// lives meanwhile; and requests that are cancelled, refused or thrown out of.
#include <pthread.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <new>
#include <thread>

#include "peek.h"
#include "recording_api.h"

namespace {

using namespace recording;

class Client : public ClientTest {};

TEST_F(Client, Names_givenFormedCutOrTakenAway) {
  EXPECT_STREQ(GSProvider("grp", 3, nullptr).getLocalName(), "grp_3");
  EXPECT_STREQ(GSProvider("grp", -2, "mine").getLocalName(), "mine");
  const std::string huge(5000, 'x');
  EXPECT_EQ(GSProvider(huge.c_str(), -32768, nullptr).getLocalName(), huge + "_-32768");
  EXPECT_STREQ(GSProvider(nullptr, 1, nullptr).getLocalName(), "_1");

  watcher.setGroupName(huge.c_str());
  watcher.subscribeGroup();
  EXPECT_EQ(api.entered, std::string(32, 'x'));
  watcher.setGroupName(nullptr);
  EXPECT_EQ(watcher.getGroupName(), nullptr);
  EXPECT_STREQ(zelt_gscl_V1::getTraceIdStr(&watcher), "Subs[G=(null),T=12]");
}

TEST_F(Client, JoinAndSubscribe_handOverTheirCallbacksAndTheOwnGroup) {
  char other[] = "other";
  wyx_group_attributes_t attributes = {};
  member.getGroupAttributes(&attributes);
  EXPECT_STREQ(attributes.gs_group_name, "g");
  attributes.gs_group_name = other;
  member.setGroupAttributes(&attributes);
  member.setInstanceNumber(9);
  member.joinGroup();
  EXPECT_EQ(api.entered, "g/9/g_3");
  const wyx_join_request_t& join = api.proposal._gs_protocol_info._gs_join_request;
  EXPECT_EQ(join.gs_n_phase_protocol_callback, &GSController::stub_nPhaseCb);
  EXPECT_EQ(join.gs_protocol_approved_callback, &GSController::stub_approvedCb);
  EXPECT_EQ(join.gs_protocol_rejected_callback, &GSController::stub_rejectedCb);
  EXPECT_EQ(join.gs_announcement_callback, &GSController::stub_announcementCb);
  EXPECT_EQ(join.gs_merge_callback, &GSController::stub_mergeCb);

  const wyx_subscribe_request_t& subscribe = api.proposal._gs_protocol_info._gs_subscribe_request;
  watcher.subscribeGroup();
  EXPECT_EQ(subscribe.gs_subscription_control, WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP);
  EXPECT_EQ(subscribe.gs_subscription_callback, &GSController::stub_subscribeCb);
  watcher.setSubscriptionCtrl(WYX_SUBSCRIBE_MEMBERSHIP);
  api.answer = WYX_NO_INIT;
  EXPECT_EQ(watcher.subscribeGroup(), WYX_NO_INIT);
  EXPECT_EQ(subscribe.gs_subscription_control, WYX_SUBSCRIBE_MEMBERSHIP);
  EXPECT_EQ(watcher.getToken(), -1);
}

// Every convenience form ends in the virtual one.
class Overrider : public GSProvider {
 public:
  using GSProvider::change_attributes;
  using GSProvider::changeStateValue;
  using GSProvider::expelMembers;
  using GSProvider::GSProvider;
  using GSProvider::leaveGroup;
  using GSProvider::send_message;
  using Info = const wyx_proposal_info_t*;
  wyx_rc_t changeStateValue(Info p) override { return ++virtuals, GSProvider::changeStateValue(p); }
  wyx_rc_t leaveGroup(Info p) override { return ++virtuals, GSProvider::leaveGroup(p); }
  wyx_rc_t expelMembers(Info p) override { return ++virtuals, GSProvider::expelMembers(p); }
  wyx_rc_t send_message(Info p) override { return ++virtuals, GSProvider::send_message(p); }
  wyx_rc_t change_attributes(Info p) override { return ++virtuals, GSProvider::change_attributes(p); }
  int virtuals = 0;
};

TEST_F(Client, ConvenienceForms_fillTheRequestAndCallTheVirtualForm) {
  Overrider provider("g", 3, nullptr);
  char text[] = "abc";
  const wyx_state_value_t value = {3, text};
  wyx_group_attributes_t attributes = {};
  attributes.gs_client_version = 9;
  const wyx_state_change_request_t change = {WYX_N_PHASE, 30, value};
  const wyx_leave_request_t leave = {WYX_N_PHASE, 30, 7};
  const wyx_message_request_t send = {WYX_N_PHASE, 30, {3, text}};
  const wyx_attribute_change_request_t alter = {WYX_N_PHASE, 30, &attributes, nullptr};
  const wyx_expel_request_t expel = {WYX_N_PHASE, 30, {0, nullptr}, 4, text};
  GSSetDebugLevel(0);
  api.take();
  const auto expect = [&](const char* call, auto... requests) {
    for (const auto& request : {std::function<void()>(requests)...}) {
      const int before = provider.virtuals;
      request();
      EXPECT_EQ(api.take(), Lines{call});
      EXPECT_EQ(provider.virtuals, before + 1) << call;
    }
  };
  expect(
      "wyx_change_state_value(-1, 2, 30, 3)", [&] { provider.changeStateValue(value, WYX_N_PHASE, 30); },
      [&] { provider.changeStateValue(&change); },
      [&] { provider.changeStateValue(GSStateValue(&value), WYX_N_PHASE, 30); });
  expect("wyx_change_state_value(-1, 2, 30, 0)",
         [&] { provider.changeStateValue(GSStateValue(), WYX_N_PHASE, 30); });
  expect(
      "wyx_leave(-1, 2, 30, 7)", [&] { provider.leaveGroup(7, WYX_N_PHASE, 30); },
      [&] { provider.leaveGroup(&leave); });
  expect(
      "wyx_send_message(-1, 2, 30, 3)",
      [&] {
        provider.send_message({3, text}, WYX_N_PHASE, 30);
      },
      [&] { provider.send_message(&send); });
  expect(
      "wyx_change_attributes(-1, 2, 30, 9)", [&] { provider.change_attributes(attributes, WYX_N_PHASE, 30); },
      [&] { provider.change_attributes(&alter); });
  expect("wyx_expel(-1, 2, 30, 4)", [&] { provider.expelMembers(&expel); });
}

TEST_F(Client, CancelledRequest_isFinishedFirst) {
  api.during = [] {
    pthread_cancel(pthread_self());
    pthread_testcancel();
  };
  // Every trace line is a cancellation point, as with the standard routine.
  GSSetTraceRtn([](int, char*) { pthread_testcancel(); });
  const auto cancelled = [](const std::function<wyx_rc_t()>& request) {
    wyx_rc_t answer = WYX_NOT_OK;
    peek::CancellableThread thread([&] {
      answer = request();
      pthread_testcancel();
    });
    EXPECT_TRUE(thread.join());
    return answer;
  };
  EXPECT_EQ(cancelled([&] { return member.joinGroup(); }), WYX_OK);
  EXPECT_EQ(member.getClientState(), GS_IAM_JOINING);
  EXPECT_EQ(member.getToken(), kToken);
  EXPECT_EQ(cancelled([&] { return member.goodbyeGroup(); }), WYX_OK);
  EXPECT_EQ(cancelled([&] { return watcher.subscribeGroup(); }), WYX_OK);
  EXPECT_EQ(cancelled([&] { return watcher.unsubscribeGroup(); }), WYX_OK);
  EXPECT_EQ(cancelled([&] { return controller.initialize(); }), WYX_OK);
  EXPECT_EQ(controller.getGSDescriptor(), 7);
  EXPECT_EQ(cancelled([&] { return controller.quit(); }), WYX_OK);
  EXPECT_EQ(controller.getGSDescriptor(), -1);
  const wyx_responsiveness_t wanted = {WYX_PING_RESPONSIVENESS, 10, 5, nullptr, 0};
  wyx_responsiveness_t held = {};
  EXPECT_EQ(cancelled([&] { return stub_change_responsiveness(&wanted); }), WYX_OK);
  controller.getResponsiveness(&held);
  EXPECT_EQ(held.gs_responsiveness_interval, 10u);
  api.during = nullptr;
  GSWaitForRC waited = GS_WAITFOR_ERROR;
  EXPECT_EQ(cancelled([&] {
              const wyx_rc_t answer = member.joinGroup();
              approve(WYX_JOIN);
              pthread_cancel(pthread_self());
              waited = member.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, nullptr, nullptr, nullptr);
              return answer;
            }),
            WYX_OK);
  EXPECT_EQ(waited, GS_WAITFOR_RECEIVED);
  EXPECT_EQ(member.joinGroup(), WYX_OK) << "no lock was left behind";
}

TEST_F(Client, TraceRoutineThatThrows_losesNothingButItsLines) {
  const gscl_tracef_rtn before = GSSetTraceRtn([](int, char*) { throw std::bad_alloc(); });
  EXPECT_EQ(controller.initialize(), WYX_OK);
  EXPECT_EQ(controller.getGSDescriptor(), 7);
  {
    Member mortal("g", 3, nullptr);
    joined(mortal);
    EXPECT_EQ(mortal.getToken(), kToken);
    EXPECT_EQ(mortal.getClientState(), GS_IAM_JOINED);
    EXPECT_EQ(mortal.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, nullptr, nullptr, nullptr),
              GS_WAITFOR_RECEIVED);
  }
  EXPECT_EQ(controller.quit(), WYX_OK);
  GSSetTraceRtn(before);
}

class Routing : public ClientTest {
 protected:
  /// Whether `notify` reaches the waiters, seen at the line that only an own request writes.
  template <class Notify>
  bool told(Notify notify) {
    api.take();
    notify();
    const Lines lines = api.take();
    return std::any_of(lines.begin(), lines.end(), [](auto& l) { return l.find("IS_MYREQ=1") != l.npos; });
  }

  std::unique_ptr<Member> mortal = std::make_unique<Member>("g", short{3}, nullptr);
};

TEST_F(Routing, OwnRequest_byProtocolAndProposer) {
  struct Case {
    wyx_request_t protocol;
    wyx_provider_t by;
    bool told;
    GSClientState after;
  };
  for (const Case& c :
       {Case{WYX_STATE_VALUE_CHANGE, kOwn, true, GS_IAM_JOINED},
        Case{WYX_STATE_VALUE_CHANGE, kOther, false, GS_IAM_JOINED}, Case{WYX_EXPEL, kOwn, true, GS_IAM_JOINED},
        Case{WYX_LEAVE, kOther, false, GS_IAM_JOINED}, Case{WYX_LEAVE, kOwn, true, GS_IAM_IDLE},
        Case{WYX_FAILURE_LEAVE, kOwn, false, GS_IAM_JOINED},
        // The proposer says nothing about a join.
        Case{WYX_JOIN, kOwn, false, GS_IAM_JOINED}}) {
    for (auto notify : {approve, reject, phase}) {
      joined(member);
      EXPECT_EQ(told([&] { notify(c.protocol, {.by = c.by}); }), c.told) << c.protocol;
      EXPECT_EQ(member.getClientState(), c.after) << c.protocol;
    }
  }
}

TEST_F(Routing, ClientOfAToken_isTheEarliestThatIsNotIdle) {
  joined(*mortal);
  member.joinGroup();
  member.joinGroup();  // with the same token
  EXPECT_EQ(member.getOldClientState(), GS_IAM_JOINING) << "moves also without a change";
  approve(WYX_JOIN, {.changed = WYX_UPDATED_MEMBERSHIP, .members = {kOwn}});
  EXPECT_EQ(member.getClientState(), GS_IAM_JOINED) << "registered first";
  wyx_provider_t id = {};
  EXPECT_EQ(member.getMemberAt(-1, &id) + member.getMemberAt(1, &id) + member.getMemberAt(0, nullptr), 0);
  delayedError(WYX_JOIN, WYX_COLLIDE);
  EXPECT_EQ(member.getMemberCount(), 0) << "idle, although the list is still there";
  EXPECT_EQ(member.getToken(), kToken);
  announce(WYX_GROUP_DISSOLVED);
  EXPECT_EQ(mortal->getToken(), -1);
  EXPECT_EQ(member.getToken(), kToken);
  member.joinGroup();
  EXPECT_EQ(member.getMemberCount(), 0) << "those of an earlier life are forgotten";
}

TEST_F(Routing, Callback_mayDestroyItsOwnClient) {
  joined(*mortal);
  mortal->action = [&] { mortal.reset(); };
  api.take();
  approve(WYX_STATE_VALUE_CHANGE, {.by = kOther});
  const Lines lines = api.take();
  // Nothing that needs the client follows its end.
  ASSERT_GE(lines.size(), 3u);
  EXPECT_EQ(lines[lines.size() - 3], "A P[3/7,T=12] destroyed");
  EXPECT_EQ(lines[lines.size() - 2], "W The provider(P[3/7,T=12]) is being deleted before leaving the group.");
  EXPECT_EQ(lines.back(), "D returned from approvedCb()");
  approve(WYX_STATE_VALUE_CHANGE, {.by = kOther});
  EXPECT_EQ(api.take(), Lines{"W stub_approvedCb provider_token=12 not found"});
}

TEST_F(Routing, NestedDispatch_thatDestroysTheOuterClient_isNoticedByBothDeliveries) {
  joined(*mortal);
  int depth = 0;
  mortal->action = [&] {
    if (++depth == 1) return announce(WYX_DEFAULT_APPROVE);
    mortal.reset();
    // Likely at the same address: it must not be taken for the old one.
    mortal = std::make_unique<Member>("h", short{3}, nullptr);
    mortal->joinGroup();
  };
  approve(WYX_STATE_VALUE_CHANGE, {.by = kOther});
  EXPECT_EQ(depth, 2);
  EXPECT_EQ(api.take().back(), "D returned from approvedCb()");
  EXPECT_EQ(mortal->getClientState(), GS_IAM_JOINING);
}

TEST_F(Routing, Callback_mayRequestVoteAndConstructClients) {
  joined(member);
  member.action = [&] {
    EXPECT_EQ(member.vote(WYX_VOTE_APPROVE, WYX_VOTE_REJECT, nullptr, nullptr), WYX_OK);
    api.token = 13;
    mortal = std::make_unique<Member>("h", short{1}, nullptr);
    EXPECT_EQ(mortal->joinGroup(), WYX_OK);
    EXPECT_EQ(controller.dispatch(WYX_NON_BLOCKING), WYX_OK);
  };
  phase(WYX_STATE_VALUE_CHANGE, {.by = kOther});
  EXPECT_EQ(mortal->getToken(), 13);
}

// Of the trace routine below: what the two threads have come to.
std::atomic<bool> in_callback, destroying, delivered;

void holdCallbackUntilDestructionBegins(int, char* text) {
  const std::string line(text);
  if (line.starts_with("approvedCb(")) {
    in_callback = true;
    while (!destroying) std::this_thread::yield();
    // Room for a destructor that does not wait to get done.
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  if (line.find("destroyed") != line.npos) destroying = true;
  if (line.find("stub_approvedCb") != line.npos && line.find("done") != line.npos) delivered = true;
}

TEST_F(Routing, Destructor_waitsForADeliveryOnAnotherThread) {
  auto provider = std::make_unique<GSProvider>("g", short{3}, nullptr);
  joined(*provider);
  in_callback = destroying = delivered = false;
  const gscl_tracef_rtn before = GSSetTraceRtn(holdCallbackUntilDestructionBegins);
  std::thread deliverer([] { approve(WYX_STATE_VALUE_CHANGE, {.by = kOther}); });
  while (!in_callback) std::this_thread::yield();
  provider.reset();
  EXPECT_TRUE(delivered);
  deliverer.join();
  GSSetTraceRtn(before);
}

}  // namespace
