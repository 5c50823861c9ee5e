// What the members and watchers of a group see through the entry points, over every kind of endpoint.

#include "support/client_fixture.h"

namespace test_support {
namespace {

constexpr unsigned kProposedState = WYX_PROPOSED_STATE_VALUE | WYX_CURRENT_STATE_VALUE;

class ClientFlow : public ClientTest {
 protected:
  /// Two members of `group`, joined, with what they saw until then forgotten.
  void join_two() {
    ASSERT_EQ(join(group, 1, &first), WYX_OK);
    ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().count(first, WYX_APPROVED_NOTIFICATION) == 1; }));
    ASSERT_EQ(join(group, 2, &second), WYX_OK);
    ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().count(second, WYX_APPROVED_NOTIFICATION) == 1; }));
    ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().count(first, WYX_APPROVED_NOTIFICATION) == 2; }));
    recorder().reset();
  }
  bool both_see(wyx_notification_type_t type, std::size_t times = 1) {
    return dispatch_until(
        fd(), [&] { return recorder().count(first, type) >= times && recorder().count(second, type) >= times; });
  }

  Group group{"flow"};
  wyx_token_t first = -1;
  wyx_token_t second = -1;
};

TEST_P(ClientFlow, Join_approvedSaysWhoIsThere) {
  join_two();
  wyx_token_t third = -1;
  ASSERT_EQ(join(group, 3, &third), WYX_OK);
  ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().count(third, WYX_APPROVED_NOTIFICATION) == 1; }));
  ASSERT_TRUE(both_see(WYX_APPROVED_NOTIFICATION));
  for (const wyx_token_t token : {first, second, third}) {
    const Seen seen = recorder().of(token).at(0);
    EXPECT_EQ(seen.protocol, WYX_JOIN);
    EXPECT_EQ(seen.proposed_by, 3);
    EXPECT_EQ(seen.members, (std::vector<int>{1, 2, 3}));
    EXPECT_EQ(seen.changing, std::vector<int>{3});
    EXPECT_TRUE(seen.whats_changed & WYX_UPDATED_MEMBERSHIP);
    EXPECT_FALSE(seen.proposed.has_value());
    EXPECT_FALSE(seen.message.has_value());
    EXPECT_EQ(seen.seqnum, recorder().of(first).at(0).seqnum);
  }
}

TEST_P(ClientFlow, Join_rejectedByAVote_endsTheJoinersToken) {
  Group voted("voted");
  voted.attributes.gs_num_phases = WYX_N_PHASE;
  recorder().set_hook([&](const Seen& seen) {
    if (seen.type == WYX_N_PHASE_NOTIFICATION) {
      vote(seen.token, seen.token == first && seen.proposed_by == 2 ? WYX_VOTE_REJECT : WYX_VOTE_APPROVE);
    }
  });
  ASSERT_EQ(join(voted, 1, &first), WYX_OK);
  ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().count(first, WYX_APPROVED_NOTIFICATION) == 1; }));
  ASSERT_EQ(join(voted, 2, &second), WYX_OK);
  ASSERT_TRUE(both_see(WYX_REJECTED_NOTIFICATION));
  EXPECT_EQ(change_state(second, "x"), WYX_BAD_MEMBER_TOKEN);
  EXPECT_EQ(change_state(first, "x"), WYX_OK);
}

TEST_P(ClientFlow, StateChange_votedThroughTwoPhases) {
  join_two();
  recorder().set_hook([&](const Seen& seen) {
    if (seen.type != WYX_N_PHASE_NOTIFICATION) return;
    if (seen.phase == 1 && seen.token == second) {
      std::string better = "better";
      std::string why = "because";
      const wyx_state_value_t state = {static_cast<int>(better.size()), better.data()};
      const wyx_provider_message_t message = {static_cast<int>(why.size()), why.data()};
      EXPECT_EQ(wyx_vote(second, WYX_VOTE_CONTINUE, &state, &message, WYX_VOTE_APPROVE), WYX_OK);
    } else {
      EXPECT_EQ(vote(seen.token, WYX_VOTE_APPROVE), WYX_OK);
    }
  });
  ASSERT_EQ(change_state(first, "good", WYX_N_PHASE, 30), WYX_OK);
  ASSERT_TRUE(both_see(WYX_APPROVED_NOTIFICATION));

  const auto seen = recorder().of(first);
  ASSERT_EQ(seen.size(), 3u);
  EXPECT_EQ(seen[0].whats_changed & kProposedState, kProposedState);
  EXPECT_EQ(seen[0].proposed, "good");
  EXPECT_EQ(seen[0].time_limit, 30);
  EXPECT_EQ(seen[1].phase, 2);
  EXPECT_TRUE(seen[1].whats_changed & WYX_ONGOING_STATE_VALUE);
  EXPECT_EQ(seen[1].proposed, "better");
  EXPECT_EQ(seen[1].message, "because");
  EXPECT_TRUE(seen[2].whats_changed & WYX_UPDATED_STATE_VALUE);
  EXPECT_EQ(seen[2].state, "better");
  EXPECT_EQ(seen[2].summary, static_cast<unsigned>(WYX_EXPLICIT_APPROVE));
}

