// How a protocol runs: phases, votes, outcome, and what is said about it.
#include <algorithm>

#include "engine/group.h"

namespace gs {
namespace {

std::uint32_t summary_of(wyx_vote_value_t vote, bool by_default) {
  if (vote == WYX_VOTE_APPROVE) return by_default ? WYX_DEFAULT_APPROVE : WYX_EXPLICIT_APPROVE;
  if (vote == WYX_VOTE_REJECT) return by_default ? WYX_DEFAULT_REJECT : WYX_EXPLICIT_REJECT;
  return 0;
}

bool is_default(const Ballot& ballot) { return ballot.summary & (WYX_DEFAULT_APPROVE | WYX_DEFAULT_REJECT); }

/// Null: there are none.
SharedVoteResults as_shared(std::vector<VoteResult> results) {
  return results.empty() ? nullptr : std::make_shared<const std::vector<VoteResult>>(std::move(results));
}

/// At once, and never little by little.
void make_room(std::vector<Delivery>& deliveries, std::size_t more) {
  const std::size_t needed = deliveries.size() + more;
  if (needed > deliveries.capacity()) deliveries.reserve(std::max(needed, 2 * deliveries.capacity()));
}

std::vector<MemberPtr> joined(const std::vector<MemberPtr>& a, const std::vector<MemberPtr>& b) {
  std::vector<MemberPtr> all = a;
  all.insert(all.end(), b.begin(), b.end());
  return all;
}

}  // namespace

// ------------------------------------------------------------------------------------------------------ phases

void Group::start(Run&& run, Surroundings& env) {
  if (!run.changing.empty()) {
    Membership ids;
    ids.reserve(run.changing.size());
    for (const MemberPtr& m : run.changing) ids.push_back(m->id);
    run.changing_ids = std::make_shared<const Membership>(std::move(ids));
  }
  for (const MemberPtr& m : run.changing) m->changing = true;
  const std::uint16_t longest = env.limits.max_phase_time;
  if (longest != 0 && (run.terms.time_limit == 0 || run.terms.time_limit > longest))
    run.terms.time_limit = longest;
  run.number = ++env.last_protocol;
  run.since = env.watch.now;
  tell(Happening::Kind::kBegin, run, env);
  ++env.watch.tally.begun;
  run.collect = attributes_->batch_control & WYX_COLLECT_ALL_RESULT;
  if (run.terms.num_phases == WYX_1_PHASE) return approve(run, WYX_EXPLICIT_APPROVE, env);
  for (const MemberPtr& m : members_) m->ballot = {};
  run_ = std::move(run);
  open_phase(env);
}

/// With nobody to ask, nothing is sent and the protocol is approved.
void Group::open_phase(Surroundings& env) {
  Run& run = *run_;
  ProtocolNotification note = compose(run, WYX_N_PHASE_NOTIFICATION, run.defaults);
  note.time_limit = run.terms.time_limit;

  run.voters.clear();
  const bool changing_vote = run.traits->changing_role == ChangingRole::kVote;
  for (const MemberPtr& m : members_)
    if (!m->gone() && !m->changing) run.voters.push_back(m);
  for (const MemberPtr& m : run.changing)
    if (changing_vote && !m->gone()) run.voters.push_back(m);
  run.missing = run.voters.size();
  run.collected = 0;
  if (run.voters.empty()) {
    if (run.phase > 1) --run.phase;
    return;
  }
  for (const MemberPtr& m : run.voters) {
    const wyx_vote_value_t default_vote = m->ballot.default_vote;
    m->ballot = {};
    m->ballot.open = true;
    m->ballot.default_vote = default_vote;
  }
  if (run.voted_message && run.traits->message_is_proposal) run.message = run.voted_message;
  run.voted_message = {};
  note.seqnum = next_number(env);
  run.phase_since = env.watch.now;
  tell(Happening::Kind::kPhase, run, env, run.defaults);
  send(run, std::move(note), run.voters, env);
  env.timers.push_back(*running_timer());
}

void Group::vote(Member& voter, const VoteRequest& request, Surroundings& env) {
  Ballot& ballot = voter.ballot;
  ballot.open = false;
  ballot.vote = request.vote;
  ballot.summary = summary_of(request.vote, false);
  if (request.default_vote != WYX_NULL_VOTE) ballot.default_vote = request.default_vote;
  if (request.proposed_state) {
    run_->proposed_state = env.keep(voter, *request.proposed_state);
    collect(run_->proposed_state, WYX_COLLECT_STATEVALUE_RESULT, ballot.proposed_state);
  }
  if (request.message) {
    run_->voted_message = env.keep(voter, *request.message);
    collect(run_->voted_message, WYX_COLLECT_MSG_RESULT, ballot.message);
  }
  --run_->missing;
  ++env.watch.tally.votes;
  tell_vote(Happening::Kind::kVote, voter, env);
}

/// Values over the limit are left out, so that no notification grows with the number of voters without bound.
void Group::collect(const Value& value, std::uint32_t flag, Value& into) {
  if (!(run_->collect & flag) || run_->collected + value.bytes->size() > kMaxCollected) return;
  run_->collected += value.bytes->size();
  into = value;
}

void Group::cast_default(Member& voter, std::uint32_t cause) {
  Ballot& ballot = voter.ballot;
  wyx_vote_value_t vote = ballot.default_vote;
  if (vote == WYX_NULL_VOTE) vote = attributes_->default_vote;
  if (vote == WYX_NULL_VOTE) vote = WYX_VOTE_APPROVE;
  ballot.open = false;
  ballot.vote = vote;
  ballot.summary = summary_of(vote, true) | cause;
  run_->defaults |= ballot.summary;
  --run_->missing;
}

bool Group::awaits(const TimerId& timer) const {
  return run_ && run_->number == timer.protocol && run_->phase == timer.phase;
}

std::optional<TimerRequest> Group::running_timer() const {
  if (!run_) return std::nullopt;
  return TimerRequest{{name_, run_->number, run_->phase}, run_->terms.time_limit};
}

void Group::expire(const TimerId& timer) {
  if (!awaits(timer) || run_->terms.time_limit == 0) return;
  for (const MemberPtr& m : run_->voters)
    if (m->ballot.open) cast_default(*m, WYX_TIME_LIMIT_EXCEEDED);
}

std::vector<MissingVoter> Group::voters(bool who_voted, std::size_t at_most) const {
  std::vector<MissingVoter> found;
  if (!run_) return found;
  for (const MemberPtr& m : run_->voters) {
    if (found.size() == at_most) break;
    if (m->ballot.open != who_voted) found.push_back({m->to, m->id, m->local_name});
  }
  return found;
}

std::vector<MissingVoter> Group::missing_voters(std::size_t at_most) const { return voters(false, at_most); }

void Group::end_phase(Surroundings& env) {
  tell_default_votes(env);
  bool any_continue = false;
  std::uint32_t rejects = 0;
  for (const MemberPtr& m : run_->voters) {
    any_continue |= m->ballot.vote == WYX_VOTE_CONTINUE;
    if (m->ballot.vote == WYX_VOTE_REJECT) rejects |= m->ballot.summary;
  }
  const PhaseEnd how = phase_end(rejects != 0, any_continue, run_->traits->preventable);
  if (how == PhaseEnd::kNextPhase) {
    ++run_->phase;
    return open_phase(env);
  }
  Run run = std::move(*run_);
  run_.reset();
  if (how == PhaseEnd::kReject) return reject(run, rejects, env);
  if (how == PhaseEnd::kApproveRejected) {
    run.proposed_state = {};
    return approve(run, rejects, env);
  }
  approve(run, run.defaults != 0 ? run.defaults : std::uint32_t{WYX_EXPLICIT_APPROVE}, env);
}

// ----------------------------------------------------------------------------------------------------- outcome

void Group::approve(const Run& run, std::uint32_t summary, Surroundings& env) {
  const bool was_born = born();
  std::vector<MemberPtr> all;  // where the members change
  if (!run.changing.empty())
    all = run.traits->changing_role == ChangingRole::kVote ? joined(members_, run.changing) : members_;
  const std::vector<MemberPtr>& audience = run.changing.empty() ? members_ : all;

  change_membership(run);
  for (const MemberPtr& m : run.changing) m->since = env.watch.now;
  if (run.proposed_state) state_value_ = run.proposed_state;
  if (run.new_attributes) attributes_ = run.new_attributes;
  ProtocolNotification note = compose(run, WYX_APPROVED_NOTIFICATION, summary);
  note.seqnum = next_number(env);
  ++env.watch.tally.approved;
  tell(Happening::Kind::kApproved, run, env, summary);
  send(run, std::move(note), audience, env);

  end(run, audience);
  if (run.traits->changing_role == ChangingRole::kHearEnd) dismiss(run, env);
  tell_subscribers(run, was_born, env);
  if (!born()) forget_values();
}

void Group::reject(const Run& run, std::uint32_t summary, Surroundings& env) {
  const bool joins = run.traits->changing_role == ChangingRole::kVote;
  const std::vector<MemberPtr> audience = joins ? joined(members_, run.changing) : members_;
  ProtocolNotification note = compose(run, WYX_REJECTED_NOTIFICATION, summary);
  note.seqnum = next_number(env);
  ++env.watch.tally.rejected;
  tell(Happening::Kind::kRejected, run, env, summary);
  send(run, std::move(note), audience, env);

  end(run, audience);
  if (joins) {
    for (const MemberPtr& m : run.changing) {
      m->stage = Member::Stage::kOut;
      if (!m->gone()) release(*m, env);
    }
  }
  if (!born()) forget_values();
}

void Group::end(const Run& run, const std::vector<MemberPtr>& audience) {
  for (const MemberPtr& m : audience) m->ballot = {};
  for (const MemberPtr& m : run.changing) m->changing = false;
}

void Group::change_membership(const Run& run) {
  if (run.changing.empty()) return;
  const bool joins = run.traits->changing_role == ChangingRole::kVote;
  for (const MemberPtr& m : run.changing) m->stage = joins ? Member::Stage::kJoined : Member::Stage::kOut;
  if (joins)
    members_.insert(members_.end(), run.changing.begin(), run.changing.end());
  else
    std::erase_if(members_, [](const MemberPtr& m) { return m->stage == Member::Stage::kOut; });
  Membership ids;
  ids.reserve(members_.size());
  for (const MemberPtr& m : members_) ids.push_back(m->id);
  member_ids_ = std::make_shared<const Membership>(std::move(ids));
}

/// The last words to those who have been taken out. A leave that an expelled member had waiting can no longer run.
void Group::dismiss(const Run& run, Surroundings& env) {
  std::shared_ptr<const Notification> dissolved;
  for (const MemberPtr& m : run.changing) {
    if (auto waiting = queue_.find(m->place); waiting != queue_.end()) {
      const Queued leave = dequeue(waiting);
      env.deliveries.push_back(
          delayed_error(m->to, std::get<LeaveRequest>(leave.request), WYX_NOT_A_MEMBER, nullptr));
    }
    if (m->gone()) continue;
    release(*m, env);
    if (run.traits->type != WYX_EXPEL) continue;
    if (!dissolved)
      dissolved = std::make_shared<const Notification>(AnnouncementNotification{WYX_GROUP_DISSOLVED, nullptr});
    env.deliveries.push_back({m->to, dissolved});
  }
}

void Group::tell_subscribers(const Run& run, bool was_born, Surroundings& env) {
  GroupView now = view();
  now.state_changed = run.proposed_state.bytes != nullptr;
  if (run.traits->changing_role == ChangingRole::kVote) now.joined = run.changing_ids;
  if (run.traits->changing_role == ChangingRole::kHearEnd) {
    now.left = run.changing_ids;
    now.leave_codes = run.leave_codes;
  }
  if (!was_born) return env.subscribers.born(name_, now, env.deliveries);
  if (born()) return env.subscribers.changed(name_, now, env.deliveries);
  for (const Endpoint& over : env.subscribers.ended(name_, now, env.deliveries)) env.clients.erase(over);
}

// ------------------------------------------------------------------------------------------------ what is said

ProtocolNotification Group::compose(const Run& run, wyx_notification_type_t type, std::uint32_t summary) const {
  const bool approved = type == WYX_APPROVED_NOTIFICATION, rejected = type == WYX_REJECTED_NOTIFICATION;
  auto bit = [&](std::uint32_t proposed, std::uint32_t ongoing, std::uint32_t updated, std::uint32_t refused) {
    if (approved) return updated;
    if (rejected) return refused;
    return run.phase == 1 ? proposed : ongoing;
  };
  ProtocolNotification note;
  note.type = type;
  note.protocol = run.traits->type;
  note.summary = summary;
  Proposal& p = note.proposal;
  p.num_phases = static_cast<std::uint16_t>(run.terms.num_phases);
  p.phase = static_cast<std::uint16_t>(std::min<std::uint32_t>(run.phase, UINT16_MAX));
  p.proposed_by = run.proposed_by;
  p.whats_changed = WYX_CURRENT_STATE_VALUE;
  p.current_providers = member_ids_;
  p.current_state = state_value_.bytes;
  if (run.changing_ids) {
    p.whats_changed |=
        bit(WYX_PROPOSED_MEMBERSHIP, WYX_ONGOING_MEMBERSHIP, WYX_UPDATED_MEMBERSHIP, WYX_REJECTED_MEMBERSHIP);
    p.changing_providers = run.changing_ids;
    p.leave_codes = run.leave_codes;
  }
  if (run.expel_info) {
    p.whats_changed |= WYX_EXPEL_INFORMATION;
    p.expel_info = run.expel_info;
  }
  // An approved value is the current one; a rejected one is gone.
  if (run.proposed_state) {
    p.whats_changed |= bit(WYX_PROPOSED_STATE_VALUE, WYX_ONGOING_STATE_VALUE, WYX_UPDATED_STATE_VALUE, 0);
    if (!approved && !rejected) p.proposed_state = run.proposed_state.bytes;
  }
  if (run.new_attributes) {
    p.whats_changed |= bit(WYX_PROPOSED_GROUP_ATTRIBUTES, WYX_ONGOING_GROUP_ATTRIBUTES,
                           WYX_UPDATED_GROUP_ATTRIBUTES, WYX_REJECTED_GROUP_ATTRIBUTES);
    p.new_attributes = run.new_attributes;
  }
  p.message = run.voted_message.bytes;
  if (!p.message && !rejected) p.message = run.message.bytes;
  if (p.message) p.whats_changed |= WYX_UPDATED_PROVIDER_MESSAGE;
  add_vote_results(run, p);
  return note;
}

/// Of the phase that has just ended, when the batch control asks for them.
void Group::add_vote_results(const Run& run, Proposal& proposal) const {
  if (run.collect == 0) return;
  std::vector<VoteResult> current, changing;
  for (const MemberPtr& m : run.voters) {
    VoteResult result;
    result.voter = m->id;
    if (run.collect & WYX_COLLECT_VOTE_RESULT) result.vote = m->ballot.vote;
    result.summary = m->ballot.summary;
    result.leave_code = is_default(m->ballot) ? m->gone_code : 0;
    result.proposed_state = m->ballot.proposed_state.bytes;
    result.message = m->ballot.message.bytes;
    (m->changing ? changing : current).push_back(std::move(result));
  }
  proposal.current_vote_results = as_shared(std::move(current));
  proposal.changing_vote_results = as_shared(std::move(changing));
}

/// One notification for all, but for those who read their own id as the proposer's.
void Group::send(const Run& run, ProtocolNotification&& notification, const std::vector<MemberPtr>& to,
                 Surroundings& env) const {
  const auto shared = std::make_shared<const Notification>(std::move(notification));
  make_room(env.deliveries, to.size());
  for (const MemberPtr& m : to) {
    if (m->gone()) continue;
    auto what = shared;
    if (run.traits->each_proposes_itself && m->changing && m->id != run.proposed_by) {
      ProtocolNotification own = std::get<ProtocolNotification>(*shared);
      own.proposal.proposed_by = m->id;
      what = std::make_shared<const Notification>(std::move(own));
    }
    env.deliveries.push_back({m->to, std::move(what)});
  }
}

}  // namespace gs
