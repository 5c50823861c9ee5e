// Every notification: the order of its steps, its trace lines, what it does to the client, who is told.
#include <atomic>
#include <chrono>
#include <memory>
#include <optional>
#include <thread>

#include "recording_api.h"

namespace {

using namespace recording;

const char* const kNotMine[] = {"D setNotify for_my_req=0 ...set tid_for_my_own to NULL",
                                "D setNotify for_my_req=0 but no-any-callbacks"};

/// The events of one delivery to a client that stays in `at` ("JOINED/12"), with `inner` around the callback's
/// place.
std::vector<std::string> delivery(const std::string& at, const std::vector<std::string>& inner,
                                  const std::string& told) {
  std::vector<std::string> events;
  const auto add = [&](const std::string& what) { events.push_back(at + " " + what); };
  const auto notMine = [&] {
    for (const char* line : kNotMine) add(line);
  };
  add("D beginTransaction @");
  if (told.empty()) {
    notMine();
  } else {
    add("D setNotify where=1 for_my_req=1 NOT-AFTER...");
  }
  add("D endTransaction @");
  for (const std::string& what : inner) add(what);
  add("D beginTransaction @");
  if (told.empty()) {
    notMine();
  } else {
    add("D " + told);
    add("D ApplyNotify(seq=S)");
    add("D PassNotify (seq=S)");
  }
  add("D endTransaction @");
  return events;
}

std::vector<std::string> operator+(std::vector<std::string> a, const std::vector<std::string>& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

using Lines = std::vector<std::string>;

// Requests are numbered over the whole process, so the numbers depend on the tests before.
Lines withoutNumbers(Lines lines) {
  for (std::string& line : lines) {
    const size_t at = line.find("(seq=");
    if (at != std::string::npos) line.replace(at, std::string::npos, "(seq=S)");
  }
  return lines;
}

class Routing : public testing::Test {
 protected:
  Lines steps() { return withoutNumbers(api.take()); }

  /// Watches from here on.
  void watch(GSClient& client) {
    api.take();
    api.watch(&client);
  }
  ~Routing() override { api.watch(nullptr); }

  RecordingApi api;
  GSController controller;
  std::optional<Member> member_{std::in_place, "g", short{3}, nullptr};
  Member& member = *member_;
  Watcher watcher{"g", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP};
};

TEST_F(Routing, ApprovedJoin_ofTheJoiner_makesItAMember) {
  member.joinGroup();
  watch(member);
  Proposal proposal(ownId(), WYX_UPDATED_MEMBERSHIP);
  proposal.members({otherId(), ownId()});
  proposal.current("state");
  const auto n = proposal.approved(WYX_JOIN);
  GSController::stub_approvedCb(&n);
  const std::string id = "(Prov[g,Id=3/7,T=12])";
  EXPECT_EQ(
      steps(),
      (Lines{"JOINING/12 A GSController::stub_approvedCb(Prov[g,Id=-1/-1,T=12]) for prot=WYX_JOIN  "
             "sumCode=WYX_EXPLICIT_APPROVE, whats_changed=0x20",
             "JOINING/12 A Client[Prov[g,Id=3/7,T=12]] ClientState: GS_IAM_JOINING to GS_IAM_JOINED.",
             "JOINED/12 A GSController::stub_approved: set new members"}) +
          delivery("JOINED/12", {"D calling approvedCb()", "-> approvedCb", "D returned from approvedCb()"},
                   "setNotify" + std::string("(Prov[g,Id=3/7,T=12], where=2,what=WYX_APPROVED_NOTIFICATION,") +
                       "type=WYX_JOIN) IS_MYREQ=1") +
          Lines{"JOINED/12 A GSController::stub_approvedCb" + id + " done"});
  EXPECT_EQ(member.getOldClientState(), GS_IAM_JOINING);
  EXPECT_EQ(member.getMemberCount(), 2);
  EXPECT_EQ(currentValue(member), "state");
}

TEST_F(Routing, ApprovedJoin_ofAnother_saysAlreadyJoinedAndStillApplies) {
  joined(member);
  watch(member);
  Proposal proposal(otherId(), WYX_UPDATED_MEMBERSHIP);
  proposal.members({ownId(), otherId()});
  const auto n = proposal.approved(WYX_JOIN);
  GSController::stub_approvedCb(&n);
  EXPECT_EQ(
      steps(),
      (Lines{"JOINED/12 A GSController::stub_approvedCb(Prov[g,Id=3/7,T=12]) for prot=WYX_JOIN  "
             "sumCode=WYX_EXPLICIT_APPROVE, whats_changed=0x20",
             "JOINED/12 A GSController::stub_approvedCb(Prov[g,Id=3/7,T=12])- I was already joined.. "
             "ID=[3/7]. my_req=0",
             "JOINED/12 A GSController::stub_approved: set new members"}) +
          delivery("JOINED/12", {"D calling approvedCb()", "-> approvedCb", "D returned from approvedCb()"}, "") +
          Lines{"JOINED/12 A GSController::stub_approvedCb(Prov[g,Id=3/7,T=12]) done"});
  EXPECT_EQ(member.getId(), ownId());
  EXPECT_EQ(member.getMemberCount(), 2);
}

TEST_F(Routing, ApprovedWithoutMembership_keepsMembersAndReplacesBothValues) {
  joined(member);
  Proposal first(otherId());
  first.current("one");
  first.proposed("two");
  const auto with = first.approved(WYX_STATE_VALUE_CHANGE);
  GSController::stub_approvedCb(&with);
  EXPECT_EQ(currentValue(member) + "/" + proposedValue(member), "one/two");
  Proposal second(otherId());
  const auto without = second.approved(WYX_STATE_VALUE_CHANGE);
  GSController::stub_approvedCb(&without);
  EXPECT_EQ(currentValue(member) + "/" + proposedValue(member), "/");
  EXPECT_EQ(member.getMemberCount(), 1);
}

// Whether a notification reaches the waiters, seen at the line that only an own request writes.
bool told(const Lines& lines) {
  return std::any_of(lines.begin(), lines.end(),
                     [](const std::string& l) { return l.find("IS_MYREQ=1") != l.npos; });
}

TEST_F(Routing, OwnRequest_byProtocolAndProposer) {
  struct Case {
    wyx_request_t protocol;
    bool mine;
    bool told;
  };
  for (const Case& c : {Case{WYX_STATE_VALUE_CHANGE, true, true}, Case{WYX_STATE_VALUE_CHANGE, false, false},
                        Case{WYX_EXPEL, true, true}, Case{WYX_FAILURE_LEAVE, true, false},
                        // The proposer says nothing about a join.
                        Case{WYX_JOIN, true, false}}) {
    Proposal proposal(c.mine ? ownId() : otherId());
    const auto approved = proposal.approved(c.protocol);
    const auto rejected = proposal.rejected(c.protocol);
    joined(member);
    GSController::stub_approvedCb(&approved);
    EXPECT_EQ(told(api.take()), c.told) << "approved " << c.protocol;
    GSController::stub_rejectedCb(&rejected);
    EXPECT_EQ(told(api.take()), c.told) << "rejected " << c.protocol;
    const auto phase = proposal.phase(c.protocol, 1);
    GSController::stub_nPhaseCb(&phase);
    EXPECT_EQ(told(api.take()), c.told) << "phase of " << c.protocol;
    EXPECT_EQ(member.getClientState(), GS_IAM_JOINED);
  }
}

TEST_F(Routing, OwnLeave_approvedRejectedOrInPhase_endsTheMembership) {
  for (int kind = 0; kind < 3; ++kind) {
    joined(member);
    Proposal proposal(ownId());
    const auto approved = proposal.approved(WYX_LEAVE);
    const auto rejected = proposal.rejected(WYX_LEAVE);
    auto phase = proposal.phase(WYX_LEAVE, 1);
    if (kind == 0) GSController::stub_approvedCb(&approved);
    if (kind == 1) GSController::stub_rejectedCb(&rejected);
    if (kind == 2) GSController::stub_nPhaseCb(&phase);
    EXPECT_EQ(member.getClientState(), GS_IAM_IDLE) << kind;
    EXPECT_TRUE(told(api.take())) << kind;
  }
}

TEST_F(Routing, RejectedJoin_ofTheJoiner_makesItIdle) {
  member.joinGroup();
  watch(member);
  Proposal proposal(ownId());
  proposal.current("state");
  const auto n = proposal.rejected(WYX_JOIN);
  GSController::stub_rejectedCb(&n);
  EXPECT_EQ(steps(),
            (Lines{"JOINING/12 A GSController::stub_rejectCb(Prov[g,Id=-1/-1,T=12]) protocol=WYX_JOIN "
                   "sumCode=WYX_EXPLICIT_REJECT, myId=-1 provider_token=12",
                   "JOINING/12 A Client[Prov[g,Id=-1/-1,T=12]] ClientState: GS_IAM_JOINING to GS_IAM_IDLE."}) +
                delivery("IDLE/12", {"-> rejectedCb"},
                         "setNotify(Prov[g,Id=-1/-1,T=12], where=2,what=WYX_REJECTED_NOTIFICATION,type=WYX_JOIN) "
                         "IS_MYREQ=1"));
  EXPECT_EQ(currentValue(member), "state");
}

TEST_F(Routing, NPhase_ofAnOwnJoin_takesTheCurrentValueBeforeItsLine) {
  member.joinGroup();
  watch(member);
  Proposal proposal(ownId(), WYX_PROPOSED_STATE_VALUE);
  proposal.current("now");
  proposal.proposed("next");
  const auto n = proposal.phase(WYX_JOIN, 1);
  GSController::stub_nPhaseCb(&n);
  EXPECT_EQ(steps(),
            (Lines{"JOINING/12 A GSController::stub_nPhaseCb(Prov[g,Id=-1/-1,T=12]) protocol=WYX_JOIN token=12, "
                   "sumCode=WYX_EXPLICIT_APPROVE, notification=WYX_N_PHASE_NOTIFICATION"}) +
                delivery("JOINING/12", {"-> nPhaseCb"},
                         "setNotify(Prov[g,Id=-1/-1,T=12], where=2,what=WYX_N_PHASE_NOTIFICATION,type=WYX_JOIN) "
                         "IS_MYREQ=1"));
  EXPECT_EQ(currentValue(member) + "/" + proposedValue(member), "now/next");
}

TEST_F(Routing, NPhase_ofAnother_clearsTheProposedValueOnlyInTheFirstPhase) {
  joined(member);
  Proposal with(otherId(), WYX_PROPOSED_STATE_VALUE);
  with.current("ignored");
  with.proposed("next");
  const auto first = with.phase(WYX_STATE_VALUE_CHANGE, 1);
  GSController::stub_nPhaseCb(&first);
  EXPECT_EQ(currentValue(member) + "/" + proposedValue(member), "/next");
  Proposal without(otherId());
  const auto second = without.phase(WYX_STATE_VALUE_CHANGE, 2, 3);
  GSController::stub_nPhaseCb(&second);
  EXPECT_EQ(proposedValue(member), "next");
  const auto one_phase = without.phase(WYX_STATE_VALUE_CHANGE, 2, 1);
  GSController::stub_nPhaseCb(&one_phase);
  EXPECT_EQ(proposedValue(member), "");
}

TEST_F(Routing, Announcement_comparedWhole_endsTheMembershipOrNot) {
  joined(member);
  watch(member);
  const auto ordinary = announcement(WYX_GROUP_DISSOLVED | WYX_DEFAULT_APPROVE);
  GSController::stub_announcementCb(&ordinary);
  EXPECT_EQ(steps(), (Lines{"JOINED/12 A GSController::stub_announceCb(Prov[g,Id=3/7,T=12]) "
                            "summary=WYX_DEFAULT_APPROVE|WYX_DISSOLVED"}) +
                         delivery("JOINED/12", {"-> announcementCb"}, ""));
  const auto dissolved = announcement(WYX_GROUP_DISSOLVED);
  GSController::stub_announcementCb(&dissolved);
  EXPECT_EQ(steps(),
            (Lines{"JOINED/12 A GSController::stub_announceCb(Prov[g,Id=3/7,T=12]) summary=WYX_GROUP_DISSOLVED",
                   "JOINED/12 A Client[Prov[g,Id=3/7,T=12]] ClientState: GS_IAM_JOINED to GS_IAM_IDLE."}) +
                delivery("IDLE/-1", {"-> announcementCb"},
                         "setNotify(Prov[g,Id=3/7,T=-1], where=2,what=WYX_ANNOUNCEMENT_NOTIFICATION,"
                         "type=empty-request) IS_MYREQ=1"));
  joined(member);
  const auto died = announcement(WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY);
  GSController::stub_announcementCb(&died);
  EXPECT_EQ(member.getToken(), -1);
}

TEST_F(Routing, Merge_onlyCallsBack) {
  joined(member);
  watch(member);
  wyx_merge_notification_t n = {};
  n.gs_notification_type = WYX_MERGE_NOTIFICATION;
  n.gs_provider_token = kToken;
  GSController::stub_mergeCb(&n);
  n.gs_provider_token = 99;
  GSController::stub_mergeCb(&n);
  EXPECT_EQ(steps(), Lines{"JOINED/12 -> mergeCb"});
}

TEST_F(Routing, Subscription_firstNotification_subscribesAndPicksOneMembership) {
  watcher.subscribeGroup();
  watch(watcher);
  wyx_provider_t full[] = {ownId()}, changing[] = {otherId()};
  wyx_membership_t full_record = {1, full}, changing_record = {1, changing};
  char text[] = "v";
  wyx_state_value_t value = {1, text};
  auto n = subscription(WYX_SUBSCRIPTION_MEMBERSHIP | WYX_SUBSCRIPTION_DELTA_JOIN | WYX_SUBSCRIPTION_STATE);
  n.gs_full_membership = &full_record;
  n.gs_changing_membership = &changing_record;
  n.gs_state_value = &value;
  GSController::stub_subscribeCb(&n);
  EXPECT_EQ(steps(), (Lines{"SUBSCRIBED/12 A Subs[G=g,T=12] is now subscribed.",
                            "SUBSCRIBED/12 A Subs[G=g,T=12] received FULL_MBRSHIP."}) +
                         delivery("SUBSCRIBED/12", {"-> subscribeCb"},
                                  "setNotify(Subs[G=g,T=12], where=2,what=WYX_SUBSCRIPTION_NOTIFICATION,"
                                  "type=WYX_SUBSCRIPTION) IS_MYREQ=1"));
  EXPECT_EQ(currentValue(watcher), "v");
  wyx_provider_t id = {};
  ASSERT_EQ(watcher.getMemberCount(), 1);
  ASSERT_EQ(watcher.getMemberAt(0, &id), 1);
  EXPECT_EQ(id, ownId());

  const auto lineOf = [&](int type) {
    n.gs_subscription_type = static_cast<wyx_subscription_type_t>(type);
    GSController::stub_subscribeCb(&n);
    return api.take().front();
  };
  EXPECT_EQ(lineOf(WYX_SUBSCRIPTION_DELTA_JOIN | WYX_SUBSCRIPTION_DELTA_LEAVE),
            "SUBSCRIBED/12 A Subs[G=g,T=12] received DELTA_JOINS.");
  EXPECT_EQ(watcher.getMemberCount(), 2);
  EXPECT_EQ(lineOf(WYX_SUBSCRIPTION_DELTA_LEAVE), "SUBSCRIBED/12 A Subs[G=g,T=12] received DELTA_LEAVES.");
  EXPECT_EQ(watcher.getMemberCount(), 1);
  EXPECT_EQ(lineOf(WYX_SUBSCRIPTION_SPECIAL_DATA), "SUBSCRIBED/12 A WHATELSE=40");
  EXPECT_EQ(currentValue(watcher), "v");
}

TEST_F(Routing, Subscription_dissolved_endsItWithTheTokenKept) {
  for (int flag : {WYX_SUBSCRIPTION_DISSOLVED, WYX_SUBSCRIPTION_GS_HAS_DIED}) {
    subscribed(watcher);
    watch(watcher);
    const auto n = subscription(flag | WYX_SUBSCRIPTION_MEMBERSHIP);
    GSController::stub_subscribeCb(&n);
    EXPECT_EQ(steps(), (Lines{"SUBSCRIBED/12 A Subs[G=g,T=12] is dissolved."}) +
                           delivery("IDLE/12", {"-> subscribeCb"},
                                    "setNotify(Subs[G=g,T=12], where=2,what=WYX_SUBSCRIPTION_NOTIFICATION,"
                                    "type=WYX_SUBSCRIPTION) IS_MYREQ=1"));
    api.watch(nullptr);
  }
}

TEST_F(Routing, DelayedError_ofEntryOrProposal_idleOrUnchanged) {
  joined(member);
  watch(member);
  const auto proposal = delayedError(WYX_STATE_VALUE_CHANGE, WYX_COLLIDE);
  GSController::stub_delayedErrorCb(&proposal);
  EXPECT_EQ(steps(), (Lines{"JOINED/12 A GSController::stub_delayedErrorCb(Prov[g,Id=3/7,T=12]) "
                            "protocol=WYX_STATE_VALUE_CHANGE token=12, delayRc=WYX_COLLIDE"}) +
                         delivery("JOINED/12", {"-> delayedErrorCb"},
                                  "setNotify(Prov[g,Id=3/7,T=12], where=2,what=WYX_DELAYED_ERROR_NOTIFICATION,"
                                  "type=WYX_STATE_VALUE_CHANGE) IS_MYREQ=1"));
  const auto entry = delayedError(WYX_JOIN, WYX_COLLIDE);
  GSController::stub_delayedErrorCb(&entry);
  EXPECT_EQ(member.getClientState(), GS_IAM_IDLE);
  EXPECT_EQ(member.getToken(), kToken);
}

TEST_F(Routing, UnknownToken_tracedAndDropped) {
  joined(member);
  Proposal proposal(otherId());
  const auto approved = proposal.approved(WYX_JOIN, 99);
  api.token = 13;
  subscribed(watcher);
  const auto rejected = proposal.rejected(WYX_JOIN, 13);  // a subscriber's
  const auto phase = proposal.phase(WYX_JOIN, 1, 2, 99);
  auto announced = announcement(WYX_GROUP_DISSOLVED);
  announced.gs_provider_token = 99;
  auto error = delayedError(WYX_LEAVE, WYX_NOT_OK);
  error.gs_request_token = 99;
  const auto of_a_provider = subscription(WYX_SUBSCRIPTION_STATE);
  GSController::stub_approvedCb(&approved);
  GSController::stub_rejectedCb(&rejected);
  GSController::stub_nPhaseCb(&phase);
  GSController::stub_announcementCb(&announced);
  GSController::stub_delayedErrorCb(&error);
  GSController::stub_subscribeCb(&of_a_provider);
  EXPECT_EQ(
      steps(),
      (Lines{"W stub_approvedCb provider_token=99 not found", "W stub_rejectedCb provider_token=13 not found",
             "W stub_nPhaseCb token 99 not found", "W stub_announcementCb provider_token=99 not found",
             "W GSController::stub_delayedErrCb - unable to find a client(token=99) for protocol=WYX_LEAVE",
             "W Subscriber 12 is not found...ERROR"}));
}

TEST_F(Routing, IdleClient_isNotFound) {
  const auto n = delayedError(WYX_JOIN, WYX_COLLIDE);
  member.joinGroup();
  GSController::stub_delayedErrorCb(&n);
  api.take();
  Proposal proposal(ownId());
  const auto late = proposal.approved(WYX_JOIN);
  GSController::stub_approvedCb(&late);
  EXPECT_EQ(steps(), Lines{"W stub_approvedCb provider_token=12 not found"});
}

TEST_F(Routing, Callback_mayDestroyItsOwnClient) {
  joined(member);
  member.action = [&] { member_.reset(); };
  Proposal proposal(otherId());
  const auto n = proposal.approved(WYX_STATE_VALUE_CHANGE);
  GSController::stub_approvedCb(&n);
  const Lines lines = steps();
  // Nothing that needs the client follows its end.
  ASSERT_GE(lines.size(), 2u);
  EXPECT_EQ(lines[lines.size() - 2],
            "W The provider(Prov[g,Id=3/7,T=12]) is being deleted before leaving the group.");
  EXPECT_EQ(lines.back(), "D returned from approvedCb()");
  GSController::stub_approvedCb(&n);
  EXPECT_EQ(steps(), Lines{"W stub_approvedCb provider_token=12 not found"});
}

TEST_F(Routing, NestedDispatch_thatDestroysTheOuterClient_isNoticedByBothDeliveries) {
  joined(member);
  Proposal proposal(otherId());
  const auto outer = proposal.approved(WYX_STATE_VALUE_CHANGE);
  const auto inner = announcement(WYX_DEFAULT_APPROVE);
  int depth = 0;
  member.action = [&] {
    if (++depth == 1) return GSController::stub_announcementCb(&inner);
    member_.reset();
    // Likely at the same address: it must not be taken for the old one.
    member_.emplace("h", short{3}, nullptr);
    member_->joinGroup();
  };
  GSController::stub_approvedCb(&outer);
  EXPECT_EQ(depth, 2);
  EXPECT_EQ(api.take().back(), "D returned from approvedCb()");
  EXPECT_EQ(member_->getClientState(), GS_IAM_JOINING);
}

TEST_F(Routing, Callback_mayRequestVoteAndConstructClients) {
  joined(member);
  Proposal proposal(otherId());
  const auto n = proposal.phase(WYX_STATE_VALUE_CHANGE, 1);
  std::unique_ptr<Member> another;
  member.action = [&] {
    EXPECT_EQ(member.vote(WYX_VOTE_APPROVE, WYX_VOTE_REJECT, nullptr, nullptr), WYX_OK);
    api.token = 13;
    another = std::make_unique<Member>("h", short{1}, nullptr);
    EXPECT_EQ(another->joinGroup(), WYX_OK);
    EXPECT_EQ(controller.dispatch(WYX_NON_BLOCKING), WYX_OK);
  };
  GSController::stub_nPhaseCb(&n);
  EXPECT_EQ(another->getToken(), 13);
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

TEST(RoutingLife, Destructor_waitsForADeliveryOnAnotherThread) {
  RecordingApi api(GSCL_TRC_API);
  GSController controller;
  auto provider = std::make_unique<GSProvider>("g", short{3}, nullptr);
  joined(*provider);
  in_callback = destroying = delivered = false;
  const gscl_tracef_rtn before = GSSetTraceRtn(holdCallbackUntilDestructionBegins);
  Proposal proposal(otherId());
  const auto n = proposal.approved(WYX_STATE_VALUE_CHANGE);
  std::thread deliverer([&] { GSController::stub_approvedCb(&n); });
  while (!in_callback) std::this_thread::yield();
  provider.reset();
  EXPECT_TRUE(delivered);
  deliverer.join();
  GSSetTraceRtn(before);
}

TEST(RoutingLife, WithoutController_everythingIsDroppedWithALine) {
  RecordingApi api;
  Proposal proposal(ownId());
  const auto approved = proposal.approved(WYX_JOIN);
  const auto rejected = proposal.rejected(WYX_JOIN);
  const auto phase = proposal.phase(WYX_JOIN, 1);
  const auto announced = announcement(WYX_GROUP_DISSOLVED);
  const auto subscribed_to = subscription(WYX_SUBSCRIPTION_STATE);
  const auto error = delayedError(WYX_JOIN, WYX_COLLIDE);
  const wyx_merge_notification_t merge = {};
  const wyx_responsiveness_notification_t alive = {};
  const wyx_query_notification_t query = {};
  wyx_domain_control_notification_t domain = {};
  domain.domain_event_type = WYX_DOMAIN_MERGE;
  GSController::stub_approvedCb(&approved);
  GSController::stub_rejectedCb(&rejected);
  GSController::stub_nPhaseCb(&phase);
  GSController::stub_announcementCb(&announced);
  GSController::stub_subscribeCb(&subscribed_to);
  GSController::stub_delayedErrorCb(&error);
  GSController::stub_mergeCb(&merge);
  EXPECT_EQ(stub_responsivenessCb(&alive), WYX_CALLBACK_OK);
  stub_queryCb(&query);
  const Lines lines = api.take();
  EXPECT_EQ(lines.size(), 9u);
  for (const std::string& line : lines) EXPECT_EQ(line.front(), 'W') << line;
  stub_domain_controlCb(&domain);
  EXPECT_EQ(api.take()[1], "W stub_domain_control_cb() domain_event=2 dropped: no controller of version 3");
}

}  // namespace
