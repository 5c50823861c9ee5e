// What a client, a provider and a subscriber hold and say themselves: names, values, attributes, default
// callbacks.
#include <pthread.h>
#include <string.h>

#include "lock_peek.h"
#include "recording_api.h"

namespace {

using namespace recording;
using Lines = std::vector<std::string>;

const char kLongName[] = "0123456789012345678901234567890123456789";

TEST(Client, New_isIdleWithoutTokenAndMembers) {
  RecordingApi api(0);
  GSController controller;
  GSProvider provider("g", 3, nullptr);
  GSMembershipList members;
  members.append(otherId());
  wyx_provider_t id = otherId();
  EXPECT_EQ(provider.getClientState(), GS_IAM_IDLE);
  EXPECT_EQ(provider.getOldClientState(), GS_IAM_IDLE);
  EXPECT_EQ(provider.getToken(), -1);
  EXPECT_EQ(provider.getMemberCount(), 0);
  EXPECT_EQ(provider.getMembers(members), 0);
  EXPECT_EQ(members.count(), 1) << "left alone";
  EXPECT_EQ(provider.getMemberAt(0, &id), 0);
  EXPECT_EQ(provider.getId().gs_provider_id, -1);
  EXPECT_EQ(provider.type(), GS_PROVIDER);
  EXPECT_EQ(GSSubscriber("g", WYX_SUBSCRIBE_STATE).type(), GS_SUBSCRIBER);
}

TEST(Client, GroupName_isCutAt32_andNullTakesItAway) {
  RecordingApi api(GSCL_TRC_API);
  GSController controller;
  GSSubscriber subscriber(kLongName, WYX_SUBSCRIBE_STATE);
  EXPECT_STREQ(subscriber.getGroupName(), std::string(kLongName, 32).c_str());
  subscriber.subscribeGroup();
  EXPECT_EQ(api.subscribed_group.size(), 32u);
  subscriber.setGroupName(nullptr);
  EXPECT_EQ(subscriber.getGroupName(), nullptr);
  EXPECT_STREQ(zelt_gscl_V1::getTraceIdStr(&subscriber), "Subs[G=(null),T=12]");
  subscriber.setGroupName(kLongName);
  EXPECT_EQ(strlen(subscriber.getGroupName()), 32u);
  subscriber.setGroupName("g");
  EXPECT_STREQ(zelt_gscl_V1::getTraceIdStr(&subscriber), "Subs[G=g,T=12]");
}

TEST(Client, Getters_byStateAndIndex) {
  RecordingApi api(0);
  GSController controller;
  GSProvider provider("g", 3, nullptr);
  joined(provider);
  Proposal proposal(otherId(), WYX_UPDATED_MEMBERSHIP);
  proposal.members({ownId(), otherId()});
  proposal.current("now");
  proposal.proposed("next");
  const auto n = proposal.approved(WYX_JOIN);
  GSController::stub_approvedCb(&n);
  wyx_provider_t id = {};
  EXPECT_EQ(provider.getMemberAt(1, &id), 1);
  EXPECT_EQ(id, otherId());
  EXPECT_EQ(provider.getMemberAt(2, &id), 0);
  EXPECT_EQ(provider.getMemberAt(-1, &id), 0);
  EXPECT_EQ(provider.getMemberAt(0, nullptr), 0);
  GSStateValue value;
  EXPECT_EQ(provider.getProposedStateValue(value), 1);
  EXPECT_EQ(textOf(value), "next");

  const auto error = delayedError(WYX_JOIN, WYX_COLLIDE);
  GSController::stub_delayedErrorCb(&error);
  EXPECT_EQ(provider.getMemberCount(), 0) << "the list is still there, but the client is idle";
  EXPECT_EQ(provider.getCurrentStateValue(value), 0);
  EXPECT_EQ(textOf(value), "now");
}

TEST(Client, OldState_movesAlsoWithoutAChange) {
  RecordingApi api(0);
  GSController controller;
  GSProvider provider("g", 3, nullptr);
  provider.joinGroup();
  provider.joinGroup();
  EXPECT_EQ(provider.getOldClientState(), GS_IAM_JOINING);
  joined(provider);
  EXPECT_EQ(provider.getOldClientState(), GS_IAM_JOINING);
  Proposal proposal(ownId());
  const auto leave = proposal.phase(WYX_LEAVE, 1);
  GSController::stub_nPhaseCb(&leave);
  EXPECT_EQ(provider.getOldClientState(), GS_IAM_JOINED);
}

TEST(Provider, Names_givenOrFormed) {
  RecordingApi api(0);
  GSController controller;
  EXPECT_STREQ(GSProvider("grp", 3, nullptr).getLocalName(), "grp_3");
  GSProvider named("grp", -2, "mine");
  EXPECT_STREQ(named.getLocalName(), "mine");
  EXPECT_EQ(named.getInstanceNumber(), -2);
  const std::string huge(5000, 'x');
  EXPECT_EQ(GSProvider(huge.c_str(), -32768, nullptr).getLocalName(), huge + "_-32768");
  EXPECT_STREQ(GSProvider(nullptr, 1, nullptr).getLocalName(), "_1");
}

TEST(Provider, Attributes_defaultsCopiesAndTheNameThatIsJoined) {
  RecordingApi api(0);
  GSController controller;
  GSProvider provider("g", 3, "local");
  wyx_group_attributes_t held = {};
  provider.getGroupAttributes(&held);
  EXPECT_EQ(held.gs_num_phases, WYX_1_PHASE);
  EXPECT_EQ(held.gs_source_reflection_num_phases, WYX_1_PHASE);
  EXPECT_EQ(held.gs_group_default_vote, WYX_VOTE_APPROVE);
  EXPECT_EQ(held.gs_time_limit, 0);
  EXPECT_EQ(held.gs_sizeof_group_attributes, 56);
  EXPECT_STREQ(held.gs_group_name, "g");
  EXPECT_EQ(held.gs_source_group_name, nullptr);

  char other[] = "other", source[] = "source";
  wyx_group_attributes_t wanted = held;
  wanted.gs_version = 5;
  wanted.gs_num_phases = WYX_N_PHASE;
  wanted.gs_group_name = other;
  wanted.gs_source_group_name = source;
  provider.setGroupAttributes(&wanted);
  provider.setGroupAttributes(nullptr);
  provider.getGroupAttributes(nullptr);
  provider.getGroupAttributes(&held);
  EXPECT_EQ(held.gs_num_phases, WYX_N_PHASE);
  EXPECT_EQ(held.gs_version, 0);
  EXPECT_STREQ(held.gs_group_name, "other");
  EXPECT_NE(held.gs_group_name, other);

  provider.setInstanceNumber(9);
  provider.joinGroup();
  EXPECT_EQ(api.join_text, "g/9/local");
  const wyx_join_request_t& join = api.proposal._gs_protocol_info._gs_join_request;
  EXPECT_EQ(join.gs_n_phase_protocol_callback, &GSController::stub_nPhaseCb);
  EXPECT_EQ(join.gs_protocol_approved_callback, &GSController::stub_approvedCb);
  EXPECT_EQ(join.gs_protocol_rejected_callback, &GSController::stub_rejectedCb);
  EXPECT_EQ(join.gs_announcement_callback, &GSController::stub_announcementCb);
  EXPECT_EQ(join.gs_merge_callback, &GSController::stub_mergeCb);
}

// Notes which virtual form each request goes through.
class Overrider : public GSProvider {
 public:
  using GSProvider::change_attributes;
  using GSProvider::changeStateValue;
  using GSProvider::expelMembers;
  using GSProvider::GSProvider;
  using GSProvider::leaveGroup;
  using GSProvider::send_message;
  using Info = const wyx_proposal_info_t*;
  wyx_rc_t changeStateValue(Info p) override { return slot = 11, GSProvider::changeStateValue(p); }
  wyx_rc_t leaveGroup(Info p) override { return slot = 12, GSProvider::leaveGroup(p); }
  wyx_rc_t expelMembers(Info p) override { return slot = 13, GSProvider::expelMembers(p); }
  wyx_rc_t send_message(Info p) override { return slot = 14, GSProvider::send_message(p); }
  wyx_rc_t change_attributes(Info p) override { return slot = 16, GSProvider::change_attributes(p); }
  int slot = 0;
};

TEST(Provider, ConvenienceForms_fillTheRequestAndCallTheVirtualForm) {
  RecordingApi api(0);
  GSController controller;
  Overrider provider("g", 3, nullptr);
  auto& last = api.proposal._gs_protocol_info;
  api.answer = WYX_EXISTS;
  char text[] = "abc";
  const wyx_state_value_t value = {3, text};

  EXPECT_EQ(provider.changeStateValue(value, WYX_N_PHASE, 30), WYX_EXISTS);
  EXPECT_EQ(provider.slot, 11);
  EXPECT_EQ(last._gs_state_change_request.gs_num_phases, WYX_N_PHASE);
  EXPECT_EQ(last._gs_state_change_request.gs_time_limit, 30);
  EXPECT_EQ(last._gs_state_change_request.gs_new_state.gs_state, text);
  provider.changeStateValue(GSStateValue(&value), WYX_1_PHASE, 0);
  EXPECT_EQ(last._gs_state_change_request.gs_new_state.gs_length, 3);
  provider.changeStateValue(GSStateValue(), WYX_1_PHASE, 0);
  EXPECT_EQ(last._gs_state_change_request.gs_new_state.gs_length, 0);
  const wyx_state_change_request_t change = {WYX_N_PHASE, 7, value};
  provider.changeStateValue(&change);
  EXPECT_EQ(last._gs_state_change_request.gs_time_limit, 7);

  provider.leaveGroup(0x1, WYX_N_PHASE, 30);
  EXPECT_EQ(provider.slot, 12);
  EXPECT_EQ(last._gs_leave_request.gs_leave_code, 1u);
  const wyx_leave_request_t leave = {WYX_1_PHASE, 2, 9};
  provider.leaveGroup(&leave);
  EXPECT_EQ(last._gs_leave_request.gs_leave_code, 9u);

  const wyx_expel_request_t expel = {WYX_1_PHASE, 2, {0, nullptr}, 4, text};
  provider.expelMembers(&expel);
  EXPECT_EQ(provider.slot, 13);
  EXPECT_EQ(last._gs_expel_request.gs_deactivate_phase, 4);
  EXPECT_EQ(last._gs_expel_request.gs_deactivate_flag, text);

  provider.send_message({3, text}, WYX_N_PHASE, 5);
  EXPECT_EQ(provider.slot, 14);
  EXPECT_EQ(last._gs_message_request.gs_message.gs_message, text);
  const wyx_message_request_t message = {WYX_1_PHASE, 6, {2, text}};
  provider.send_message(&message);
  EXPECT_EQ(last._gs_message_request.gs_message.gs_length, 2);

  wyx_group_attributes_t attributes = {};
  provider.change_attributes(attributes, WYX_N_PHASE, 8);
  EXPECT_EQ(provider.slot, 16);
  EXPECT_EQ(last._gs_attribute_change_request.gs_group_attributes, &attributes);
  EXPECT_EQ(last._gs_attribute_change_request.gs_backlevel_providers, nullptr);
  EXPECT_EQ(last._gs_attribute_change_request.gs_time_limit, 8);
}

TEST(Provider, DefaultCallbacks_onlyTrace) {
  RecordingApi api(GSCL_TRC_API);
  GSController controller;
  GSProvider provider("g", 3, nullptr);
  const auto after = [&](auto route, const auto& n) {
    api.take();
    route(&n);
    return api.take();
  };
  const std::string id = "Prov[g,Id=3/7,T=12]";
  Proposal proposal(ownId());
  provider.joinGroup();
  const auto join = proposal.approved(WYX_JOIN);
  EXPECT_THAT(after(GSController::stub_approvedCb, join),
              testing::IsSupersetOf(
                  {"A approvedCb(" + id + ") for WYX_JOIN by [7.3]", "A My Join(" + id + ") is approved"}));
  const auto failure = proposal.approved(WYX_FAILURE_LEAVE);
  EXPECT_THAT(after(GSController::stub_approvedCb, failure), testing::Contains("A " + id + " Failure approved."));
  const auto no_failure = proposal.rejected(WYX_FAILURE_LEAVE);
  EXPECT_THAT(after(GSController::stub_rejectedCb, no_failure),
              testing::Contains("A " + id + " Failure rejected."));
  Proposal others(otherId());
  const auto not_mine = others.rejected(WYX_JOIN);
  EXPECT_THAT(after(GSController::stub_rejectedCb, not_mine),
              testing::Not(testing::Contains(testing::HasSubstr("My"))));
  const auto phase = others.phase(WYX_EXPEL, 1);
  EXPECT_THAT(after(GSController::stub_nPhaseCb, phase),
              testing::Contains("A nPhaseCb(" + id + ") for WYX_EXPEL"));
  EXPECT_THAT(after(GSController::stub_announcementCb, announcement(WYX_RESPONSIVENESS_RESPONSE)),
              testing::Contains("A announcementCb(" + id + ") WYX_RESPONSIVENESS_RESPONSE"));
  wyx_merge_notification_t merge = {};
  merge.gs_provider_token = kToken;
  EXPECT_EQ(after(GSController::stub_mergeCb, merge), Lines{"A mergeCb(" + id + ")"});
  provider.joinGroup();
  const auto mine = proposal.rejected(WYX_JOIN);
  EXPECT_THAT(after(GSController::stub_rejectedCb, mine), testing::Contains("A My join(" + id + ") is rejected."));
}

TEST(Provider, Destroyed_tellsOnlyTheTrace) {
  RecordingApi api;
  GSController controller;
  {
    GSProvider provider("g", 3, nullptr);
    EXPECT_EQ(api.take().back(), "A Prov[g,Id=-1/-1,T=-1] created");
    joined(provider);
  }
  EXPECT_EQ(api.take(), (Lines{"A Prov[g,Id=3/7,T=12] destroyed",
                               "W The provider(Prov[g,Id=3/7,T=12]) is being deleted before leaving the group."}));
}

TEST(Subscriber, Destroyed_unsubscribesBeforeItLeavesTheRegistry) {
  RecordingApi api(GSCL_TRC_API);
  GSController controller;
  {
    GSSubscriber subscriber("g", WYX_SUBSCRIBE_STATE);
    EXPECT_EQ(api.take().back(), "A Subs[G=g,T=-1] created");
    subscribed(subscriber);
    api.during = [&] {
      // Still found: a notification on the way reaches it.
      const auto n = subscription(WYX_SUBSCRIPTION_SPECIAL_DATA);
      api.take();
      GSController::stub_subscribeCb(&n);
      EXPECT_EQ(api.take().front(), "A WHATELSE=40");
    };
    const auto n = subscription(WYX_SUBSCRIPTION_STATE);
    GSController::stub_subscribeCb(&n);
    EXPECT_EQ(api.take().back(), "A subscribeCb(Subs[G=g,T=12]) WYX_SUBSCRIPTION_STATE");
  }
  api.during = nullptr;
  EXPECT_EQ(api.take(), (Lines{"A stub_unsubscribe_group(Subs[G=g,T=-1]) returns sync_rc=WYX_OK",
                               "A Subs[G=g,T=-1]: unsubscribe sync_rc=WYX_OK"}));
}

TEST(Client, CancelledRequest_isFinishedFirst) {
  RecordingApi api;
  GSController controller;
  GSProvider provider("g", 3, nullptr);
  GSSubscriber subscriber("g", WYX_SUBSCRIBE_STATE);
  api.during = [] {
    pthread_cancel(pthread_self());
    pthread_testcancel();
  };
  // Every trace line is a cancellation point, as with the standard routine.
  GSSetTraceRtn([](int, char*) { pthread_testcancel(); });
  const auto cancelled = [](const std::function<wyx_rc_t()>& request) {
    wyx_rc_t answer = WYX_NOT_OK;
    lock_peek::CancellableThread thread([&] {
      answer = request();
      pthread_testcancel();
    });
    EXPECT_TRUE(thread.join());
    return answer;
  };
  EXPECT_EQ(cancelled([&] { return provider.joinGroup(); }), WYX_OK);
  EXPECT_EQ(provider.getClientState(), GS_IAM_JOINING);
  EXPECT_EQ(provider.getToken(), kToken);
  EXPECT_EQ(cancelled([&] { return provider.goodbyeGroup(); }), WYX_OK);
  EXPECT_EQ(cancelled([&] { return subscriber.subscribeGroup(); }), WYX_OK);
  EXPECT_EQ(cancelled([&] { return subscriber.unsubscribeGroup(); }), WYX_OK);
  api.during = nullptr;
  EXPECT_EQ(provider.joinGroup(), WYX_OK) << "no lock was left behind";
}

}  // namespace
