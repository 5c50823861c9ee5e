// What is refused, with which code, and that a refusal changes nothing; subscribers.
#include "gs/engine_script.h"

namespace gs::test {
namespace {

class EngineRequests : public Script {
 protected:
  /// Refused with `rc`, whoever was told before and whoever was not, and nothing is changed by it.
  void expect_refused(int who, const Request& wrong, wyx_rc_t rc) {
    SCOPED_TRACE("request " + std::to_string(++refusals_) + ", kind " + std::to_string(wrong.index()));
    const std::uint64_t before = engine.digest();
    EXPECT_EQ(request(who, wrong), rc);
    EXPECT_EQ(last.deliveries.size(), 0u);
    EXPECT_EQ(request(who, wrong, true), rc);  // the model sees to the delayed error
    EXPECT_EQ(engine.digest(), before);
  }
  void expect_refused(int who, const std::vector<std::pair<Request, wyx_rc_t>>& wrong) {
    for (const auto& [request, rc] : wrong) expect_refused(who, request, rc);
  }
  JoinRequest join_request(Token token, std::int16_t instance) const { return {token, attributes, instance, "p"}; }

 private:
  int refusals_ = 0;
};

TEST_F(EngineRequests, Join_with_wrong_values_or_other_attributes_than_the_groups_is_refused) {
  const auto with = [&](auto member, auto value) {
    JoinRequest join = join_request(1, 2);
    join.attributes.*member = value;
    return join;
  };
  using A = GroupAttributes;
  JoinRequest long_name = join_request(1, 2);
  long_name.local_name = std::string(257, 'l');
  expect_refused(2, {{join_request(-1, 2), WYX_BAD_MEMBER_TOKEN},
                     {long_name, WYX_NAME_TOO_LONG},
                     {with(&A::group_name, ""), WYX_BAD_PARAMETER},
                     {with(&A::group_name, std::string(33, 'g')), WYX_NAME_TOO_LONG},
                     {with(&A::source_group_name, "s"), WYX_NOT_SUPPORTED},
                     {with(&A::num_phases, wyx_num_phases_t(0)), WYX_BAD_GROUP_ATTRIBUTES},
                     {with(&A::default_vote, WYX_VOTE_CONTINUE), WYX_BAD_GROUP_ATTRIBUTES},
                     {with(&A::batch_control, wyx_batch_ctrl_t(64)), WYX_BAD_GROUP_ATTRIBUTES},
                     {with(&A::merge_control, wyx_merge_ctrl_t(-3)), WYX_BAD_GROUP_ATTRIBUTES}});
  EXPECT_TRUE(engine.status().empty());
  EXPECT_EQ(request(3, with(&A::group_name, std::string(32, 'g'))), WYX_OK);

  group_of({1});
  for (const JoinRequest& other :
       {with(&A::client_version, std::int16_t{1}), with(&A::batch_control, WYX_BATCH_JOINS),
        with(&A::num_phases, WYX_N_PHASE), with(&A::default_vote, WYX_VOTE_REJECT),
        with(&A::merge_control, WYX_LARGER_MERGE), with(&A::time_limit, std::uint16_t{1})})
    expect_refused(2, other, WYX_BAD_GROUP_ATTRIBUTES);
}

TEST_F(EngineRequests, Session_with_as_many_clients_as_may_be_gets_no_more_until_one_goes) {
  group_of({1});
  SubscribeRequest more{2, WYX_SUBSCRIBE_STATE, "g"};
  for (; more.token <= static_cast<Token>(kMaxSessionClients); ++more.token) ASSERT_EQ(request(1, more), WYX_OK);
  expect_refused(1, more, WYX_NO_MEMORY);
  expect_refused(1, join_request(more.token, 7), WYX_NO_MEMORY);
  EXPECT_EQ(subscribe(2, WYX_SUBSCRIBE_STATE), WYX_OK);
  ASSERT_EQ(request(1, UnsubscribeRequest{2}), WYX_OK);
  EXPECT_EQ(request(1, join_request(more.token, 7)), WYX_OK);
}

TEST_F(EngineRequests, Instance_is_unique_per_node_against_members_and_queued_joins) {
  group_of({1});
  expect_refused(2, join_request(1, 1), WYX_DUPLICATE_INSTANCE_NUMBER);
  change_state(1, "x", kPhases);
  EXPECT_EQ(request(2, join_request(1, 2)), WYX_OK);
  expect_refused(3, join_request(1, 2), WYX_DUPLICATE_INSTANCE_NUMBER);
  expect_refused(2, join_request(1, 9), WYX_BAD_MEMBER_TOKEN);
  approve({1});
  expect_refused(3, join_request(1, 2), WYX_DUPLICATE_INSTANCE_NUMBER);
  EXPECT_EQ(join(1 << 8, 5), WYX_OK);
}

TEST_F(EngineRequests, Proposals_and_votes_with_wrong_values_are_refused) {
  group_of({1, 2});
  const ProtocolTerms wrong{wyx_num_phases_t(3), 0};
  const Bytes large(kMaxStateValue + 1, 'x');
  GroupAttributes other = attributes;
  other.group_name = "h";
  const auto expel = [](Membership list, ProtocolTerms terms = kOnePhase, std::int32_t phase = 0,
                        Bytes flag = "") {
    return ExpelRequest{1, terms, std::move(list), phase, std::move(flag)};
  };
  expect_refused(1, {{StateChangeRequest{1, wrong, ""}, WYX_BAD_PARAMETER},
                     {StateChangeRequest{1, kOnePhase, large}, WYX_BAD_PARAMETER},
                     {MessageRequest{1, wrong, ""}, WYX_BAD_PARAMETER},
                     {MessageRequest{1, kOnePhase, large}, WYX_BAD_PARAMETER},
                     {LeaveRequest{1, wrong, 0}, WYX_BAD_PARAMETER},
                     {AttributeChangeRequest{1, wrong, attributes}, WYX_BAD_PARAMETER},
                     {AttributeChangeRequest{1, kOnePhase, other}, WYX_BAD_GROUP_ATTRIBUTES},
                     {expel({}), WYX_BAD_PARAMETER},
                     {expel({id(2), id(3)}), WYX_UNKNOWN_PROVIDER},
                     {expel({id(2, 4)}), WYX_UNKNOWN_PROVIDER},
                     {expel({id(2), id(2)}), WYX_PROVIDER_APPEARS_TWICE},
                     {expel({id(2)}, kPhases, -1), WYX_INVALID_DEACTIVATE_PHASE},
                     {expel({id(2)}, kOnePhase, 2), WYX_INVALID_DEACTIVATE_PHASE},
                     {expel({id(2)}, kOnePhase, 0, Bytes(257, 'f')), WYX_BAD_PARAMETER},
                     {VoteRequest{1, WYX_VOTE_APPROVE, {}, {}}, WYX_VOTE_NOT_EXPECTED}});
  EXPECT_EQ(change_state(1, Bytes(kMaxStateValue, 'x')), WYX_OK);

  leave(2, 0, kPhases);
  expect_refused(2, VoteRequest{1, WYX_VOTE_APPROVE, {}, {}}, WYX_VOTE_NOT_EXPECTED);
  expect_refused(1, {{VoteRequest{1, WYX_NULL_VOTE, {}, {}}, WYX_VOTE_VALUE_NOT_ALLOWED},
                     {VoteRequest{1, WYX_VOTE_APPROVE_AND_SWITCH_ALPHA_OMEGA, {}, {}}, WYX_VOTE_VALUE_NOT_ALLOWED},
                     {VoteRequest{1, WYX_VOTE_APPROVE, {}, {}, WYX_VOTE_CONTINUE}, WYX_VOTE_VALUE_NOT_ALLOWED},
                     {VoteRequest{1, WYX_VOTE_APPROVE, large, {}}, WYX_BAD_PARAMETER},
                     {VoteRequest{1, WYX_VOTE_APPROVE, {}, large}, WYX_BAD_PARAMETER}});
}

TEST_F(EngineRequests, Proposals_collide_while_a_protocol_runs_and_want_a_members_token) {
  group_of({1, 2});
  subscribe(4, WYX_SUBSCRIBE_STATE);
  change_state(1, "x", kPhases);
  join(3);
  const std::map<int, wyx_rc_t> cases = {
      {1, WYX_COLLIDE}, {2, WYX_COLLIDE}, {3, WYX_NOT_A_MEMBER}, {5, WYX_BAD_MEMBER_TOKEN}};
  for (const auto& [who, rc] : cases) {
    expect_refused(who, {{StateChangeRequest{1, kOnePhase, "y"}, rc},
                         {MessageRequest{1, kOnePhase, "y"}, rc},
                         {ExpelRequest{1, kOnePhase, {id(1)}, 0, ""}, rc},
                         {AttributeChangeRequest{1, kOnePhase, attributes}, rc}});
    if (rc != WYX_COLLIDE) expect_refused(who, LeaveRequest{1, kOnePhase, 0}, rc);
  }
  expect_refused(4, GoodbyeRequest{kSubscriberToken}, WYX_BAD_MEMBER_TOKEN);
  expect_refused(4, VoteRequest{kSubscriberToken, WYX_VOTE_APPROVE, {}, {}}, WYX_BAD_MEMBER_TOKEN);
  expect_refused(1, UnsubscribeRequest{1}, WYX_BAD_MEMBER_TOKEN);
  expect_refused(1, UnsubscribeRequest{77}, WYX_BAD_MEMBER_TOKEN);
}

TEST_F(EngineRequests, What_is_kept_is_bounded_by_session_user_and_in_all_whoever_shares_the_groups) {
  Engine small(Limits{.session_bytes = 70'000, .user_bytes = 130'000, .total_bytes = 240'000});
  const auto ask = [&](int who, std::uint32_t of, Request r) {
    return small.apply(RequestEvent{session(who), std::move(r), false, of}).rc;
  };
  const auto join_own = [&](int who, std::uint32_t of) {
    JoinRequest own = join_request(1, static_cast<std::int16_t>(who));
    own.attributes.group_name = "of " + std::to_string(who);
    ASSERT_EQ(ask(who, of, own), WYX_OK);
  };
  const auto change = [](std::size_t bytes, ProtocolTerms terms = kOnePhase) {
    return StateChangeRequest{1, terms, Bytes(bytes, 'x')};
  };
  for (const std::int16_t who : {1, 2, 3, 4}) ASSERT_EQ(ask(who, who < 4 ? 7 : 0, join_request(1, who)), WYX_OK);
  ASSERT_EQ(ask(1, 7, change(60'000)), WYX_OK);
  const std::uint64_t before = small.digest();
  EXPECT_EQ(ask(1, 7, change(60'000)), WYX_NO_MEMORY) << "the session's room, for the old value and the new one";
  EXPECT_EQ(small.digest(), before);
  EXPECT_EQ(ask(2, 7, change(60'000, kPhases)), WYX_OK) << "another session of the user, in the same group";
  for (const int who : {1, 2, 3}) ASSERT_EQ(ask(who, 7, VoteRequest{1, WYX_VOTE_APPROVE, {}, {}}), WYX_OK);
  const Bytes voted(60'000, 'v');
  EXPECT_EQ(ask(4, 0, VoteRequest{1, WYX_VOTE_APPROVE, voted, voted}), WYX_NO_MEMORY);
  EXPECT_EQ(ask(4, 0, VoteRequest{1, WYX_VOTE_APPROVE, voted, {}}), WYX_OK);
  EXPECT_EQ(ask(1, 7, change(60'000)), WYX_OK) << "the vote's value has replaced its own";

  small.apply(SessionGoneEvent{session(1)});
  EXPECT_EQ(ask(2, 7, MessageRequest{1, kPhases, Bytes(60'000, 'm')}), WYX_OK);
  join_own(6, 7);
  EXPECT_EQ(ask(6, 7, change(60'000)), WYX_NO_MEMORY) << "the user's room: the value of a dead session counts on";
  join_own(8, 8);
  EXPECT_EQ(ask(8, 8, change(60'000)), WYX_OK) << "another user's";
  join_own(9, 9);
  join_own(10, 0);
  EXPECT_EQ(ask(9, 9, change(40'000)), WYX_NO_MEMORY) << "the last eighth of all";
  EXPECT_EQ(ask(10, 0, change(40'000)), WYX_OK) << "is root's";

  SubscribeRequest more{2, WYX_SUBSCRIBE_STATE, "g"};
  while (ask(12, 0, more) == WYX_OK) ++more.token;
  EXPECT_LE(more.token, 70'000 / 512 + 2) << "subscribers are charged";
  ASSERT_EQ(ask(12, 0, UnsubscribeRequest{2}), WYX_OK);
  EXPECT_EQ(ask(12, 0, more), WYX_OK);
}

class EngineSubscribers : public EngineRequests {};

TEST_F(EngineSubscribers, Each_gets_what_its_flags_ask_for_first_as_it_is_then_each_change) {
  group_of({1});
  change_state(1, "x");
  seen();
  subscribe(11, WYX_SUBSCRIBE_STATE);
  subscribe(12, WYX_SUBSCRIBE_DELTA_JOINS);
  subscribe(13, WYX_SUBSCRIBE_DELTA_LEAVES);
  subscribe(14, WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP | WYX_SUBSCRIBE_PERSISTENCE);
  EXPECT_EQ(seen(),
            "s11: subscription {state}, state 'x'\n"
            "s12: subscription {join}, changing 1\n"
            "s13: subscription {none}\n"
            "s14: subscription {state|members}, members 1, state 'x'\n");
  leave(1, 6);
  EXPECT_EQ(seen(),
            "1: approved leave by 1 <approve>, members -, changing 1(voluntary=6), state 'x'\n"
            "s11 s12: subscription {dissolved}\n"
            "s13: subscription {leave}, changing 1(voluntary=6)\n"
            "s13: subscription {dissolved}\n"
            "s14: subscription {state|leave|members|persistent}, members -, changing 1(voluntary=6), state ''\n");
  EXPECT_EQ(request(11, UnsubscribeRequest{kSubscriberToken}), WYX_BAD_MEMBER_TOKEN);
  group_of({2});
  EXPECT_EQ(request(14, UnsubscribeRequest{kSubscriberToken}), WYX_OK);
  change_state(2, "y");
  EXPECT_EQ(seen(), "2: approved state by 2 <approve>, members 2, state 'y'\n");
}

TEST_F(EngineSubscribers, Wrong_requests_are_refused) {
  const auto wanting = [](std::uint32_t control, const std::string& group = "g") {
    return SubscribeRequest{kSubscriberToken, control, group};
  };
  attributes.num_phases = WYX_N_PHASE;
  join(1);
  expect_refused(11, wanting(WYX_SUBSCRIBE_STATE), WYX_UNKNOWN_GROUP);  // unborn
  approve({1});
  expect_refused(11, {{wanting(WYX_SUBSCRIBE_STATE, "other"), WYX_UNKNOWN_GROUP},
                      {wanting(0), WYX_BAD_PARAMETER},
                      {wanting(WYX_SUBSCRIBE_PERSISTENCE), WYX_BAD_PARAMETER},
                      {wanting(0x400 | WYX_SUBSCRIBE_STATE), WYX_BAD_PARAMETER},
                      {wanting(WYX_SUBSCRIBE_STATE, ""), WYX_BAD_PARAMETER},
                      {wanting(WYX_SUBSCRIBE_STATE, std::string(33, 'g')), WYX_NAME_TOO_LONG},
                      {wanting(WYX_SUBSCRIBE_STATE | WYX_SUBSCRIBE_ADAPTER_INFO), WYX_NOT_SUPPORTED},
                      {wanting(WYX_SUBSCRIBE_STATE | WYX_SUBSCRIBE_SPECIAL_DATA), WYX_NOT_SUPPORTED}});
  EXPECT_EQ(subscribe(11, WYX_SUBSCRIBE_STATE), WYX_OK);
  expect_refused(11, wanting(WYX_SUBSCRIBE_STATE), WYX_BAD_MEMBER_TOKEN);
}

}  // namespace
}  // namespace gs::test
