// Protocols as those who take part see them, where the simulator's model leaves room.
#include "gs/engine_script.h"

namespace gs::test {
namespace {

class EngineProtocols : public Script {};

TEST_F(EngineProtocols, Queue_runs_batches_where_the_group_says_so_and_leaves_of_the_same_terms_only) {
  attributes.batch_control = WYX_BATCH_BOTH;
  group_of({1, 2, 3, 4});
  change_state(1, "x", kPhases);
  leave(2, 20);
  leave(3, 30, kPhases);
  leave(4, 40);
  join(5, 7);
  join(6, 7);
  seen();
  approve({1, 2, 3, 4});
  approve({1});
  apply(HostGoneEvent{7});
  EXPECT_EQ(seen(),
            "1 2 3 4: approved state by 1 <approve>, members 1 2 3 4, state 'x'\n"
            "1 2 3: approved leave by 2 <approve>, members 1 3, changing 2 4(voluntary=20 voluntary=40), "
            "state 'x'\n"
            "4: approved leave by 4 <approve>, members 1 3, changing 2 4(voluntary=20 voluntary=40), state 'x'\n"
            "1: phase 1 leave by 3, members 1 3, changing 3(voluntary=30), state 'x'\n"
            "1 3: approved leave by 3 <approve>, members 1, changing 3(voluntary=30), state 'x'\n"
            "1 5: approved join by 5@7 <approve>, members 1 5@7 6@7, changing 5@7 6@7, state 'x'\n"
            "6: approved join by 6@7 <approve>, members 1 5@7 6@7, changing 5@7 6@7, state 'x'\n"
            "1: approved failure by 5@7 <approve>, members 1, changing 5@7 6@7(host host), state 'x'\n");
  EXPECT_EQ(join(8, 7), WYX_NO_INIT);
  apply(HostCameEvent{7});
  EXPECT_EQ(join(8, 7), WYX_OK);
}

TEST_F(EngineProtocols, Join_queued_that_no_longer_fits_gets_a_delayed_error_with_the_reason) {
  group_of({1});
  GroupAttributes changed = attributes;
  changed.client_version = 5;
  request(1, AttributeChangeRequest{1, kPhases, changed});
  EXPECT_EQ(join(2), WYX_OK);
  seen();
  approve({1});
  EXPECT_EQ(seen(),
            "1: approved attributes by 1 <approve>, members 1, version 5\n"
            "2: error 13 for join, group has version 5\n");
  EXPECT_EQ(join(2), WYX_BAD_GROUP_ATTRIBUTES);
  attributes = changed;
  EXPECT_EQ(join(2), WYX_OK);
}

TEST_F(EngineProtocols, Goodbye_frees_token_and_id_at_once_also_of_a_joiner) {
  attributes.num_phases = WYX_N_PHASE;
  group_of({1, 2});
  join(3);
  EXPECT_EQ(goodbye(3), WYX_OK);
  EXPECT_EQ(join(3), WYX_OK) << "the same token again, behind the old join";
  approve({1, 2});
  EXPECT_EQ(goodbye(3), WYX_OK);
  EXPECT_EQ(goodbye(3), WYX_BAD_MEMBER_TOKEN);
}

TEST_F(EngineProtocols, Vote_results_are_collected_as_the_batch_control_says) {
  attributes.batch_control = WYX_COLLECT_ALL_RESULT;
  attributes.num_phases = WYX_N_PHASE;
  attributes.time_limit = 5;
  group_of({1, 2, 3});
  join(4);
  vote(4, WYX_VOTE_CONTINUE, "s", "m");
  dies(3);
  approve({1});
  seen();
  apply(TimerExpiredEvent{timers.back().id});
  approve({1, 2});
  vote(4, WYX_VOTE_REJECT);
  EXPECT_EQ(seen(),
            "1 2 4: phase 2 join by 4 <default-approve|time|failed>, members 1 2 3, changing 4, proposed 's', "
            "msg 'm', votes[1 yes approve; 2 yes default-approve|time; 3 yes default-approve|failed (died)], "
            "changing votes[4 continue none 's' msg 'm'], limit 5\n"
            "1 2 4: rejected join by 4 <reject>, members 1 2 3, changing 4, "
            "votes[1 yes approve; 2 yes approve], changing votes[4 no reject]\n"
            "1 2: phase 1 failure by 3, members 1 2 3, changing 3(died), limit 5\n");

  const std::pair<wyx_batch_ctrl_t, std::string> parts[] = {{WYX_COLLECT_VOTE_RESULT, "yes approve]"},
                                                            {WYX_COLLECT_MSG_RESULT, "null approve msg 'm']"},
                                                            {WYX_COLLECT_STATEVALUE_RESULT, "null approve 's']"}};
  int who = 10;
  for (const auto& [control, votes] : parts) {
    attributes.batch_control = control;
    attributes.group_name = votes;
    group_of({++who});
    request(who, MessageRequest{1, kPhases, "p"});
    vote(who, WYX_VOTE_APPROVE, "s", "m");
    EXPECT_NE(seen().find("votes[" + std::to_string(who) + " " + votes), std::string::npos) << votes;
  }
}

TEST_F(EngineProtocols, Vote_results_of_many_large_values_are_bounded_and_hold_every_vote) {
  attributes.batch_control = WYX_COLLECT_ALL_RESULT;
  constexpr std::size_t kVoters = 40;
  for (std::size_t who = 1; who <= kVoters; ++who) join(static_cast<int>(who));
  request(1, MessageRequest{1, kPhases, "m"});
  const Bytes value(kMaxStateValue, 'v');
  for (std::size_t who = 1; who <= kVoters; ++who) vote(static_cast<int>(who), WYX_VOTE_APPROVE, value, value);
  const auto& approved = std::get<ProtocolNotification>(*last.deliveries.at(0).what);
  const std::vector<VoteResult>& results = *approved.proposal.current_vote_results;
  EXPECT_EQ(results.size(), kVoters);
  std::size_t bytes = 0;
  for (const VoteResult& r : results)
    bytes += (r.proposed_state ? r.proposed_state->size() : 0) + (r.message ? r.message->size() : 0);
  EXPECT_EQ(bytes, kMaxCollected);
}

class EngineSlices : public Script {
 protected:
  static constexpr std::size_t kSlice = 100, kMembers = 60;
  EngineSlices() : Script(Limits{.slice = kSlice}) {}

