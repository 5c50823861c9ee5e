// Joins, leaves, failure leaves, goodbyes and expels: who is a member, when, and who is told.
#include "gs/engine_script.h"

namespace gs::test {
namespace {

class EngineMembership : public Script {};

TEST_F(EngineMembership, Join_in_phases_asks_members_and_joiner_also_the_first_one_about_itself) {
  attributes.num_phases = WYX_N_PHASE;
  attributes.time_limit = 9;
  join(1);
  EXPECT_EQ(seen(), "1: phase 1 join by 1 {proposed-members}, members -, changing 1, limit 9, #1\n");
  EXPECT_TRUE(engine.status()[0].members.empty());
  vote_all({1}, WYX_VOTE_APPROVE);
  join(2);
  vote_all({2}, WYX_VOTE_CONTINUE);
  vote_all({1}, WYX_VOTE_APPROVE);
  vote_all({1, 2}, WYX_VOTE_APPROVE);
  EXPECT_EQ(seen(),
            "1: approved join by 1 <approve> {updated-members}, members 1, changing 1, #2\n"
            "1 2: phase 1 join by 2 {proposed-members}, members 1, changing 2, limit 9, #3\n"
            "1 2: phase 2 join by 2 {ongoing-members}, members 1, changing 2, limit 9, #4\n"
            "1 2: approved join by 2 <approve> {updated-members}, members 1 2, changing 2, #5\n");
}

TEST_F(EngineMembership, Join_queued_behind_a_protocol_runs_after_it_one_by_one_or_as_a_batch) {
  for (auto batching : {WYX_NO_BATCHING, WYX_BATCH_JOINS}) {
    attributes.group_name = batching == WYX_NO_BATCHING ? "single" : "batch";
    attributes.batch_control = batching;
    const int a = batching == WYX_NO_BATCHING ? 1 : 4;
    group_of({a});
    change_state(a, "x", kPhases);
    join(a + 1);
    join(a + 2);
    seen();
    vote_all({a}, WYX_VOTE_APPROVE);
  }
  EXPECT_EQ(seen(),
            "4: approved state by 4 <approve> {updated-state}, members 4, state 'x', #3\n"
            "4 5: approved join by 5 <approve> {updated-members}, members 4 5 6, changing 5 6, state 'x', #4\n"
            "6: approved join by 6 <approve> {updated-members}, members 4 5 6, changing 5 6, state 'x', #4\n");
}

TEST_F(EngineMembership, Join_queued_that_no_longer_fits_gets_a_delayed_error) {
  group_of({1});
  GroupAttributes changed = attributes;
  changed.client_version = 5;
  change_attributes(1, changed, kPhases);
  EXPECT_EQ(join(2), WYX_OK);
  seen();
  vote_all({1}, WYX_VOTE_APPROVE);
  EXPECT_EQ(seen(),
            "1: approved attributes by 1 <approve> {updated-attributes}, members 1, version 5, #3\n"
            "2: error 13 for join, group has version 5\n");
  EXPECT_EQ(join(2), WYX_BAD_GROUP_ATTRIBUTES);
  attributes = changed;
  EXPECT_EQ(join(2), WYX_OK);
}

TEST_F(EngineMembership, Leave_in_phases_asks_the_others_and_tells_the_leaver_the_end) {
  group_of({1, 2, 3});
  leave(2, 42, kPhases);
  EXPECT_EQ(leave(2), WYX_COLLIDE);
  vote_all({3}, WYX_VOTE_CONTINUE);
  vote_all({1}, WYX_VOTE_APPROVE);
  vote_all({1, 3}, WYX_VOTE_APPROVE);
  EXPECT_EQ(seen(),
            "1 3: phase 1 leave by 2 {proposed-members}, members 1 2 3, changing 2(voluntary=42), #4\n"
            "1 3: phase 2 leave by 2 {ongoing-members}, members 1 2 3, changing 2(voluntary=42), #5\n"
            "1 2 3: approved leave by 2 <approve> {updated-members}, members 1 3, changing 2(voluntary=42), #6\n");
  EXPECT_EQ(leave(2), WYX_BAD_MEMBER_TOKEN);
}

TEST_F(EngineMembership, Leave_that_is_rejected_is_approved_all_the_same_without_the_proposed_state) {
  group_of({1, 2, 3});
  leave(3, 0, kPhases);
  seen();
  vote_with(1, WYX_VOTE_CONTINUE, "new", std::nullopt);
  vote_all({2}, WYX_VOTE_REJECT);
  EXPECT_EQ(seen(),
            "1 2 3: approved leave by 3 <reject> {updated-members}, members 1 2, changing 3(voluntary), #5\n");
}

TEST_F(EngineMembership, Leaves_batch_only_with_the_same_terms_and_each_leaver_reads_its_own_id) {
  attributes.batch_control = WYX_BATCH_LEAVES;
  group_of({1, 2, 3, 4});
  send(1, "m", kPhases);
  leave(2, 20);
  leave(3, 30, kPhases);
  leave(4, 40);
  seen();
  vote_all({1, 2, 3, 4}, WYX_VOTE_APPROVE);
  EXPECT_EQ(seen(),
            "1 2 3 4: approved message by 1 <approve> {message}, members 1 2 3 4, msg 'm', #6\n"
            "1 2 3: approved leave by 2 <approve> {updated-members}, members 1 3, "
            "changing 2 4(voluntary=20 voluntary=40), #7\n"
            "4: approved leave by 4 <approve> {updated-members}, members 1 3, "
            "changing 2 4(voluntary=20 voluntary=40), #7\n"
            "1: phase 1 leave by 3 {proposed-members}, members 1 3, changing 3(voluntary=30), #8\n");
}

TEST_F(EngineMembership, Failures_come_before_queued_leaves_and_joins_and_say_how_each_was_lost) {
  group_of({1, 2, 3, 4});
  change_state(1, "x", kPhases);
  join(5);
  leave(4);
  dies(2);
  goodbye(3);
  seen();
  vote_all({1, 4}, WYX_VOTE_APPROVE);
  EXPECT_EQ(
      seen(),
      "1 4: approved state by 1 <default-approve|failed> {updated-state}, members 1 2 3 4, state 'x', #6\n"
      "1 4: approved failure by 2 <approve> {updated-members}, members 1 3 4, changing 2(died), state 'x', #7\n"
      "1 4: approved failure by 3 <approve> {updated-members}, members 1 4, changing 3(goodbye), state 'x', #8\n"
      "1 4 5: approved join by 5 <approve> {updated-members}, members 1 4 5, changing 5, state 'x', #9\n"
      "1 4 5: approved leave by 4 <approve> {updated-members}, members 1 5, changing 4(voluntary), state 'x', "
      "#10\n");
}

TEST_F(EngineMembership, Host_failure_takes_all_of_the_host_and_refuses_it_until_it_comes_back) {
  attributes.batch_control = WYX_BATCH_LEAVES;
  join(1);
  join(2, 7);
  join(3, 7);
  subscribe(3, WYX_SUBSCRIBE_MEMBERSHIP);
  seen();
  apply(HostGoneEvent{7, WYX_HOST_FAILURE});
  EXPECT_EQ(
      seen(),
      "1: approved failure by 2@7 <approve> {updated-members}, members 1, changing 2@7 3@7(host host), #4\n");
  EXPECT_EQ(join(4, 7), WYX_NO_INIT);
  apply(HostCameEvent{7});
  EXPECT_EQ(join(4, 7), WYX_OK);
}

TEST_F(EngineMembership, Failure_leave_in_phases_is_voted_on_by_survivors_and_cannot_be_prevented) {
  attributes.num_phases = WYX_N_PHASE;
  group_of({1, 2, 3});
  dies(1);
  vote_all({2}, WYX_VOTE_CONTINUE);
  vote_all({3}, WYX_VOTE_APPROVE);
  vote_all({2, 3}, WYX_VOTE_REJECT);
  EXPECT_EQ(seen(),
            "2 3: phase 1 failure by 1 {proposed-members}, members 1 2 3, changing 1(died), #5\n"
            "2 3: phase 2 failure by 1 {ongoing-members}, members 1 2 3, changing 1(died), #6\n"
            "2 3: approved failure by 1 <reject> {updated-members}, members 2 3, changing 1(died), #7\n");
}

TEST_F(EngineMembership, All_members_dead_while_joins_wait_begins_the_group_anew_with_the_first_of_them) {
  group_of({1, 2});
  change_state(1, "x", kPhases);
  join(3);
  dies(1);
  seen();
  dies(2);
  EXPECT_EQ(seen(), "3: approved join by 3 <approve> {updated-members}, members 3, changing 3, #1\n");
}

TEST_F(EngineMembership, Goodbye_frees_token_and_id_at_once_also_of_a_joiner) {
  attributes.num_phases = WYX_N_PHASE;
  group_of({1, 2});
  join(3);
  EXPECT_EQ(goodbye(3), WYX_OK);
  EXPECT_EQ(join(3), WYX_OK) << "the same token again, behind the old join";
  vote_all({1, 2}, WYX_VOTE_REJECT);
  vote_all({1, 2, 3}, WYX_VOTE_APPROVE);
  EXPECT_EQ(goodbye(3), WYX_OK);
  EXPECT_EQ(goodbye(3), WYX_BAD_MEMBER_TOKEN);
  seen();
  vote_all({1, 2}, WYX_VOTE_APPROVE);
  EXPECT_EQ(seen(),
            "1 2: approved failure by 3 <approve> {updated-members}, members 1 2, changing 3(goodbye), #9\n");
}

TEST_F(EngineMembership, Expel_asks_the_unlisted_and_dismisses_the_listed_with_their_waiting_leave) {
  group_of({1, 2, 3, 4});
  request(1, ExpelRequest{1, kPhases, {id(2), id(4)}, 3, "flag"});
  leave(4);
  vote_all({1, 3}, WYX_VOTE_APPROVE);
  EXPECT_EQ(seen(),
            "1 3: phase 1 expel by 1 {proposed-members|expel}, members 1 2 3 4, changing 2 4(expelled expelled), "
            "deactivate 3 'flag', #5\n"
            "1 2 3 4: approved expel by 1 <approve> {updated-members|expel}, members 1 3, "
            "changing 2 4(expelled expelled), deactivate 3 'flag', #6\n"
            "2: announcement <dissolved>\n"
            "4: error 6 for leave\n"
            "4: announcement <dissolved>\n");
  EXPECT_EQ(change_state(2, "x"), WYX_BAD_MEMBER_TOKEN);
}

TEST_F(EngineMembership, Responsiveness_is_announced_to_every_group_of_the_client_and_to_no_other) {
  group_of({1, 2});
  attributes.group_name = "other";
  group_of({3});
  apply(ResponsivenessEvent{session(2), false});
  apply(ResponsivenessEvent{session(2), true});
  EXPECT_EQ(seen(), "1 2: announcement <no-response> 2\n1 2: announcement <response> 2\n");
}

}  // namespace
}  // namespace gs::test
