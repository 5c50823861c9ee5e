// Requests and notifications in all their steps: the order of trace lines, base API calls and callbacks, and the
// client's state and token at each of them.
#include <functional>
#include <map>
#include <sstream>

#include "recording_api.h"

namespace {

using namespace recording;

class Transcript : public ClientTest {
 protected:
  /// Plays a story: "> step" does that step, the base API answering as in "> step: WYX_COLLIDE", and the events
  /// until the next one are those that are expected, with ">~ step" the others are not looked at, with ">> step"
  /// none. An event is one that the recording base API writes, or one of those that frame a callback, "before
  /// mine", "after not mine" and so on. A backslash at its end joins a line with the next.
  void play(const char* story) {
    std::istringstream lines(story);
    Lines expected;
    std::string step, line;
    while (std::getline(lines, line)) {
      for (std::string rest; line.ends_with("\\"); line += rest) {
        line.pop_back();
        std::getline(lines, rest);
      }
      if (line.starts_with(">")) {
        finish(step, expected);
        step = line;
      } else if (!line.empty()) {
        expand(line, expected);
      }
    }
    finish(step, expected);
  }

  /// Waits without patience and records the result and the summary in numbers.
  void wait(GSClient& client) {
    const timespec past = {1, 0};
    wyx_notification_type_t type = {};
    wyx_notification_summary_t sum = {{}, {}, WYX_PROPOSED_MEMBERSHIP, WYX_TIME_LIMIT_EXCEEDED, {}, WYX_EXISTS};
    const GSWaitForRC rc = client.waitForNotification(GS_TRIGGER_AFTER_CALLBACK, &past, &type, &sum);
    std::ostringstream result;
    result << "= " << gscl_GSWaitForRCName(rc) << ' ' << type << ": " << sum.gs_notification_type << ' '
           << sum.gs_protocol_type << ' ' << sum.gs_whats_changed << ' ' << sum.gs_summary_code << ' '
           << sum.gs_subscription_type << ' ' << sum.gs_delayed_return_code;
    api.record(result.str());
  }

  std::map<std::string, std::function<void()>> steps;

