// What the members and watchers of a group are told, over every kind of endpoint.

#include "support/client_fixture.h"

namespace test_support {
namespace {

class ClientFlow : public ClientTest {
 protected:
  void join_two() {
    first = joined(group, 1);
    ASSERT_EQ(join(group, 2, &second), WYX_OK);
    expect_both_told("approved join by 2 <approve>, members 1 2, changing 2\n");
  }
  /// The same to both, and then forgotten.
  void expect_both_told(const std::string& lines) {
    const auto count = static_cast<std::size_t>(std::count(lines.begin(), lines.end(), '\n'));
    EXPECT_EQ(told(first, count), lines);
    EXPECT_EQ(told(second, count), lines);
    recorder().reset();
  }
  std::string told_next(wyx_token_t token, std::size_t count = 1) {
    const std::string lines = told(token, count);
    recorder().reset();
    return lines;
  }

  Group group{"flow"};
  wyx_token_t first = -1;
  wyx_token_t second = -1;
};

TEST_P(ClientFlow, Members_areToldOfEveryProtocol) {
  group.attributes.gs_batch_control = WYX_COLLECT_VOTE_RESULT;
  join_two();
  recorder().set_hook([&](const Seen& seen) {
    if (seen.type != WYX_N_PHASE_NOTIFICATION) return;
    const bool counter = seen.protocol().proposal.phase == 1 && seen.token == second;
    std::string better = "better", why = "because";
    const wyx_state_value_t state = {static_cast<int>(better.size()), better.data()};
    const wyx_provider_message_t message = {static_cast<int>(why.size()), why.data()};
    EXPECT_EQ(wyx_vote(seen.token, counter ? WYX_VOTE_CONTINUE : WYX_VOTE_APPROVE, counter ? &state : nullptr,
                       counter ? &message : nullptr, WYX_NULL_VOTE),
              WYX_OK);
  });
  ASSERT_EQ(change_state(first, "good", WYX_N_PHASE, 30), WYX_OK);
  expect_both_told(
      "phase 1 state by 1, members 1 2, proposed 'good', limit 30\n"
      "phase 2 state by 1, members 1 2, proposed 'better', msg 'because', "
      "votes[1 yes approve; 2 continue none], limit 30\n"
      "approved state by 1 <approve>, members 1 2, state 'better', "
      "votes[1 yes approve; 2 yes approve]\n");

  Group changed = group;
  changed.attributes.gs_client_version = 5;
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_attribute_change_request = {WYX_1_PHASE, 0, changed.record(), nullptr};
  ASSERT_EQ(wyx_change_attributes(first, &info), WYX_OK);
  expect_both_told("approved attributes by 1 <approve>, members 1 2, state 'better', version 5\n");

  ASSERT_EQ(leave(first, 42), WYX_OK);
  expect_both_told("approved leave by 1 <approve>, members 2, changing 1(voluntary=42), state 'better'\n");
  EXPECT_EQ(leave(first), WYX_BAD_MEMBER_TOKEN);
  EXPECT_EQ(send_message(second, "still here"), WYX_OK);
}

TEST_P(ClientFlow, Message_anyBytesAndTheLargest_arriveWhole) {
  join_two();
  const std::string bytes("a\0b", 3), large(64 * 1024, 'x');
  ASSERT_EQ(send_message(first, bytes), WYX_OK);
  ASSERT_EQ(send_message(second, large), WYX_OK);
  for (const wyx_token_t token : {first, second}) {
    ASSERT_TRUE(all_arrive(token, 2));
    EXPECT_EQ(*recorder().of(token)[0].protocol().proposal.message, bytes);
    EXPECT_EQ(*recorder().of(token)[1].protocol().proposal.message, large);
  }
}

TEST_P(ClientFlow, TimeLimit_runsOut_countsTheDefaultVote) {
  join_two();
  ASSERT_EQ(change_state(first, "slow", WYX_N_PHASE, 1), WYX_OK);
  ASSERT_TRUE(all_arrive(first, 1));
  ASSERT_EQ(vote(first, WYX_VOTE_APPROVE), WYX_OK);
  expect_both_told(
      "phase 1 state by 1, members 1 2, proposed 'slow', limit 1\n"
      "approved state by 1 <default-approve|time>, members 1 2, state 'slow'\n");
}

TEST_P(ClientFlow, Goodbye_isSilentForTheOneAndAFailureLeaveForTheOthers) {
  join_two();
  ASSERT_EQ(wyx_goodbye(first), WYX_OK);
  EXPECT_EQ(wyx_goodbye(first), WYX_BAD_MEMBER_TOKEN);
  EXPECT_EQ(told(second), "approved failure by 1 <approve>, members 2, changing 1(goodbye)\n");
  EXPECT_TRUE(recorder().of(first).empty());
}

TEST_P(ClientFlow, ThoseWhoAreOut_areToldAndForgotten) {
  join_two();
  wyx_provider_t whom = {};
  whom._gs_provider_info._gs_instance_number = 2;
  whom._gs_provider_info._gs_node_number = 1;
  ASSERT_EQ(expel(first, whom, "out"), WYX_OK);
  EXPECT_EQ(told_next(second, 2),
            "approved expel by 1 <approve>, members 1, changing 2(expelled), deactivate 0 'out'\n"
            "announcement <dissolved>\n");
  EXPECT_EQ(leave(second), WYX_BAD_MEMBER_TOKEN);

  Group voted("voted");
  voted.attributes.gs_num_phases = WYX_N_PHASE;
  recorder().set_hook([&](const Seen& seen) {
    if (seen.type != WYX_N_PHASE_NOTIFICATION) return;
    const bool rejects = seen.protocol().proposal.proposed_by.instance == 2 && seen.token == first;
    EXPECT_EQ(vote(seen.token, rejects ? WYX_VOTE_REJECT : WYX_VOTE_APPROVE), WYX_OK);
  });
  ASSERT_EQ(join(voted, 1, &first), WYX_OK);
  ASSERT_TRUE(all_arrive(first, 2));
  ASSERT_EQ(join(voted, 2, &second), WYX_OK);
  EXPECT_EQ(told(second, 2),
            "phase 1 join by 2, members 1, changing 2\n"
            "rejected join by 2 <reject>, members 1, changing 2\n");
  ASSERT_TRUE(all_arrive(first, 4));
  EXPECT_EQ(change_state(second, "x"), WYX_BAD_MEMBER_TOKEN);
  EXPECT_EQ(change_state(first, "x"), WYX_OK);
}

TEST_P(ClientFlow, Subscribers_seeStateAndMembershipUntilTheGroupEnds_persistentOnesBeyond) {
  wyx_token_t watcher = -1, persistent = -1;
  EXPECT_EQ(subscribe(group.name, WYX_SUBSCRIBE_STATE, &watcher), WYX_UNKNOWN_GROUP);
  ASSERT_EQ(subscribe(group.name, WYX_SUBSCRIBE_MEMBERSHIP | WYX_SUBSCRIBE_PERSISTENCE, &persistent), WYX_OK);
  first = joined(group);
  ASSERT_EQ(change_state(first, "seen"), WYX_OK);
  ASSERT_EQ(subscribe(group.name, WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP, &watcher), WYX_OK);
  EXPECT_EQ(told_next(watcher), "subscription {state|members}, members 1, state 'seen'\n");
  ASSERT_EQ(leave(first), WYX_OK);
  EXPECT_EQ(told(watcher, 2),
            "subscription {leave|members}, members -, changing 1(voluntary)\n"
            "subscription {dissolved}\n");
  EXPECT_EQ(told_next(persistent), "subscription {members|persistent}, members -\n");
  EXPECT_EQ(wyx_unsubscribe(watcher), WYX_BAD_MEMBER_TOKEN);

  ASSERT_EQ(join(group, 1, &first), WYX_OK);
  EXPECT_EQ(told(persistent), "subscription {members}, members 1\n");
  EXPECT_EQ(wyx_unsubscribe(persistent), WYX_OK);
  EXPECT_EQ(wyx_unsubscribe(persistent), WYX_BAD_MEMBER_TOKEN);
}

INSTANTIATE_TEST_SUITE_P(Endpoints, ClientFlow, kEndpoints, endpoint_name);

}  // namespace
}  // namespace test_support