TEST_P(ClientFlow, TimeLimit_runsOut_countsTheDefaultVote) {
  join_two();
  ASSERT_EQ(change_state(first, "slow", WYX_N_PHASE, 1), WYX_OK);
  ASSERT_TRUE(both_see(WYX_N_PHASE_NOTIFICATION));
  ASSERT_EQ(vote(first, WYX_VOTE_APPROVE), WYX_OK);
  ASSERT_TRUE(both_see(WYX_APPROVED_NOTIFICATION));
  const Seen last = recorder().of(second).back();
  EXPECT_TRUE(last.summary & WYX_DEFAULT_APPROVE);
  EXPECT_TRUE(last.summary & WYX_TIME_LIMIT_EXCEEDED);
  EXPECT_EQ(last.state, "slow");
}

TEST_P(ClientFlow, Message_anyBytesAndTheLargest_arriveWhole) {
  join_two();
  std::string bytes("a\0b", 3);
  ASSERT_EQ(send_message(first, bytes), WYX_OK);
  ASSERT_EQ(send_message(second, std::string(64 * 1024, 'x')), WYX_OK);
  ASSERT_TRUE(both_see(WYX_APPROVED_NOTIFICATION, 2));
  const auto seen = recorder().of(first);
  EXPECT_EQ(seen[0].message, bytes);
  EXPECT_TRUE(seen[0].whats_changed & WYX_UPDATED_PROVIDER_MESSAGE);
  EXPECT_EQ(seen[1].message, std::string(64 * 1024, 'x'));
  EXPECT_FALSE(seen[1].changing.has_value());
}

TEST_P(ClientFlow, Leave_theLeaverIsToldAndForgotten) {
  join_two();
  ASSERT_EQ(leave(first, 42), WYX_OK);
  ASSERT_TRUE(both_see(WYX_APPROVED_NOTIFICATION));
  for (const wyx_token_t token : {first, second}) {
    const Seen last = recorder().of(token).back();
    EXPECT_EQ(last.protocol, WYX_LEAVE);
    EXPECT_EQ(last.changing, std::vector<int>{1});
    EXPECT_EQ(last.leave_codes, std::vector<unsigned>{WYX_VOLUNTARY_LEAVE});
    EXPECT_EQ(last.members, std::vector<int>{2});
  }
  EXPECT_EQ(leave(first), WYX_BAD_MEMBER_TOKEN);
  EXPECT_EQ(send_message(second, "still here"), WYX_OK);
}

TEST_P(ClientFlow, Goodbye_isSilentForTheOneAndAFailureLeaveForTheOthers) {
  join_two();
  ASSERT_EQ(wyx_goodbye(first), WYX_OK);
  EXPECT_EQ(wyx_goodbye(first), WYX_BAD_MEMBER_TOKEN);
  ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().count(second, WYX_APPROVED_NOTIFICATION) == 1; }));
  EXPECT_TRUE(recorder().of(first).empty());
  const Seen last = recorder().of(second).back();
  EXPECT_EQ(last.protocol, WYX_FAILURE_LEAVE);
  EXPECT_TRUE(last.leave_codes.at(0) & WYX_PROVIDER_SAID_GOODBYE);
}

TEST_P(ClientFlow, Expel_theExpelledIsToldTwiceAndForgotten) {
  join_two();
  wyx_provider_t whom = {};
  whom._gs_provider_info._gs_instance_number = 2;
  int node = -1;
  ASSERT_EQ(wyx_get_node_number(&node), WYX_OK);
  whom._gs_provider_info._gs_node_number = static_cast<short>(node);
  ASSERT_EQ(expel(first, whom, "out"), WYX_OK);
  ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().count(second, WYX_ANNOUNCEMENT_NOTIFICATION) == 1; }));
  const auto seen = recorder().of(second);
  ASSERT_EQ(seen.size(), 2u);
  EXPECT_EQ(seen[0].protocol, WYX_EXPEL);
  EXPECT_EQ(seen[0].expel_flag, "out");
  EXPECT_EQ(seen[1].summary, static_cast<unsigned>(WYX_GROUP_DISSOLVED));
  EXPECT_EQ(leave(second), WYX_BAD_MEMBER_TOKEN);
}