  JoinRequest provider(Token token, std::int16_t instance, const std::string& group) const {
    JoinRequest join{token, attributes, instance, "p"};
    join.attributes.group_name = group;
    return join;
  }
};

TEST_F(EngineSlices, Many_failures_of_one_death_are_told_in_parts_and_others_are_served_between_them) {
  for (std::int16_t i = 0; i < 2 * static_cast<int>(kMembers); ++i)
    ASSERT_EQ(request(1 + i % 2, provider(i, i, "g")), WYX_OK);
  for (std::int16_t i = 0; i < 50; ++i)
    ASSERT_EQ(request(1, provider(500 + i, 1, "h" + std::to_string(i))), WYX_OK);
  ASSERT_EQ(request(3, provider(1, 1, "other")), WYX_OK);
  const std::size_t before = engine.status().size();
  dies(1);
  std::size_t parts = 1, told = last.deliveries.size();
  for (; engine.busy(); ++parts) {
    EXPECT_LE(last.deliveries.size(), kSlice + kMembers);
    EXPECT_EQ(request(2, StateChangeRequest{1, kOnePhase, "x"}), WYX_COLLIDE);
    EXPECT_EQ(request(3, StateChangeRequest{1, kOnePhase, "x"}), WYX_OK);
    EXPECT_EQ(last.deliveries.size(), 1u);
    apply(ContinueEvent{});
    told += last.deliveries.size();
  }
  EXPECT_EQ(told, kMembers * kMembers);
  EXPECT_GE(parts, told / (kSlice + kMembers));
  EXPECT_EQ(engine.status().size(), before - 50);
  EXPECT_EQ(request(2, StateChangeRequest{1, kOnePhase, "x"}), WYX_OK);
}

TEST_F(EngineSlices, Silence_in_many_groups_is_told_in_parts_and_changes_that_undo_each_other_are_left_out) {
  constexpr std::size_t kGroups = 50;
  for (std::int16_t i = 0; i < static_cast<int>(kGroups); ++i)
    for (const int who : {1, 2, 3, 4})
      ASSERT_EQ(request(who, provider(i, static_cast<std::int16_t>(who), "g" + std::to_string(i))), WYX_OK);
  std::size_t told = 0;
  for (int i = 0; i < 9; ++i, told += last.deliveries.size()) apply(ResponsivenessEvent{session(1), i % 2 == 1});
  for (; engine.busy(); told += last.deliveries.size()) {
    EXPECT_LE(last.deliveries.size(), kSlice + 4);
    apply(ContinueEvent{});
  }
  EXPECT_LE(told, 9 * (kSlice + 4) + 2 * 4 * kGroups);
  EXPECT_EQ(request(1, StateChangeRequest{0, kOnePhase, "x"}), WYX_OK);
}

class EngineLongestPhase : public Script {
 protected:
  EngineLongestPhase() : Script(Limits{.max_phase_time = 30}) {}
};

TEST_F(EngineLongestPhase, Phase_without_a_limit_or_with_a_longer_one_gets_the_longest) {
  group_of({1, 2});
  for (const std::uint16_t asked : {0, 31, 30, 7}) {
    change_state(1, "x", {WYX_N_PHASE, asked});
    EXPECT_EQ(last.timers.at(0).seconds, asked == 7 ? 7 : 30);
    approve({1});
    const MissingVotes missing = engine.missing_votes("g", 8);
    EXPECT_EQ(missing.count, 1u);
    EXPECT_EQ(missing.voters.at(0).id, id(2));
    apply(TimerExpiredEvent{timers.back().id});
    EXPECT_EQ(engine.missing_votes("g", 8).protocol, "");
  }
}

}  // namespace
}  // namespace gs::test
