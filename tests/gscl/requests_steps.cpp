// Every request: the order of its steps, its trace lines, where token and state are set, its results.
#include <new>
#include <thread>

#include "recording_api.h"

namespace {

using namespace recording;

enum Before { kFresh, kOldToken, kJoining, kJoined };

wyx_state_value_t stateValue(char* text) { return {5, text}; }

struct RequestCase {
  const char* name;
  Before before;
  wyx_rc_t answer;
  wyx_rc_t (*request)(Member&);
  wyx_rc_t result;
  std::vector<std::string> steps;
};

void PrintTo(const RequestCase& c, std::ostream* out) { *out << c.name; }

class ProviderRequest : public testing::TestWithParam<RequestCase> {};

TEST_P(ProviderRequest, Steps) {
  const RequestCase& c = GetParam();
  RecordingApi api;
  GSController controller;
  Member member("g", 3, nullptr);
  if (c.before != kFresh) member.joinGroup();
  if (c.before == kOldToken) {
    const auto n = delayedError(WYX_JOIN, WYX_COLLIDE);
    GSController::stub_delayedErrorCb(&n);
  }
  if (c.before == kJoined) joined(member);
  api.take();
  api.watch(&member);
  api.answer = c.answer;
  EXPECT_EQ(c.request(member), c.result);
  EXPECT_EQ(api.take(), c.steps);
  api.answer = WYX_OK;
  api.watch(nullptr);
}

wyx_rc_t join(Member& m) { return m.joinGroup(); }
wyx_rc_t goodbye(Member& m) { return m.goodbyeGroup(); }
char value_text[] = "value";

// The frame that the five proposals share.
std::vector<std::string> accepted(const std::string& name, const std::string& protocol) {
  const std::string id = "(Prov[g,Id=3/7,T=12])";
  return {"JOINED/12 A stub_" + name + id + " is issued",
          "JOINED/12 D beginTransaction @",
          "JOINED/12 wyx_" + name + "(12)",
          "JOINED/12 D startProtocolRequested" + id + " type=" + protocol,
          "JOINED/12 D endTransaction @",
          "JOINED/12 A stub_" + name + id + " token=12 sync_rc=WYX_OK"};
}

INSTANTIATE_TEST_SUITE_P(
    All, ProviderRequest,
    testing::Values(
        RequestCase{"JoinAccepted",
                    kFresh,
                    WYX_OK,
                    join,
                    WYX_OK,
                    {"IDLE/-1 A GSProvider::joinGroup(Prov[g,Id=-1/-1,T=-1]) begins",
                     "IDLE/-1 A stub_join_group(Prov[g,Id=-1/-1,T=-1]) is issued", "IDLE/-1 D beginTransaction @",
                     "IDLE/-1 wyx_join(-1)",
                     "IDLE/12 A Client[Prov[g,Id=-1/-1,T=12]] ClientState: GS_IAM_IDLE to GS_IAM_JOINING.",
                     "JOINING/12 D startProtocolRequested(Prov[g,Id=-1/-1,T=12]) type=WYX_JOIN",
                     "JOINING/12 D endTransaction @",
                     "JOINING/12 A stub_join_group(Prov[g,Id=-1/-1,T=12]) token=12 sync_rc=WYX_OK",
                     "JOINING/12 A GSProvider::joinGroup(Prov[g,Id=-1/-1,T=12]) returns  sync_rc=WYX_OK."}},
        RequestCase{"JoinRefused",
                    kOldToken,
                    WYX_EXISTS,
                    join,
                    WYX_EXISTS,
                    {"IDLE/12 A GSProvider::joinGroup(Prov[g,Id=-1/-1,T=12]) begins",
                     "IDLE/12 A stub_join_group(Prov[g,Id=-1/-1,T=12]) is issued", "IDLE/-1 D beginTransaction @",
                     "IDLE/-1 wyx_join(-1)",
                     "IDLE/-1 A Client[Prov[g,Id=-1/-1,T=-1]] ClientState: GS_IAM_IDLE to GS_IAM_IDLE.",
                     "IDLE/-1 D endTransaction @",
                     "IDLE/-1 A stub_join_group(Prov[g,Id=-1/-1,T=-1]) token=-1 sync_rc=WYX_EXISTS",
                     "IDLE/-1 A GSProvider::joinGroup(Prov[g,Id=-1/-1,T=-1]) returns  sync_rc=WYX_EXISTS."}},
        RequestCase{"ChangeStateValue", kJoined, WYX_OK,
                    [](Member& m) { return m.changeStateValue(stateValue(value_text), WYX_N_PHASE, 30); }, WYX_OK,
                    accepted("change_state_value", "WYX_STATE_VALUE_CHANGE")},
        RequestCase{"ChangeStateValueRefused",
                    kJoined,
                    WYX_COLLIDE,
                    [](Member& m) { return m.changeStateValue(stateValue(value_text), WYX_N_PHASE, 30); },
                    WYX_COLLIDE,
                    {"JOINED/12 A stub_change_state_value(Prov[g,Id=3/7,T=12]) is issued",
                     "JOINED/12 D beginTransaction @", "JOINED/12 wyx_change_state_value(12)",
                     "JOINED/12 D endTransaction @",
                     "JOINED/12 A stub_change_state_value(Prov[g,Id=3/7,T=12]) token=12 sync_rc=WYX_COLLIDE"}},
        RequestCase{"SendMessage", kJoined, WYX_OK,
                    [](Member& m) {
                      return m.send_message({5, value_text}, WYX_1_PHASE, 0);
                    },
                    WYX_OK, accepted("send_message", "WYX_PROVIDER_MESSAGE")},
        RequestCase{"Leave", kJoined, WYX_OK, [](Member& m) { return m.leaveGroup(1, WYX_N_PHASE, 30); }, WYX_OK,
                    accepted("leave", "WYX_LEAVE")},
        RequestCase{"Expel", kJoined, WYX_OK,
                    [](Member& m) {
                      const wyx_expel_request_t request = {WYX_1_PHASE, 0, {0, nullptr}, 0, nullptr};
                      return m.expelMembers(&request);
                    },
                    WYX_OK, accepted("expel", "WYX_EXPEL")},
        RequestCase{"ChangeAttributes", kJoined, WYX_OK,
                    [](Member& m) {
                      wyx_group_attributes_t attributes;
                      m.getGroupAttributes(&attributes);
                      return m.change_attributes(attributes, WYX_1_PHASE, 0);
                    },
                    WYX_OK, accepted("change_attributes", "WYX_GROUP_ATTRIBUTE_CHANGE")},
        RequestCase{
            "VoteAccepted",
            kJoined,
            WYX_OK,
            [](Member& m) {
              const wyx_state_value_t value = stateValue(value_text);
              return m.vote(WYX_VOTE_APPROVE, WYX_VOTE_REJECT, &value, nullptr);
            },
            WYX_OK,
            {"JOINED/12 A stub_vote(Prov[g,Id=3/7,T=12]) vote=WYX_VOTE_APPROVE defvote=WYX_VOTE_REJECT issued",
             "JOINED/12 wyx_vote(12, 1, value, null, 3)", "JOINED/12 D setVoteIsSubmitted(Prov[g,Id=3/7,T=12])",
             "JOINED/12 A stub_vote(Prov[g,Id=3/7,T=12]) token=12 sync_rc=WYX_OK"}},
        RequestCase{
            "VoteRefused",
            kJoined,
            WYX_VOTE_NOT_EXPECTED,
            [](Member& m) {
              const wyx_provider_message_t message = {5, value_text};
              return m.vote(WYX_VOTE_CONTINUE, WYX_NULL_VOTE, nullptr, &message);
            },
            WYX_VOTE_NOT_EXPECTED,
            {"JOINED/12 A stub_vote(Prov[g,Id=3/7,T=12]) vote=WYX_VOTE_CONTINUE defvote=WYX_NULL_VOTE issued",
             "JOINED/12 wyx_vote(12, 2, null, value, 0)",
             "JOINED/12 A stub_vote(Prov[g,Id=3/7,T=12]) token=12 sync_rc=WYX_VOTE_NOT_EXPECTED"}},
        RequestCase{"Goodbye",
                    kJoined,
                    WYX_OK,
                    goodbye,
                    WYX_OK,
                    {"JOINED/12 A GSController::stub_goodbye_group(Prov[g,Id=3/7,T=12]) is issued",
                     "JOINED/12 D beginTransaction @", "JOINED/12 wyx_goodbye(12)",
                     "JOINED/12 A stub_goodbye_group(Prov[g,Id=3/7,T=12]) token=12 sync_rc=WYX_OK, and removed",
                     "JOINED/-1 A Client[Prov[g,Id=3/7,T=-1]] ClientState: GS_IAM_JOINED to GS_IAM_IDLE.",
                     "IDLE/-1 D endTransaction @",
                     "IDLE/-1 A Prov[g,Id=3/7,T=-1] issued goodbye and get sync_rc=WYX_OK."}},
        RequestCase{
            "GoodbyeOfTokenThatTheDaemonForgot",
            kJoining,
            WYX_BAD_MEMBER_TOKEN,
            goodbye,
            WYX_BAD_MEMBER_TOKEN,
            {"JOINING/12 A GSController::stub_goodbye_group(Prov[g,Id=-1/-1,T=12]) is issued",
             "JOINING/12 D beginTransaction @", "JOINING/12 wyx_goodbye(12)",
             "JOINING/12 A stub_goodbye_group(Prov[g,Id=-1/-1,T=12]) token=12 sync_rc=WYX_BAD_MEMBER_TOKEN, and "
             "removed",
             "JOINING/-1 A Client[Prov[g,Id=-1/-1,T=-1]] ClientState: GS_IAM_JOINING to GS_IAM_IDLE.",
             "IDLE/-1 D endTransaction @",
             "IDLE/-1 A Prov[g,Id=-1/-1,T=-1] issued goodbye and get sync_rc=WYX_BAD_MEMBER_TOKEN."}},
        RequestCase{"GoodbyeFailed",
                    kJoined,
                    WYX_NO_INIT,
                    goodbye,
                    WYX_NO_INIT,
                    {"JOINED/12 A GSController::stub_goodbye_group(Prov[g,Id=3/7,T=12]) is issued",
                     "JOINED/12 D beginTransaction @", "JOINED/12 wyx_goodbye(12)",
                     "JOINED/12 A stub_goodbye_group(Prov[g,Id=3/7,T=12]) token=12 sync_rc=WYX_NO_INIT",
                     "JOINED/12 D endTransaction @",
                     "JOINED/12 A Prov[g,Id=3/7,T=12] issued goodbye and get sync_rc=WYX_NO_INIT."}},
        RequestCase{"GoodbyeWhenIdle",
                    kFresh,
                    WYX_OK,
                    goodbye,
                    WYX_NOT_OK,
                    {"IDLE/-1 A Prov[g,Id=-1/-1,T=-1] was already out-of-group."}}),
    [](const auto& one) { return std::string(one.param.name); });

TEST(SubscriberRequest, Subscribe_accepted_waitsForTheFirstNotification) {
  RecordingApi api;
  GSController controller;
  Watcher watcher("g", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP);
  api.take();
  api.watch(&watcher);
  EXPECT_EQ(watcher.subscribeGroup(), WYX_OK);
  EXPECT_EQ(api.take(), (std::vector<std::string>{
                            "IDLE/-1 A stub_subscribe_group(Subs[G=g,T=-1]) is issued",
                            "IDLE/-1 D beginTransaction @", "IDLE/-1 wyx_subscribe(-1)",
                            "SUBSCRIBING/12 D startProtocolRequested(Subs[G=g,T=12]) type=WYX_SUBSCRIPTION",
                            "SUBSCRIBING/12 D endTransaction @",
                            "SUBSCRIBING/12 A stub_subscribe_group(Subs[G=g,T=12]) token=12 sync_rc=WYX_OK",
                            "SUBSCRIBING/12 A Subs[G=g,T=12]: subscribe sync_rc=WYX_OK"}));
  EXPECT_EQ(api.subscribed_group, "g");
  const wyx_subscribe_request_t& request = api.proposal._gs_protocol_info._gs_subscribe_request;
  EXPECT_EQ(request.gs_subscription_control, 0xF);
  EXPECT_EQ(request.gs_subscription_callback, &GSController::stub_subscribeCb);

  api.answer = WYX_NO_INIT;
  watcher.setSubscriptionCtrl(WYX_SUBSCRIBE_MEMBERSHIP);
  EXPECT_EQ(watcher.subscribeGroup(), WYX_NO_INIT);
  EXPECT_EQ(api.proposal._gs_protocol_info._gs_subscribe_request.gs_subscription_control, 0x8);
  EXPECT_EQ(watcher.getClientState(), GS_IAM_IDLE);
  EXPECT_EQ(watcher.getToken(), -1);
  api.watch(nullptr);
}

TEST(SubscriberRequest, Unsubscribe_byState_refusedOrIssued) {
  RecordingApi api;
  GSController controller;
  Watcher watcher("g", WYX_SUBSCRIBE_MEMBERSHIP);
  api.take();
  api.watch(&watcher);
  EXPECT_EQ(watcher.unsubscribeGroup(), WYX_BAD_MEMBER_TOKEN);
  EXPECT_EQ(api.take(),
            (std::vector<std::string>{
                "IDLE/-1 A stub_unsubscribe_group(Subs[G=g,T=-1]) cannot be issued because it is not subscribed.",
                "IDLE/-1 A Subs[G=g,T=-1]: unsubscribe sync_rc=WYX_BAD_MEMBER_TOKEN"}));
  subscribed(watcher);
  api.answer = WYX_NO_INIT;
  EXPECT_EQ(watcher.unsubscribeGroup(), WYX_NO_INIT);
  EXPECT_EQ(watcher.getClientState(), GS_IAM_SUBSCRIBED);
  api.take();
  api.answer = WYX_OK;
  EXPECT_EQ(watcher.unsubscribeGroup(), WYX_OK);
  EXPECT_EQ(api.take(),
            (std::vector<std::string>{"SUBSCRIBED/12 D beginTransaction @", "SUBSCRIBED/12 wyx_unsubscribe(12)",
                                      "IDLE/-1 D endTransaction @",
                                      "IDLE/-1 A stub_unsubscribe_group(Subs[G=g,T=-1]) returns sync_rc=WYX_OK",
                                      "IDLE/-1 A Subs[G=g,T=-1]: unsubscribe sync_rc=WYX_OK"}));
  api.watch(nullptr);
}

TEST(Request, Join_forgetsMembersAndStateValuesOfAnEarlierLife) {
  RecordingApi api;
  GSController controller;
  Member member("g", 3, nullptr);
  joined(member);
  Proposal proposal(otherId());
  proposal.current("state");
  proposal.proposed("next");
  const auto n = proposal.approved(WYX_STATE_VALUE_CHANGE);
  GSController::stub_approvedCb(&n);
  ASSERT_EQ(currentValue(member), "state");
  ASSERT_EQ(member.getMemberCount(), 1);
  EXPECT_EQ(member.joinGroup(), WYX_OK);
  EXPECT_EQ(member.getMemberCount(), 0);
  EXPECT_EQ(currentValue(member), "");
  EXPECT_EQ(proposedValue(member), "");
}

TEST(Request, MissingEntryPoint_notSupported) {
  RecordingApi api;
  GSController controller;
  Member member("g", 3, nullptr);
  api.table.wyx_join = nullptr;
  api.table.wyx_vote = nullptr;
  EXPECT_EQ(member.joinGroup(), WYX_NOT_SUPPORTED);
  EXPECT_EQ(member.getClientState(), GS_IAM_IDLE);
  EXPECT_EQ(member.vote(WYX_VOTE_APPROVE, WYX_VOTE_APPROVE, nullptr, nullptr), WYX_NOT_SUPPORTED);
}

TEST(Request, WithoutController_theBaseApiDecides) {
  RecordingApi api;
  Member member("g", 3, nullptr);
  api.answer = WYX_NO_INIT;
  EXPECT_EQ(member.joinGroup(), WYX_NO_INIT);
  EXPECT_EQ(member.getClientState(), GS_IAM_IDLE);
}

void throwing(int level, char* text) {
  if (level == GSCL_TRC_DETAIL && std::string(text).starts_with("beginTransaction")) throw std::bad_alloc();
}

TEST(Request, TraceRoutineThatThrows_leavesNoLockHeld) {
  RecordingApi api;
  GSController controller;
  Member member("g", 3, nullptr);
  const gscl_tracef_rtn before = GSSetTraceRtn(throwing);
  EXPECT_THROW(member.joinGroup(), std::bad_alloc);
  GSSetTraceRtn(before);
  // Another thread would wait for ever on a lock left behind.
  wyx_rc_t rc = WYX_NOT_OK;
  std::thread([&] { rc = member.joinGroup(); }).join();
  EXPECT_EQ(rc, WYX_OK);
}

}  // namespace