TEST_P(ClientFlow, AttributeChange_bringsTheNewOnes) {
  join_two();
  Group changed = group;
  changed.attributes.gs_time_limit = 5;
  wyx_proposal_info_t info = {};
  info._gs_protocol_info._gs_attribute_change_request = {WYX_1_PHASE, 0, changed.record(), nullptr};
  ASSERT_EQ(wyx_change_attributes(first, &info), WYX_OK);
  ASSERT_TRUE(both_see(WYX_APPROVED_NOTIFICATION));
  const Seen last = recorder().of(second).back();
  EXPECT_TRUE(last.whats_changed & WYX_UPDATED_GROUP_ATTRIBUTES);
  EXPECT_EQ(last.group, group.name);
}

TEST_P(ClientFlow, Subscriber_seesStateAndMembershipUntilTheGroupEnds) {
  join_two();
  ASSERT_EQ(change_state(first, "seen"), WYX_OK);
  ASSERT_TRUE(both_see(WYX_APPROVED_NOTIFICATION));
  wyx_token_t watcher = -1;
  EXPECT_EQ(subscribe("nobody", WYX_SUBSCRIBE_STATE, &watcher), WYX_UNKNOWN_GROUP);
  ASSERT_EQ(subscribe(group.name, WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP, &watcher), WYX_OK);
  ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().of(watcher).size() == 1; }));
  EXPECT_EQ(recorder().of(watcher)[0].state, "seen");
  EXPECT_EQ(recorder().of(watcher)[0].members, (std::vector<int>{1, 2}));

  ASSERT_EQ(leave(first), WYX_OK);
  ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().of(watcher).size() == 2; }));
  EXPECT_EQ(recorder().of(watcher)[1].changing, std::vector<int>{1});
  EXPECT_EQ(recorder().of(watcher)[1].leave_codes, std::vector<unsigned>{WYX_VOLUNTARY_LEAVE});
  ASSERT_EQ(leave(second), WYX_OK);
  const auto dissolved = [&] { return (recorder().of(watcher).back().summary & WYX_SUBSCRIPTION_DISSOLVED) != 0; };
  ASSERT_TRUE(dispatch_until(fd(), dissolved));
  EXPECT_EQ(wyx_unsubscribe(watcher), WYX_BAD_MEMBER_TOKEN);
}

TEST_P(ClientFlow, PersistentSubscriber_outlivesTheGroup) {
  wyx_token_t watcher = -1;
  ASSERT_EQ(subscribe(group.name, WYX_SUBSCRIBE_MEMBERSHIP | WYX_SUBSCRIBE_PERSISTENCE, &watcher), WYX_OK);
  for (int life = 0; life < 2; ++life) {
    recorder().reset();
    ASSERT_EQ(join(group, 1, &first), WYX_OK);
    ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().of(watcher).size() == 1; }));
    EXPECT_EQ(recorder().of(watcher)[0].members, std::vector<int>{1});
    ASSERT_EQ(leave(first), WYX_OK);
    ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().of(watcher).size() == 2; }));
    EXPECT_TRUE(recorder().of(watcher)[1].summary & WYX_SUBSCRIPTION_PERSISTENT);
    EXPECT_EQ(recorder().of(watcher)[1].members, std::vector<int>{});
  }
  EXPECT_EQ(wyx_unsubscribe(watcher), WYX_OK);
  EXPECT_EQ(wyx_unsubscribe(watcher), WYX_BAD_MEMBER_TOKEN);
}

TEST_P(ClientFlow, VoteResults_collected_travelWithTheApproval) {
  group.attributes.gs_batch_control = WYX_COLLECT_VOTE_RESULT;
  join_two();
  recorder().set_hook([](const Seen& seen) {
    if (seen.type == WYX_N_PHASE_NOTIFICATION) vote(seen.token, WYX_VOTE_APPROVE);
  });
  ASSERT_EQ(change_state(first, "counted", WYX_N_PHASE), WYX_OK);
  ASSERT_TRUE(both_see(WYX_APPROVED_NOTIFICATION));
  EXPECT_THAT(recorder().of(first).back().votes, testing::UnorderedElementsAre("1:1", "2:1"));
}

INSTANTIATE_TEST_SUITE_P(Endpoints, ClientFlow, kEndpoints, endpoint_name);

}  // namespace
}  // namespace test_support