 private:
  void finish(const std::string& step, Lines& expected) {
    if (step.empty()) return;
    const size_t colon = step.find(": "), name = step.find(' ') + 1;
    api.answer = WYX_OK;
    for (int rc = 1; colon != step.npos && rc <= WYX_INVALID_SOURCE_GROUP; ++rc) {
      if (gscl_rc_name(wyx_rc_t(rc)) == step.substr(colon + 2)) api.answer = wyx_rc_t(rc);
    }
    api.take();
    steps.at(step.substr(name, colon == step.npos ? colon : colon - name))();
    Lines seen = api.take();
    if (step.starts_with(">~")) {
      std::erase_if(seen, [&](auto& event) { return std::ranges::find(expected, event) == expected.end(); });
    }
    EXPECT_TRUE(step.starts_with(">>") || seen == expected) << step << testing::PrintToString(seen);
    expected.clear();
  }
  static void expand(const std::string& line, Lines& expected) {
    const bool not_mine = line.find(" not mine") != line.npos, before = line.starts_with("before");
    if (!before && !line.starts_with("after")) return expected.push_back(line);
    expected.push_back("D beginTransaction @");
    if (not_mine) {
      expected.push_back("D setNotify for_my_req=0 ...set tid_for_my_own to NULL");
      expected.push_back("D setNotify for_my_req=0 but no-any-callbacks");
    } else if (before) {
      expected.push_back("D setNotify where=1 for_my_req=1 NOT-AFTER...");
    } else {  // "after <client> <notification> <type>"
      std::string id, what, type;
      std::istringstream(line.substr(6)) >> id >> what >> type;
      expected.push_back("D setNotify(" + id + ", where=2,what=WYX_" + what + "_NOTIFICATION,type=" + type +
                         ") IS_MYREQ=1");
      expected.push_back("D ApplyNotify(seq=S)");
      expected.push_back("D PassNotify (seq=S)");
    }
    expected.push_back("D endTransaction @");
  }
};

char text[] = "value";

const char kProviderStory[] = R"(
> goodbye
[IDLE/-1 /]
A P[-1/-1,T=-1] was already out-of-group.
= WYX_NOT_OK
> join
A GSProvider::joinGroup(P[-1/-1,T=-1]) begins
A stub_join_group(P[-1/-1,T=-1]) is issued
D beginTransaction @
wyx_join(-1)
[IDLE/12 /]
A Client[P[-1/-1,T=12]] ClientState: GS_IAM_IDLE to GS_IAM_JOINING.
[JOINING/12 /]
D startProtocolRequested(P[-1/-1,T=12]) type=WYX_JOIN
D endTransaction @
A stub_join_group(P[-1/-1,T=12]) token=12 sync_rc=WYX_OK
A GSProvider::joinGroup(P[-1/-1,T=12]) returns  sync_rc=WYX_OK.
= WYX_OK
> own join in phase
[JOINING/12 now/]
A C::stub_nPhaseCb(P[-1/-1,T=12]) protocol=WYX_JOIN token=12, sumCode=WYX_EXPLICIT_APPROVE, \
notification=WYX_N_PHASE_NOTIFICATION
[JOINING/12 now/next]
before mine
-> nPhaseCb
A nPhaseCb(P[-1/-1,T=12]) for WYX_JOIN
after P[-1/-1,T=12] N_PHASE WYX_JOIN
> own join rejected
A C::stub_rejectCb(P[-1/-1,T=12]) protocol=WYX_JOIN sumCode=WYX_EXPLICIT_REJECT, myId=-1 provider_token=12
A Client[P[-1/-1,T=12]] ClientState: GS_IAM_JOINING to GS_IAM_IDLE.
[IDLE/12 left/gone]
before mine
-> rejectedCb
A rejectedCb(P[-1/-1,T=12]) for WYX_JOIN
A My join(P[-1/-1,T=12]) is rejected.
after P[-1/-1,T=12] REJECTED WYX_JOIN
> join: WYX_EXISTS
A GSProvider::joinGroup(P[-1/-1,T=12]) begins
A stub_join_group(P[-1/-1,T=12]) is issued
[IDLE/-1 left/gone]
D beginTransaction @
wyx_join(-1)
A Client[P[-1/-1,T=-1]] ClientState: GS_IAM_IDLE to GS_IAM_IDLE.
D endTransaction @
A stub_join_group(P[-1/-1,T=-1]) token=-1 sync_rc=WYX_EXISTS
A GSProvider::joinGroup(P[-1/-1,T=-1]) returns  sync_rc=WYX_EXISTS.
= WYX_EXISTS
>> join
> goodbye: WYX_BAD_MEMBER_TOKEN
A C::stub_goodbye_group(P[-1/-1,T=12]) is issued
D beginTransaction @
wyx_goodbye(12)
A stub_goodbye_group(P[-1/-1,T=12]) token=12 sync_rc=WYX_BAD_MEMBER_TOKEN, and removed
[JOINING/-1 /]
A Client[P[-1/-1,T=-1]] ClientState: GS_IAM_JOINING to GS_IAM_IDLE.
[IDLE/-1 /]
D endTransaction @
A P[-1/-1,T=-1] issued goodbye and get sync_rc=WYX_BAD_MEMBER_TOKEN.
= WYX_BAD_MEMBER_TOKEN
>> join
> own join approved
A C::stub_approvedCb(P[-1/-1,T=12]) for prot=WYX_JOIN  sumCode=WYX_EXPLICIT_APPROVE, whats_changed=0x20
A Client[P[3/7,T=12]] ClientState: GS_IAM_JOINING to GS_IAM_JOINED.
[JOINED/12 /]
A C::stub_approved: set new members
[JOINED/12 one/ 4.8 3.7]
before mine
D calling approvedCb()
-> approvedCb
A approvedCb(P[3/7,T=12]) for WYX_JOIN by [7.3]
A My Join(P[3/7,T=12]) is approved
D returned from approvedCb()
after P[3/7,T=12] APPROVED WYX_JOIN
A C::stub_approvedCb(P[3/7,T=12]) done
> wait
D IsAlreadySatisfied(#) OK where_recv=2 where=102
D GSClient::waitFor(P[3/7,T=12]) where=102, notify=WYX_APPROVED_NOTIFICATION \
sumCode=WYX_EXPLICIT_APPROVE _SATISFIED
= GS_NOTIFICATION_RECEIVED 4: 4 1 32 1 0 0
> wait
D IsAlready(#) NOT_OK2 where_recv=0 wf_where=102
D IsAlready(#) NOT_OK2 where_recv=0 wf_where=102
D GSClient::waitFor(P[3/7,T=12]) where=102, notify=WYX_APPROVED_NOTIFICATION is not matched..so wait again
= GS_NOTIFICATION_PENDING -1: -1 -1 1 16 0 2
> other's join approved
A C::stub_approvedCb(P[3/7,T=12]) for prot=WYX_JOIN  sumCode=WYX_EXPLICIT_APPROVE, whats_changed=0x0
A C::stub_approvedCb(P[3/7,T=12])- I was already joined.. ID=[3/7]. my_req=0
[JOINED/12 two/three 4.8 3.7]
before not mine
D calling approvedCb()
-> approvedCb
A approvedCb(P[3/7,T=12]) for WYX_JOIN by [8.4]
A My Join(P[3/7,T=12]) is approved
D returned from approvedCb()
after not mine
A C::stub_approvedCb(P[3/7,T=12]) done
>> goodbye: WYX_NO_INIT
> change
A stub_change_state_value(P[3/7,T=12]) is issued
D beginTransaction @
wyx_change_state_value(12, 2, 30, 5)
D startProtocolRequested(P[3/7,T=12]) type=WYX_STATE_VALUE_CHANGE
D endTransaction @
A stub_change_state_value(P[3/7,T=12]) token=12 sync_rc=WYX_OK
= WYX_OK
> leave: WYX_COLLIDE
A stub_leave(P[3/7,T=12]) is issued
D beginTransaction @
wyx_leave(12, 2, 30, 1)
D endTransaction @
A stub_leave(P[3/7,T=12]) token=12 sync_rc=WYX_COLLIDE
= WYX_COLLIDE
>~ message
A stub_send_message(P[3/7,T=12]) is issued
wyx_send_message(12, 1, 0, 3)
D startProtocolRequested(P[3/7,T=12]) type=WYX_PROVIDER_MESSAGE
>~ leave
A stub_leave(P[3/7,T=12]) is issued
wyx_leave(12, 2, 30, 1)
D startProtocolRequested(P[3/7,T=12]) type=WYX_LEAVE
>~ expel
A stub_expel(P[3/7,T=12]) is issued
wyx_expel(12, 1, 2, 4)
D startProtocolRequested(P[3/7,T=12]) type=WYX_EXPEL
>~ attributes
A stub_change_attributes(P[3/7,T=12]) is issued
wyx_change_attributes(12, 1, 0, 9)
D startProtocolRequested(P[3/7,T=12]) type=WYX_GROUP_ATTRIBUTE_CHANGE
> vote
A stub_vote(P[3/7,T=12]) vote=WYX_VOTE_APPROVE defvote=WYX_VOTE_REJECT issued
wyx_vote(12, 1, 5, 3, 3)
D setVoteIsSubmitted(P[3/7,T=12])
A stub_vote(P[3/7,T=12]) token=12 sync_rc=WYX_OK
= WYX_OK
>~ first phase
[JOINED/12 two/next 4.8 3.7]
before not mine
after not mine
>> second phase
>~ only phase
[JOINED/12 two/ 4.8 3.7]
>~ failure approved
before not mine
A P[3/7,T=12] Failure approved.
after not mine
>~ failure rejected
before not mine
A P[3/7,T=12] Failure rejected.
after not mine
> delayed error
A C::stub_delayedErrorCb(P[3/7,T=12]) protocol=WYX_STATE_VALUE_CHANGE token=12, delayRc=WYX_COLLIDE
before mine
-> delayedErrorCb
after P[3/7,T=12] DELAYED_ERROR WYX_STATE_VALUE_CHANGE
>~ wait
= GS_NOTIFICATION_RECEIVED 2: 2 5 0 0 0 16
> announcement
A C::stub_announceCb(P[3/7,T=12]) summary=WYX_DEFAULT_APPROVE|WYX_DISSOLVED
before not mine
-> announcementCb
A announcementCb(P[3/7,T=12]) WYX_DEFAULT_APPROVE|WYX_DISSOLVED
after not mine
> merge
-> mergeCb
A mergeCb(P[3/7,T=12])
> for nobody
W stub_approvedCb provider_token=99 not found
W stub_rejectedCb provider_token=13 not found
W stub_nPhaseCb token 99 not found
W stub_announcementCb provider_token=99 not found
W Subscriber 12 is not found...ERROR
W C::stub_delayedErrCb - unable to find a client(token=99) for protocol=WYX_LEAVE
>> leave
> end
A C::stub_announceCb(P[3/7,T=12]) summary=WYX_GROUP_DISSOLVED
A Client[P[3/7,T=12]] ClientState: GS_IAM_JOINED to GS_IAM_IDLE.
[IDLE/-1 /]
before mine
-> announcementCb
A announcementCb(P[3/7,T=-1]) WYX_GROUP_DISSOLVED
after P[3/7,T=-1] ANNOUNCEMENT empty-request
>~ wait
= GS_NOTIFICATION_RECEIVED 6: 6 -1 0 256 0 0
)";

TEST_F(Transcript, Provider_fromJoinToTheEnd_stepByStep) {
  const auto made = [&](wyx_rc_t rc) { api.record("= " + std::string(gscl_rc_name(rc))); };
  const wyx_state_value_t value = {5, text};
  const wyx_provider_message_t message = {3, text};
  const wyx_expel_request_t expel = {WYX_1_PHASE, 2, {0, nullptr}, 4, text};
  wyx_group_attributes_t attributes = {};
  attributes.gs_client_version = 9;
  steps = {
      {"join", [&] { made(member.joinGroup()); }},
      {"goodbye", [&] { made(member.goodbyeGroup()); }},
      {"change", [&] { made(member.changeStateValue(value, WYX_N_PHASE, 30)); }},
      {"message", [&] { made(member.send_message(message, WYX_1_PHASE, 0)); }},
      {"leave", [&] { made(member.leaveGroup(1, WYX_N_PHASE, 30)); }},
      {"expel", [&] { made(member.expelMembers(&expel)); }},
      {"attributes", [&] { made(member.change_attributes(attributes, WYX_1_PHASE, 0)); }},
      {"vote", [&] { made(member.vote(WYX_VOTE_APPROVE, WYX_VOTE_REJECT, &value, &message)); }},
      {"wait", [&] { wait(member); }},
      {"own join in phase",
       [] { phase(WYX_JOIN, {.changed = WYX_PROPOSED_STATE_VALUE, .current = "now", .proposed = "next"}); }},
      {"own join rejected", [] { reject(WYX_JOIN, {.current = "left", .proposed = "gone"}); }},
      {"own join approved",
       [] {
         approve(WYX_JOIN, {.changed = WYX_UPDATED_MEMBERSHIP, .current = "one", .members = {kOther, kOwn}});
       }},
      {"other's join approved",
       [] { approve(WYX_JOIN, {.by = kOther, .current = "two", .proposed = "three", .members = {kOwn}}); }},
      {"first phase",
       [] {
         phase(WYX_EXPEL,
               {.by = kOther, .changed = WYX_PROPOSED_STATE_VALUE, .current = "ignored", .proposed = "next"});
       }},
      {"second phase", [] { phase(WYX_EXPEL, {.by = kOther, .phase = 2, .phases = 3}); }},
      {"only phase", [] { phase(WYX_EXPEL, {.by = kOther, .phase = 2, .phases = 1}); }},
      {"failure approved", [] { approve(WYX_FAILURE_LEAVE, {.by = kOther}); }},
      {"failure rejected", [] { reject(WYX_FAILURE_LEAVE); }},
      {"delayed error", [] { delayedError(WYX_STATE_VALUE_CHANGE, WYX_COLLIDE); }},
      {"announcement", [] { announce(WYX_GROUP_DISSOLVED | WYX_DEFAULT_APPROVE); }},
      {"end", [] { announce(WYX_GROUP_DISSOLVED); }},
      {"merge", [] { merge(); }},
      {"for nobody",
       [&] {
         approve(WYX_JOIN, {.to = 99});
         reject(WYX_JOIN, {.to = 13});  // a subscriber's
         phase(WYX_JOIN, {.to = 99});
         announce(WYX_GROUP_DISSOLVED, 99);
         merge(99);
         subscription(WYX_SUBSCRIPTION_STATE);
         delayedError(WYX_LEAVE, WYX_NOT_OK, 99);
       }},
  };
  api.token = 13;
  watcher.subscribeGroup();
  api.token = kToken;
  api.watch(&member);
  play(kProviderStory);
}

const char kSubscriberStory[] = R"(
> unsubscribe
[IDLE/-1 /]
A stub_unsubscribe_group(Subs[G=g,T=-1]) cannot be issued because it is not subscribed.
A Subs[G=g,T=-1]: unsubscribe sync_rc=WYX_BAD_MEMBER_TOKEN
= WYX_BAD_MEMBER_TOKEN
> subscribe
A stub_subscribe_group(Subs[G=g,T=-1]) is issued
D beginTransaction @
wyx_subscribe(-1)
[SUBSCRIBING/12 /]
D startProtocolRequested(Subs[G=g,T=12]) type=WYX_SUBSCRIPTION
D endTransaction @
A stub_subscribe_group(Subs[G=g,T=12]) token=12 sync_rc=WYX_OK
A Subs[G=g,T=12]: subscribe sync_rc=WYX_OK
= WYX_OK
>> unsubscribe: WYX_NO_INIT
> unsubscribe
D beginTransaction @
wyx_unsubscribe(12)
[IDLE/-1 /]
D endTransaction @
A stub_unsubscribe_group(Subs[G=g,T=-1]) returns sync_rc=WYX_OK
A Subs[G=g,T=-1]: unsubscribe sync_rc=WYX_OK
= WYX_OK
>> subscribe
> full
[SUBSCRIBED/12 /]
A Subs[G=g,T=12] is now subscribed.
A Subs[G=g,T=12] received FULL_MBRSHIP.
[SUBSCRIBED/12 v/ 3.7]
before mine
-> subscribeCb
A subscribeCb(Subs[G=g,T=12]) WYX_SUBSCRIPTION_STATE|_DELTA_JOIN|_MEMBERSHIP
after Subs[G=g,T=12] SUBSCRIPTION WYX_SUBSCRIPTION
>~ wait
D IsAlreadySatisfied(#) OK...where_recv=2 where=102
= GS_NOTIFICATION_RECEIVED 7: 7 10 0 0 11 0
>~ joins
A Subs[G=g,T=12] received DELTA_JOINS.
[SUBSCRIBED/12 v/ 3.7 4.8]
>~ leaves
A Subs[G=g,T=12] received DELTA_LEAVES.
[SUBSCRIBED/12 v/ 4.8]
>~ other
A WHATELSE=40
>~ dissolved
A Subs[G=g,T=12] is dissolved.
[IDLE/12 v/]
>> subscribe
>~ died
A Subs[G=g,T=12] is dissolved.
[IDLE/12 /]
>> subscribe
>~ refused
[IDLE/12 /]
)";

TEST_F(Transcript, Subscriber_fromSubscriptionToTheEnd_stepByStep) {
  const auto made = [&](wyx_rc_t rc) { api.record("= " + std::string(gscl_rc_name(rc))); };
  steps = {
      {"subscribe", [&] { made(watcher.subscribeGroup()); }},
      {"unsubscribe", [&] { made(watcher.unsubscribeGroup()); }},
      {"wait", [&] { wait(watcher); }},
      {"full",
       [] {
         subscription(WYX_SUBSCRIPTION_MEMBERSHIP | WYX_SUBSCRIPTION_DELTA_JOIN | WYX_SUBSCRIPTION_STATE,
                      {.current = "v", .members = {kOwn}, .changing = {kOther}});
       }},
      {"joins",
       [] {
         subscription(WYX_SUBSCRIPTION_DELTA_JOIN | WYX_SUBSCRIPTION_DELTA_LEAVE,
                      {.current = "ignored", .changing = {kOther}});
       }},
      {"leaves", [] { subscription(WYX_SUBSCRIPTION_DELTA_LEAVE, {.changing = {kOwn}}); }},
      {"refused", [] { delayedError(WYX_SUBSCRIPTION, WYX_COLLIDE); }},
      {"other", [] { subscription(WYX_SUBSCRIPTION_SPECIAL_DATA); }},
      {"dissolved", [] { subscription(WYX_SUBSCRIPTION_DISSOLVED | WYX_SUBSCRIPTION_MEMBERSHIP); }},
      {"died", [] { subscription(WYX_SUBSCRIPTION_GS_HAS_DIED); }},
  };
  api.watch(&watcher);
  play(kSubscriberStory);
}

TEST_F(Transcript, Destroyed_clientsSayTheirLastLines) {
  {
    GSProvider provider("g", 3, nullptr);
    joined(provider);
    api.take();
  }
  EXPECT_EQ(api.take(), (Lines{"A P[3/7,T=12] destroyed",
                               "W The provider(P[3/7,T=12]) is being deleted before leaving the group."}));
  {
    GSSubscriber subscriber("g", WYX_SUBSCRIBE_STATE);
    EXPECT_EQ(api.take(), Lines{"A Subs[G=g,T=-1] created"});
    subscribed(subscriber);
    // Still found: a notification on the way reaches it.
    api.during = [&] { subscription(WYX_SUBSCRIPTION_SPECIAL_DATA); };
    GSSetDebugLevel(GSCL_TRC_API);
    api.take();
  }
  api.during = nullptr;
  EXPECT_EQ(api.take(), (Lines{"A Subs[G=g,T=12] destroyed", "wyx_unsubscribe(12)", "A WHATELSE=40",
                               "A subscribeCb(Subs[G=g,T=12]) WYX_SUBSCRIPTION_SPECIAL_DATA",
                               "A stub_unsubscribe_group(Subs[G=g,T=-1]) returns sync_rc=WYX_OK",
                               "A Subs[G=g,T=-1]: unsubscribe sync_rc=WYX_OK"}));
  EXPECT_STREQ(zelt_gscl_V1::getTraceIdStr(&member), "Prov[g,Id=-1/-1,T=-1]");
}

TEST(NoController, notifications_areDroppedWithALine) {
  RecordingApi api;
  approve(WYX_JOIN);
  reject(WYX_JOIN);
  phase(WYX_JOIN);
  announce(WYX_GROUP_DISSOLVED);
  subscription(WYX_SUBSCRIPTION_STATE);
  delayedError(WYX_JOIN, WYX_COLLIDE);
  merge();
  const wyx_responsiveness_notification_t alive = {};
  const wyx_query_notification_t query = {};
  EXPECT_EQ(stub_responsivenessCb(&alive), WYX_CALLBACK_OK);
  stub_queryCb(&query);
  const Lines lines = api.take();
  EXPECT_EQ(lines.size(), 9u);
  EXPECT_THAT(lines, testing::Each(testing::MatchesRegex("W stub_\\w+ dropped: no controller")));
}

}  // namespace
