// Phases, votes, defaults, time limits, and what protocols change when they are approved.
#include "gs/engine_script.h"

namespace gs::test {
namespace {

class EngineVoting : public Script {};

TEST_F(EngineVoting, Reject_wins_over_continue_once_all_have_voted_and_nothing_changes) {
  group_of({1, 2, 3});
  change_state(1, "x", kPhases);
  seen();
  vote_all({1}, WYX_VOTE_REJECT);
  vote_all({2}, WYX_VOTE_CONTINUE);
  EXPECT_EQ(seen(), "");
  vote_all({3}, WYX_VOTE_APPROVE);
  EXPECT_EQ(seen(), "1 2 3: rejected state by 1 <reject>, members 1 2 3, #5\n");
  GroupAttributes changed = attributes;
  changed.client_version = 3;
  change_attributes(1, changed, kPhases);
  vote_all({1, 2, 3}, WYX_VOTE_REJECT);
  EXPECT_EQ(seen(),
            "1 2 3: phase 1 attributes by 1 {proposed-attributes}, members 1 2 3, version 3, #6\n"
            "1 2 3: rejected attributes by 1 <reject> {rejected-attributes}, members 1 2 3, version 3, #7\n");
  EXPECT_EQ(join(4), WYX_OK) << "the old attributes still hold";
}

TEST_F(EngineVoting, Vote_out_of_turn_is_not_expected) {
  group_of({1, 2});
  EXPECT_EQ(vote(1, WYX_VOTE_APPROVE), WYX_VOTE_NOT_EXPECTED);
  leave(2, 0, kPhases);
  EXPECT_EQ(vote(2, WYX_VOTE_APPROVE), WYX_VOTE_NOT_EXPECTED) << "a leaver has no vote";
  EXPECT_EQ(vote(1, WYX_NULL_VOTE), WYX_VOTE_VALUE_NOT_ALLOWED);
  EXPECT_EQ(vote(1, WYX_VOTE_APPROVE_AND_SWITCH_ALPHA_OMEGA), WYX_VOTE_VALUE_NOT_ALLOWED);
  EXPECT_EQ(vote(1, WYX_VOTE_APPROVE, WYX_VOTE_CONTINUE), WYX_VOTE_VALUE_NOT_ALLOWED);
  EXPECT_EQ(vote_with(1, WYX_VOTE_APPROVE, Bytes(kMaxStateValue + 1, 'x'), std::nullopt), WYX_BAD_PARAMETER);
  EXPECT_EQ(vote_with(1, WYX_VOTE_APPROVE, std::nullopt, Bytes(kMaxProviderMessage + 1, 'x')), WYX_BAD_PARAMETER);
  EXPECT_EQ(vote(1, WYX_VOTE_APPROVE), WYX_OK);
  EXPECT_EQ(vote(1, WYX_VOTE_APPROVE), WYX_VOTE_NOT_EXPECTED);
}

TEST_F(EngineVoting, Vote_with_state_and_message_the_last_ordered_wins_the_message_is_seen_once) {
  group_of({1, 2});
  join(3);
  send(1, "first", kPhases);
  vote_with(3, WYX_VOTE_CONTINUE, "s3", "m3");
  vote_with(1, WYX_VOTE_CONTINUE, "s1", std::nullopt);
  vote_with(2, WYX_VOTE_CONTINUE, std::nullopt, "m2");
  vote_all({1, 2, 3}, WYX_VOTE_APPROVE);
  change_state(1, "y", kPhases);
  vote_with(1, WYX_VOTE_CONTINUE, "z", "why");
  vote_all({2, 3}, WYX_VOTE_APPROVE);
  vote_all({1, 2, 3}, WYX_VOTE_APPROVE);
  EXPECT_EQ(
      seen(),
      "1 2 3: approved join by 3 <approve> {updated-members}, members 1 2 3, changing 3, #3\n"
      "1 2 3: phase 1 message by 1 {message}, members 1 2 3, msg 'first', #4\n"
      "1 2 3: phase 2 message by 1 {ongoing-state|message}, members 1 2 3, proposed 's1', msg 'm2', #5\n"
      "1 2 3: approved message by 1 <approve> {updated-state|message}, members 1 2 3, state 's1', msg 'm2', #6\n"
      "1 2 3: phase 1 state by 1 {proposed-state}, members 1 2 3, state 's1', proposed 'y', #7\n"
      "1 2 3: phase 2 state by 1 {ongoing-state|message}, members 1 2 3, state 's1', proposed 'z', "
      "msg 'why', #8\n"
      "1 2 3: approved state by 1 <approve> {updated-state}, members 1 2 3, state 'z', #9\n");
}

TEST_F(EngineVoting, Rejection_carries_the_message_of_its_votes_and_never_the_one_rejected) {
  group_of({1, 2});
  send(1, "proposed", kPhases);
  vote_all({1, 2}, WYX_VOTE_REJECT);
  send(1, "proposed", kPhases);
  vote_all({1}, WYX_VOTE_APPROVE);
  seen();
  vote_with(2, WYX_VOTE_REJECT, std::nullopt, "too early");
  EXPECT_EQ(seen(), "1 2: rejected message by 1 <reject> {message}, members 1 2, msg 'too early', #6\n");
}

TEST_F(EngineVoting, Time_limit_counts_the_default_vote_of_the_silent) {
  group_of({1, 2});
  change_state(1, "x", {WYX_N_PHASE, 5});
  vote_all({1}, WYX_VOTE_APPROVE);
  seen();
  ASSERT_EQ(timers.size(), 1u);
  EXPECT_EQ(timers[0].seconds, 5);
  expire(timers[0]);
  EXPECT_EQ(outcomes(), "1 2: approved state by 1 <default-approve|time> {updated-state}\n");

  attributes.default_vote = WYX_VOTE_REJECT;
  change_attributes(1, attributes);
  change_state(1, "y", {WYX_N_PHASE, 5});
  vote_all({1}, WYX_VOTE_APPROVE);
  seen();
  expire(timers[1]);
  EXPECT_EQ(outcomes(), "1 2: rejected state by 1 <default-reject|time>\n");
}

TEST_F(EngineVoting, Default_given_with_an_earlier_vote_holds_for_this_protocol_only) {
  group_of({1, 2});
  for (const char* const closing : {"1 2: rejected state by 1 <default-reject|time>\n",
                                    "1 2: approved state by 1 <default-approve|time> {updated-state}\n"}) {
    timers.clear();
    change_state(1, "x", {WYX_N_PHASE, 5});
    const bool first = closing[5] == 'r';
    vote(2, WYX_VOTE_CONTINUE, first ? WYX_VOTE_REJECT : WYX_NULL_VOTE);
    vote_all({1}, WYX_VOTE_CONTINUE);
    vote_all({1}, WYX_VOTE_APPROVE);
    seen();
    expire(timers[1]);
    EXPECT_EQ(outcomes(), closing);
  }
}

TEST_F(EngineVoting, Results_are_collected_as_the_batch_control_says) {
  attributes.batch_control = WYX_COLLECT_ALL_RESULT;
  attributes.num_phases = WYX_N_PHASE;
  attributes.time_limit = 5;
  group_of({1, 2, 3});
  join(4);
  vote_with(4, WYX_VOTE_CONTINUE, "s", "m");
  dies(3);
  vote_all({1}, WYX_VOTE_APPROVE);
  seen();
  expire(timers[0]);
  vote_all({1, 2}, WYX_VOTE_APPROVE);
  vote_all({4}, WYX_VOTE_REJECT);
  EXPECT_EQ(seen(),
            "1 2 4: phase 2 join by 4 <default-approve|time|failed> {ongoing-members|ongoing-state|message}, "
            "members 1 2 3, changing 4, proposed 's', msg 'm', "
            "votes[1 yes approve; 2 yes default-approve|time; 3 yes default-approve|failed (died)], "
            "changing votes[4 continue none 's' msg 'm'], limit 5, #6\n"
            "1 2 4: rejected join by 4 <reject> {rejected-members}, members 1 2 3, changing 4, "
            "votes[1 yes approve; 2 yes approve], changing votes[4 no reject], #7\n"
            "1 2: phase 1 failure by 3 {proposed-members}, members 1 2 3, changing 3(died), limit 5, #8\n");

  std::string all;
  for (auto control : {WYX_COLLECT_VOTE_RESULT, WYX_COLLECT_MSG_RESULT, WYX_COLLECT_STATEVALUE_RESULT}) {
    attributes.batch_control = control;
    attributes.group_name = "g" + std::to_string(control);
    const int a = 10 * control;
    group_of({a});
    send(a, "p", kPhases);
    vote_with(a, WYX_VOTE_APPROVE, "s", "m");
    all += seen();
  }
  EXPECT_NE(all.find("votes[80 yes approve], #"), std::string::npos) << all;
  EXPECT_NE(all.find("votes[160 null approve msg 'm'], #"), std::string::npos) << all;
  EXPECT_NE(all.find("votes[320 null approve 's'], #"), std::string::npos) << all;
}

TEST_F(EngineVoting, Results_of_many_large_values_are_bounded_and_hold_every_vote) {
  attributes.batch_control = WYX_COLLECT_ALL_RESULT;
  constexpr int kVoters = 40;
  for (int who = 1; who <= kVoters; ++who) join(who);
  send(1, "m", kPhases);
  const Bytes value(kMaxStateValue, 'v');
  for (int who = 1; who <= kVoters; ++who) vote_with(who, WYX_VOTE_APPROVE, value, value);
  const auto& approved = std::get<ProtocolNotification>(*last.deliveries.at(0).what);
  const std::vector<VoteResult>& results = approved.proposal.current_vote_results;
  EXPECT_EQ(results.size(), static_cast<std::size_t>(kVoters));
  std::size_t bytes = 0;
  for (const VoteResult& r : results) {
    EXPECT_EQ(r.vote, WYX_VOTE_APPROVE);
    bytes += r.proposed_state.value_or("").size() + r.message.value_or("").size();
  }
  EXPECT_EQ(bytes, kMaxCollected);
}

}  // namespace
}  // namespace gs::test
