// What is refused, with which code, and that a refusal changes nothing; subscribers.
#include "gs/engine_script.h"

namespace gs::test {
namespace {

class EngineRequests : public Script {
 protected:
  /// Refused with `rc`, whoever was told before and whoever was not, and nothing is changed by it.
  void expect_refused(int who, const Request& wrong, wyx_rc_t rc) {
    const std::uint64_t before = engine.digest();
    EXPECT_EQ(request(who, wrong), rc);
    EXPECT_EQ(last.deliveries.size(), 0u);
    EXPECT_EQ(request(who, wrong, true), rc);
    ASSERT_EQ(last.deliveries.size(), 1u);
    const auto& error = std::get<DelayedErrorNotification>(*last.deliveries[0].what);
    EXPECT_EQ(error.rc, rc);
    EXPECT_TRUE(error.failing_request == wrong);
    EXPECT_EQ(last.deliveries[0].to.session, session(who));
    EXPECT_EQ(engine.digest(), before);
  }
  JoinRequest join_request(int who) const { return {1, attributes, static_cast<std::int16_t>(who), "p"}; }
};

TEST_F(EngineRequests, Join_with_wrong_values_is_refused) {
  const auto refused = [&](auto change, wyx_rc_t rc) {
    JoinRequest wrong = join_request(1);
    change(wrong);
    expect_refused(1, wrong, rc);
  };
  refused([](JoinRequest& j) { j.token = -1; }, WYX_BAD_MEMBER_TOKEN);
  refused([](JoinRequest& j) { j.attributes.group_name = ""; }, WYX_BAD_PARAMETER);
  refused([](JoinRequest& j) { j.attributes.group_name = std::string(33, 'g'); }, WYX_NAME_TOO_LONG);
  refused([](JoinRequest& j) { j.local_name = std::string(257, 'l'); }, WYX_NAME_TOO_LONG);
  refused([](JoinRequest& j) { j.attributes.source_group_name = "s"; }, WYX_NOT_SUPPORTED);
  refused([](JoinRequest& j) { j.attributes.num_phases = wyx_num_phases_t(0); }, WYX_BAD_GROUP_ATTRIBUTES);
  refused([](JoinRequest& j) { j.attributes.default_vote = WYX_VOTE_CONTINUE; }, WYX_BAD_GROUP_ATTRIBUTES);
  refused([](JoinRequest& j) { j.attributes.batch_control = wyx_batch_ctrl_t(64); }, WYX_BAD_GROUP_ATTRIBUTES);
  EXPECT_TRUE(engine.status().empty());
  JoinRequest right = join_request(1);
  right.attributes.group_name = std::string(32, 'g');
  EXPECT_EQ(request(1, right), WYX_OK);
}

TEST_F(EngineRequests, Join_must_have_the_groups_attributes_each_of_them) {
  group_of({1});
  const auto differs = [&](auto change) {
    JoinRequest other = join_request(2);
    change(other.attributes);
    expect_refused(2, other, WYX_BAD_GROUP_ATTRIBUTES);
  };
  differs([](GroupAttributes& a) { a.client_version = 1; });
  differs([](GroupAttributes& a) { a.batch_control = WYX_BATCH_JOINS; });
  differs([](GroupAttributes& a) { a.num_phases = WYX_N_PHASE; });
  differs([](GroupAttributes& a) { a.default_vote = WYX_VOTE_REJECT; });
  differs([](GroupAttributes& a) { a.merge_control = WYX_LARGER_MERGE; });
  differs([](GroupAttributes& a) { a.time_limit = 1; });
}

TEST_F(EngineRequests, Session_with_as_many_clients_as_may_be_gets_no_more_until_one_goes) {
  group_of({1});
  SubscribeRequest more{2, WYX_SUBSCRIBE_STATE, "g"};
  for (; more.token <= static_cast<Token>(kMaxSessionClients); ++more.token) ASSERT_EQ(request(1, more), WYX_OK);
  expect_refused(1, more, WYX_NO_MEMORY);
  JoinRequest another = join_request(7);
  another.token = more.token;
  expect_refused(1, another, WYX_NO_MEMORY);
  EXPECT_EQ(subscribe(2, WYX_SUBSCRIBE_STATE), WYX_OK);
  ASSERT_EQ(request(1, UnsubscribeRequest{2}), WYX_OK);
  EXPECT_EQ(request(1, another), WYX_OK);
}

TEST_F(EngineRequests, Instance_is_unique_per_node_against_members_and_queued_joins) {
  group_of({1});
  expect_refused(2, join_request(1), WYX_DUPLICATE_INSTANCE_NUMBER);
  change_state(1, "x", kPhases);
  EXPECT_EQ(request(2, join_request(2)), WYX_OK);
  expect_refused(3, join_request(2), WYX_DUPLICATE_INSTANCE_NUMBER);
  JoinRequest same_token = join_request(9);
  expect_refused(2, same_token, WYX_BAD_MEMBER_TOKEN);
  vote_all({1}, WYX_VOTE_APPROVE);
  expect_refused(3, join_request(2), WYX_DUPLICATE_INSTANCE_NUMBER);
  EXPECT_EQ(join(1 << 8, 5), WYX_OK);
}

TEST_F(EngineRequests, Proposals_with_wrong_values_are_refused) {
  group_of({1, 2});
  const ProtocolTerms wrong{wyx_num_phases_t(3), 0};
  expect_refused(1, StateChangeRequest{1, wrong, ""}, WYX_BAD_PARAMETER);
  expect_refused(1, StateChangeRequest{1, kOnePhase, Bytes(kMaxStateValue + 1, 'x')}, WYX_BAD_PARAMETER);
  expect_refused(1, MessageRequest{1, wrong, ""}, WYX_BAD_PARAMETER);
  expect_refused(1, MessageRequest{1, kOnePhase, Bytes(kMaxProviderMessage + 1, 'x')}, WYX_BAD_PARAMETER);
  expect_refused(1, LeaveRequest{1, wrong, 0}, WYX_BAD_PARAMETER);
  GroupAttributes other = attributes;
  other.group_name = "h";
  expect_refused(1, AttributeChangeRequest{1, kOnePhase, other}, WYX_BAD_GROUP_ATTRIBUTES);
  EXPECT_EQ(change_state(1, Bytes(kMaxStateValue, 'x')), WYX_OK);
}

TEST_F(EngineRequests, Expel_with_a_wrong_list_or_phase_is_refused) {
  group_of({1, 2});
  const auto refused = [&](Membership list, ProtocolTerms terms, std::int32_t phase, Bytes flag, wyx_rc_t rc) {
    expect_refused(1, ExpelRequest{1, terms, std::move(list), phase, std::move(flag)}, rc);
  };
  refused({}, kOnePhase, 0, "", WYX_BAD_PARAMETER);
  refused({id(2), id(3)}, kOnePhase, 0, "", WYX_UNKNOWN_PROVIDER);
  refused({id(2, 4)}, kOnePhase, 0, "", WYX_UNKNOWN_PROVIDER);
  refused({id(2), id(2)}, kOnePhase, 0, "", WYX_PROVIDER_APPEARS_TWICE);
  refused({id(2)}, kPhases, -1, "", WYX_INVALID_DEACTIVATE_PHASE);
  refused({id(2)}, kOnePhase, 2, "", WYX_INVALID_DEACTIVATE_PHASE);
  refused({id(2)}, kOnePhase, 0, Bytes(257, 'f'), WYX_BAD_PARAMETER);
}

TEST_F(EngineRequests, Tokens_of_others_of_subscribers_and_of_joiners_are_not_a_members) {
  group_of({1});
  subscribe(2, WYX_SUBSCRIBE_STATE);
  change_state(1, "x", kPhases);
  join(3);
  for (const auto& [who, rc] : {std::pair{5, WYX_BAD_MEMBER_TOKEN}, std::pair{3, WYX_NOT_A_MEMBER}}) {
    expect_refused(who, StateChangeRequest{1, kOnePhase, "y"}, rc);
    expect_refused(who, MessageRequest{1, kOnePhase, "y"}, rc);
    expect_refused(who, LeaveRequest{1, kOnePhase, 0}, rc);
    expect_refused(who, ExpelRequest{1, kOnePhase, {id(1)}, 0, ""}, rc);
    expect_refused(who, AttributeChangeRequest{1, kOnePhase, attributes}, rc);
  }
  expect_refused(2, GoodbyeRequest{kSubscriberToken}, WYX_BAD_MEMBER_TOKEN);
  expect_refused(2, VoteRequest{kSubscriberToken, WYX_VOTE_APPROVE, {}, {}, WYX_NULL_VOTE}, WYX_BAD_MEMBER_TOKEN);
  expect_refused(1, UnsubscribeRequest{1}, WYX_BAD_MEMBER_TOKEN);
  expect_refused(1, UnsubscribeRequest{77}, WYX_BAD_MEMBER_TOKEN);
}

TEST_F(EngineRequests, Proposals_collide_while_a_protocol_runs) {
  group_of({1, 2});
  send(1, "m", kPhases);
  for (int who : {1, 2}) {
    expect_refused(who, StateChangeRequest{1, kOnePhase, "y"}, WYX_COLLIDE);
    expect_refused(who, MessageRequest{1, kOnePhase, "y"}, WYX_COLLIDE);
    expect_refused(who, ExpelRequest{1, kOnePhase, {id(1)}, 0, ""}, WYX_COLLIDE);
    expect_refused(who, AttributeChangeRequest{1, kOnePhase, attributes}, WYX_COLLIDE);
  }
}

class EngineSubscribers : public EngineRequests {};

TEST_F(EngineSubscribers, Each_gets_what_its_flags_ask_for_first_as_it_is_then_each_change) {
  group_of({1});
  change_state(1, "x");
  seen();
  subscribe(11, WYX_SUBSCRIBE_STATE);
  subscribe(12, WYX_SUBSCRIBE_DELTA_JOINS);
  subscribe(13, WYX_SUBSCRIBE_DELTA_LEAVES);
  subscribe(14, WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP);
  EXPECT_EQ(seen(),
            "s11: subscription {state}, state 'x', #2\n"
            "s12: subscription {join}, changing 1, #2\n"
            "s13: subscription {none}, #2\n"
            "s14: subscription {state|members}, members 1, state 'x', #2\n");
  join(2);
  leave(2, 6);
  change_state(1, "y");
  send(1, "m");
  std::string all = seen(), told;
  for (std::size_t at = 0; at < all.size(); at = all.find('\n', at) + 1)
    if (all[at] == 's') told += all.substr(at, all.find('\n', at) + 1 - at);
  EXPECT_EQ(told,
            "s12: subscription {join}, changing 2, #3\n"
            "s14: subscription {join|members}, members 1 2, changing 2, #3\n"
            "s13: subscription {leave}, changing 2(voluntary=6), #4\n"
            "s14: subscription {leave|members}, members 1, changing 2(voluntary=6), #4\n"
            "s11 s14: subscription {state}, state 'y', #5\n");
}

TEST_F(EngineSubscribers, Wrong_requests_are_refused) {
  const auto refused = [&](std::uint32_t control, const std::string& group, wyx_rc_t rc) {
    expect_refused(11, SubscribeRequest{kSubscriberToken, control, group}, rc);
  };
  refused(WYX_SUBSCRIBE_STATE, "g", WYX_UNKNOWN_GROUP);
  attributes.num_phases = WYX_N_PHASE;
  join(1);
  refused(WYX_SUBSCRIBE_STATE, "g", WYX_UNKNOWN_GROUP);
  vote_all({1}, WYX_VOTE_APPROVE);
  refused(0, "g", WYX_BAD_PARAMETER);
  refused(WYX_SUBSCRIBE_PERSISTENCE, "g", WYX_BAD_PARAMETER);
  refused(0x400 | WYX_SUBSCRIBE_STATE, "g", WYX_BAD_PARAMETER);
  refused(WYX_SUBSCRIBE_STATE, "", WYX_BAD_PARAMETER);
  refused(WYX_SUBSCRIBE_STATE, std::string(33, 'g'), WYX_NAME_TOO_LONG);
  refused(WYX_SUBSCRIBE_STATE | WYX_SUBSCRIBE_ADAPTER_INFO, "g", WYX_NOT_SUPPORTED);
  refused(WYX_SUBSCRIBE_STATE | WYX_SUBSCRIBE_SPECIAL_DATA, "g", WYX_NOT_SUPPORTED);
  EXPECT_EQ(subscribe(11, WYX_SUBSCRIBE_STATE), WYX_OK);
  refused(WYX_SUBSCRIBE_STATE, "g", WYX_BAD_MEMBER_TOKEN);
}

TEST_F(EngineSubscribers, End_of_the_group_dissolves_and_a_persistent_one_waits_for_the_next) {
  subscribe(11, WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP | WYX_SUBSCRIBE_PERSISTENCE);
  EXPECT_EQ(seen(), "");
  group_of({1});
  change_state(1, "x");
  subscribe(12, WYX_SUBSCRIBE_MEMBERSHIP);
  subscribe(13, WYX_SUBSCRIBE_STATE);
  seen();
  dies(1);
  EXPECT_EQ(seen(),
            "s11: subscription {state|leave|members|persistent}, members -, changing 1(died), state '', #3\n"
            "s12: subscription {members}, members -, #3\n"
            "s12 s13: subscription {dissolved}, #3\n");
  EXPECT_EQ(unsubscribe(12), WYX_BAD_MEMBER_TOKEN);
  group_of({2});
  join(3);
  EXPECT_EQ(unsubscribe(11), WYX_OK);
  join(4);
  EXPECT_EQ(outcomes(),
            "2 3: approved join by 3 <approve> {updated-members}\n"
            "s11: subscription {join|members}\n"
            "2 3 4: approved join by 4 <approve> {updated-members}\n");
}

}  // namespace
}  // namespace gs::test
