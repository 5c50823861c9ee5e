// What a group tells people and tools, as it stands and as it goes.
#include <algorithm>
#include <limits>

#include "engine/group.h"

namespace gs {
namespace {

constexpr std::size_t kAll = std::numeric_limits<std::size_t>::max();

const char* state_of(const Member& m) {
  if (m.gone()) return "gone";
  if (m.stage != Member::Stage::kJoined) return "joining";
  return m.leaving ? "leaving" : "member";
}

bool is_default(const Ballot& ballot) { return ballot.summary & (WYX_DEFAULT_APPROVE | WYX_DEFAULT_REJECT); }

}  // namespace

GroupStatus Group::status() const {
  GroupStatus status;
  status.name = name_;
  status.attributes = attributes_;
  status.members = member_ids_;
  status.state = state_value_.bytes;
  status.seqnum = seqnum_;
  status.since = since_;
  status.waiting = queue_.size();
  status.unfinished = unfinished();
  if (!run_) return status;
  status.running = ProtocolStatus{run_->traits->name, run_->number,       run_->proposed_by, run_->terms,
                                  run_->phase,        run_->since,        run_->phase_since, run_->changing_ids,
                                  voters(true, kAll), voters(false, kAll)};
  return status;
}

std::vector<MemberStatus> Group::member_status(std::size_t from, std::size_t at_most) const {
  std::vector<MemberStatus> found;
  std::size_t place = 0;
  const auto take = [&](const MemberPtr& m) {
    if (place++ < from || found.size() == at_most) return;
    found.push_back({m->id, m->to, m->local_name, state_of(*m), m->since});
  };
  for (const MemberPtr& m : members_) take(m);
  if (run_ && run_->traits->changing_role == ChangingRole::kVote)
    for (const MemberPtr& m : run_->changing) take(m);
  for (const auto& [at, queued] : queue_)
    if (std::holds_alternative<JoinRequest>(queued.request)) take(queued.who);
  return found;
}

// --------------------------------------------------------------------------------------------------- observers

Happening Group::happening(Happening::Kind kind, const Run& run) const {
  Happening told;
  told.kind = kind;
  told.group = name_;
  told.protocol = run.traits->name;
  told.number = run.number;
  told.phase = run.phase;
  told.n_phase = run.terms.num_phases != WYX_1_PHASE;
  told.who = run.proposed_by;
  told.changing = run.changing_ids;
  told.leave_codes = run.leave_codes;
  told.members = member_ids_;
  told.voters = run.voters.size();
  return told;
}

void Group::tell(Happening::Kind kind, const Run& run, const Surroundings& env, std::uint32_t summary) const {
  if (env.watch.observer == nullptr) return;
  Happening told = happening(kind, run);
  told.summary = summary;
  if (kind != Happening::Kind::kBegin) told.event_number = seqnum_;
  told.state = run.proposed_state.bytes;
  told.state_changed = kind == Happening::Kind::kApproved && run.proposed_state;
  told.message = run.voted_message ? run.voted_message.bytes : run.message.bytes;
  env.watch.observer->happened(told);
}

/// Of the phase that runs.
void Group::tell_vote(Happening::Kind kind, const Member& voter, const Surroundings& env) const {
  if (env.watch.observer == nullptr) return;
  Happening told = happening(kind, *run_);
  told.who = voter.id;
  told.name = voter.local_name;
  told.session = voter.to.session;
  told.vote = voter.ballot.vote;
  told.summary = voter.ballot.summary;
  told.leave_code = voter.gone_code;
  env.watch.observer->happened(told);
}

void Group::tell_default_votes(const Surroundings& env) const {
  if (!run_ || run_->defaults == 0) return;
  for (const MemberPtr& m : run_->voters) {
    if (!is_default(m->ballot)) continue;
    ++env.watch.tally.default_votes;
    tell_vote(Happening::Kind::kDefaultVote, *m, env);
  }
}

}  // namespace gs
