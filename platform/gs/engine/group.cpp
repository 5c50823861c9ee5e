#include "engine/group.h"

#include <algorithm>

#include "engine/checks.h"
#include "engine/work.h"

namespace gs {

Delivery delayed_error(const Endpoint& to, const Request& request, wyx_rc_t rc,
                       std::shared_ptr<const GroupAttributes> group_attributes) {
  DelayedErrorNotification error;
  error.protocol = protocol_of(request);
  error.rc = rc;
  error.failing_request = request;
  error.group_attributes = std::move(group_attributes);
  return {to, std::make_shared<Notification>(std::move(error))};
}

Group::Group(std::string name, std::uint64_t last_number)
    : name_(std::move(name)),
      member_ids_(std::make_shared<const Membership>()),
      state_value_{std::make_shared<const Bytes>(), nullptr},
      seqnum_(last_number) {}

// ------------------------------------------------------------------------------------------------------ checks

wyx_rc_t Group::check_join(const GroupAttributes& attributes, ProviderId id) const {
  if (attributes_ && attributes != *attributes_) return WYX_BAD_GROUP_ATTRIBUTES;
  // The id of a provider that is gone is free: its failure leave comes before any join that waits.
  return taken_ids_.contains(id) ? WYX_DUPLICATE_INSTANCE_NUMBER : WYX_OK;
}

wyx_rc_t Group::check_leave(const Member& member) const {
  if (member.stage != Member::Stage::kJoined) return WYX_NOT_A_MEMBER;
  return member.leaving ? WYX_COLLIDE : WYX_OK;
}

wyx_rc_t Group::check_proposal(const Member& member) const {
  if (member.stage != Member::Stage::kJoined) return WYX_NOT_A_MEMBER;
  return run_ || unfinished() ? WYX_COLLIDE : WYX_OK;
}

wyx_rc_t Group::check_expel(const Membership& expelled) const {
  Membership listed = expelled;
  std::sort(listed.begin(), listed.end());
  listed.erase(std::unique(listed.begin(), listed.end()), listed.end());
  const auto present = std::count_if(member_ids_->begin(), member_ids_->end(), [&](ProviderId id) {
    return std::binary_search(listed.begin(), listed.end(), id);
  });
  return static_cast<std::size_t>(present) == listed.size() ? WYX_OK : WYX_UNKNOWN_PROVIDER;
}

wyx_rc_t Group::check_new_attributes(const GroupAttributes& attributes) const {
  return attributes.group_name == name_ ? WYX_OK : WYX_BAD_GROUP_ATTRIBUTES;
}

wyx_rc_t Group::check_vote(const Member& member) const {
  return member.ballot.open ? WYX_OK : WYX_VOTE_NOT_EXPECTED;
}

// ---------------------------------------------------------------------------------------------------- requests

void Group::join(MemberPtr joiner, const JoinRequest& request) {
  taken_ids_.insert(joiner->id);
  enqueue(std::move(joiner), request);
}

void Group::leave(const MemberPtr& member, const LeaveRequest& request) {
  member->leaving = true;
  enqueue(member, request);
}

void Group::propose(const Member& proposer, const StateChangeRequest& request, Surroundings& env) {
  Run run = new_run(WYX_STATE_VALUE_CHANGE, request.terms, proposer.id);
  run.proposed_state = env.keep(proposer, request.new_state);
  start(std::move(run), env);
}

void Group::propose(const Member& proposer, const MessageRequest& request, Surroundings& env) {
  Run run = new_run(WYX_PROVIDER_MESSAGE, request.terms, proposer.id);
  run.message = request.terms.num_phases == WYX_1_PHASE ? Surroundings::pass_on(request.message)
                                                        : env.keep(proposer, request.message);
  start(std::move(run), env);
}

void Group::propose(const Member& proposer, const ExpelRequest& request, Surroundings& env) {
  Run run = new_run(WYX_EXPEL, request.terms, proposer.id);
  run.expel_info = ExpelInfo{request.deactivate_phase, request.deactivate_flag};
  run.charge = Ledger::Charge(env.ledger, proposer.payer(), room_for(request));
  Membership listed = request.expelled;
  std::sort(listed.begin(), listed.end());
  for (const MemberPtr& m : members_)
    if (std::binary_search(listed.begin(), listed.end(), m->id)) add_changing(run, m, {run.traits->leave_code, 0});
  start(std::move(run), env);
}

void Group::propose(const Member& proposer, const AttributeChangeRequest& request, Surroundings& env) {
  Run run = new_run(WYX_GROUP_ATTRIBUTE_CHANGE, request.terms, proposer.id);
  run.new_attributes = std::make_shared<const GroupAttributes>(request.attributes);
  start(std::move(run), env);
}

void Group::lose(const MemberPtr& member, std::uint32_t leave_code) {
  member->gone_code = leave_code;
  taken_ids_.erase(member->id);
  if (auto waiting = queue_.find(member->place); waiting != queue_.end()) dequeue(waiting);
  if (member->ballot.open) cast_default(*member, WYX_PROVIDER_FAILED);
  if (member->stage == Member::Stage::kQueued)
    member->stage = Member::Stage::kOut;
  else
    failures_.push_back(member);
}

/// Of a client that changes faster than it can be told, at most two wait: the last one says how it is now.
void Group::announce(Announcement announcement) {
  const auto same_client = [&](const Announcement& a) { return a.about == announcement.about; };
  const auto last = std::find_if(announcements_.rbegin(), announcements_.rend(), same_client);
  if (last == announcements_.rend()) return announcements_.push_back(std::move(announcement));
  if (last->summary == announcement.summary) return;
  if (std::any_of(std::next(last), announcements_.rend(), same_client))
    announcements_.erase(std::next(last).base());
  else
    announcements_.push_back(std::move(announcement));
}

// --------------------------------------------------------------------------------------------------- the queue

void Group::settle(Surroundings& env) {
  while (unfinished() && env.work_left > 0) {
    const std::size_t told = env.deliveries.size();
    const std::size_t looked_at = members_.size() + queue_.size();
    if (!announcements_.empty())
      send_announcement(env);
    else if (run_)
      end_phase(env);
    else
      start_next(env);
    const std::size_t work = work_of_looking_at(looked_at) + work_of(std::span(env.deliveries).subspan(told));
    env.work_left -= std::min(work, env.work_left);
  }
}

void Group::send_announcement(Surroundings& env) {
  Announcement& next = announcements_.front();
  if (env.watch.observer != nullptr) {
    Happening told;
    told.kind = Happening::Kind::kAnnouncement;
    told.group = name_;
    told.session = next.about;
    told.summary = next.summary;
    told.changing = next.ids;
    env.watch.observer->happened(told);
  }
  const auto note =
      std::make_shared<const Notification>(AnnouncementNotification{next.summary, std::move(next.ids)});
  announcements_.pop_front();
  for (const MemberPtr& m : members_)
    if (!m->gone()) env.deliveries.push_back({m->to, note});
}

void Group::start_next(Surroundings& env) {
  if (start_failure_leave(env) || queue_.empty()) return;
  if (std::holds_alternative<LeaveRequest>(queue_.begin()->second.request))
    start_leave(env);
  else
    start_join(env);
}

bool Group::start_failure_leave(Surroundings& env) {
  std::optional<Run> run;
  while (!failures_.empty()) {
    const MemberPtr failed = std::move(failures_.front());
    failures_.pop_front();
    if (failed->stage == Member::Stage::kOut) continue;
    if (!run) run = new_run(WYX_FAILURE_LEAVE, {attributes_->num_phases, attributes_->time_limit}, failed->id);
    add_changing(*run, failed, {failed->gone_code, 0});
    if (!batches(WYX_BATCH_LEAVES)) break;
  }
  if (!run) return false;
  start(std::move(*run), env);
  return true;
}

void Group::enqueue(MemberPtr who, std::variant<JoinRequest, LeaveRequest> request) {
  who->place = ++last_place_;
  queue_.emplace(last_place_, Queued{std::move(who), std::move(request)});
}

/// Takes it out and goes on to the next one.
Group::Queued Group::dequeue(Queue::iterator& entry) {
  Queued queued = std::move(entry->second);
  entry = queue_.erase(entry);
  queued.who->place = 0;
  return queued;
}

/// It is a client no longer; its token and id are free.
void Group::release(const Member& member, Surroundings& env) {
  taken_ids_.erase(member.id);
  env.clients.erase(member.to);
}

// A batch takes the leaves that ask for the same phases and time limit as the first.
void Group::start_leave(Surroundings& env) {
  const Queued& first = queue_.begin()->second;
  const ProtocolTerms terms = std::get<LeaveRequest>(first.request).terms;
  Run run = new_run(WYX_LEAVE, terms, first.who->id);
  for (auto it = queue_.begin(); it != queue_.end();) {
    const auto* leave = std::get_if<LeaveRequest>(&it->second.request);
    if (!leave || leave->terms != terms) {
      ++it;
      continue;
    }
    const LeaveCode code{run.traits->leave_code, leave->leave_code};
    add_changing(run, dequeue(it).who, code);
    if (!batches(WYX_BATCH_LEAVES) || run.changing.size() == kMaxBatch) break;
  }
  start(std::move(run), env);
}

// A join that no longer fits the group, whose attributes have changed or which has been born anew, ends here with
// a delayed error.
void Group::start_join(Surroundings& env) {
  std::optional<Run> run;
  std::size_t taken = 0;
  for (auto it = queue_.begin(); it != queue_.end() && taken < kMaxBatch;) {
    if (!std::holds_alternative<JoinRequest>(it->second.request)) {
      ++it;
      continue;
    }
    const Queued queued = dequeue(it);
    ++taken;
    const JoinRequest& join = std::get<JoinRequest>(queued.request);
    if (members_.empty() && !run) attributes_ = std::make_shared<const GroupAttributes>(join.attributes);
    if (join.attributes != *attributes_) {
      queued.who->stage = Member::Stage::kOut;
      release(*queued.who, env);
      env.deliveries.push_back(delayed_error(queued.who->to, join, WYX_BAD_GROUP_ATTRIBUTES, attributes_));
      continue;
    }
    if (!run) run = new_run(WYX_JOIN, {attributes_->num_phases, attributes_->time_limit}, queued.who->id);
    queued.who->stage = Member::Stage::kJoining;
    add_changing(*run, queued.who, {});
    if (!batches(WYX_BATCH_JOINS)) break;
  }
  if (run) start(std::move(*run), env);
}

Group::Run Group::new_run(wyx_request_t type, const ProtocolTerms& terms, ProviderId proposed_by) const {
  Run run;
  run.traits = &traits_of(type);
  run.terms = terms;
  run.proposed_by = proposed_by;
  return run;
}

void Group::add_changing(Run& run, MemberPtr member, LeaveCode code) const {
  run.changing.push_back(std::move(member));
  if (run.traits->type == WYX_JOIN) return;
  if (!run.leave_codes) run.leave_codes = std::make_shared<std::vector<LeaveCode>>();
  run.leave_codes->push_back(code);
}

// ------------------------------------------------------------------------------------------------------- state

GroupView Group::view() const {
  GroupView view;
  view.seqnum = seqnum_;
  view.state = state_value_.bytes;
  view.members = member_ids_;
  return view;
}

std::uint64_t Group::next_number(const Surroundings& env) {
  seqnum_ = std::max(seqnum_, env.numbers_above) + 1;
  since_ = env.watch.now;
  return seqnum_;
}

void Group::forget_values() {
  attributes_ = nullptr;
  state_value_ = {std::make_shared<const Bytes>(), nullptr};
}

namespace {

void add_member(Digest& digest, const Member& m) {
  digest.add(m.to);
  digest.add(m.id);
  digest.add(m.local_name);
  digest.add(m.stage);
  digest.add(m.leaving);
  digest.add(m.gone_code);
  digest.add(m.ballot.open);
  digest.add(m.ballot.vote);
  digest.add(m.ballot.default_vote);
  digest.add(m.ballot.summary);
  digest.add(m.ballot.proposed_state.bytes);
  digest.add(m.ballot.message.bytes);
}

template <typename List>
void add_members(Digest& digest, const List& members) {
  digest.add(members.size());
  for (const MemberPtr& m : members) add_member(digest, *m);
}

}  // namespace

void Group::add_to(Digest& digest) const {
  digest.add(name_);
  digest.add(attributes_ != nullptr);
  if (attributes_) digest.add(*attributes_);
  add_members(digest, members_);
  digest.add(state_value_.bytes);
  digest.add(seqnum_);
  add_members(digest, failures_);
  digest.add(queue_.size());
  for (const auto& [place, q] : queue_) {
    add_member(digest, *q.who);
    digest.add(q.request.index());
    if (const auto* join = std::get_if<JoinRequest>(&q.request)) {
      digest.add(join->attributes);
    } else {
      digest.add(std::get<LeaveRequest>(q.request).terms);
      digest.add(std::get<LeaveRequest>(q.request).leave_code);
    }
  }
  digest.add(announcements_.size());
  for (const Announcement& a : announcements_) {
    digest.add(Endpoint{a.about, -1});
    digest.add(a.summary);
    for (const ProviderId id : *a.ids) digest.add(id);
  }
  digest.add(run_.has_value());
  if (run_) add_to(digest, *run_);
}

void Group::add_to(Digest& digest, const Run& run) {
  digest.add(run.traits->type);
  digest.add(run.number);
  digest.add(run.terms);
  digest.add(run.phase);
  digest.add(run.proposed_by);
  add_members(digest, run.changing);
  for (std::size_t i = 0; run.leave_codes && i < run.leave_codes->size(); ++i) {
    digest.add((*run.leave_codes)[i].voluntary_or_failure);
    digest.add((*run.leave_codes)[i].voluntary_code);
  }
  digest.add(run.expel_info ? run.expel_info->deactivate_phase : -1);
  digest.add(run.expel_info ? run.expel_info->flag : Bytes());
  digest.add(run.new_attributes != nullptr);
  if (run.new_attributes) digest.add(*run.new_attributes);
  digest.add(run.proposed_state.bytes);
  digest.add(run.message.bytes);
  digest.add(run.voted_message.bytes);
  digest.add(run.voters.size());
  for (const MemberPtr& m : run.voters) digest.add(m->to);
  digest.add(run.missing);
  digest.add(run.collect);
  digest.add(run.collected);
  digest.add(run.defaults);
}

}  // namespace gs
