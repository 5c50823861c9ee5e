// A group out of a snapshot: what its parts say, and whether they agree.
#include "engine/protocols.h"
#include "engine/snapshot_input.h"

namespace gs {

namespace fb = snapshot::fb;

bool GroupReader::read() {
  if (from_.attributes()) {
    GroupAttributes attributes;
    if (!in_.attributes(from_.attributes(), group_.name_, attributes)) return false;
    group_.attributes_ = std::make_shared<const GroupAttributes>(std::move(attributes));
  }
  group_.seqnum_ = from_.seqnum();
  group_.last_place_ = from_.last_place();
  return read_values() && read_providers() && read_members() && (!from_.run() || read_run(*from_.run())) &&
         read_failures() && read_queue() && read_announcements() && check_providers() && enter_clients();
}

// ------------------------------------------------------------------------------------------------------- lists

bool GroupReader::value_at(std::uint32_t reference, Value& into) {
  if (reference == 0) return true;
  if (reference > values_.size()) return in_.fail("a value that is not there");
  into = values_[reference - 1];
  return true;
}

bool GroupReader::provider_at(std::uint32_t index, MemberPtr& into) {
  if (index >= providers_.size()) return in_.fail("a provider that is not there");
  into = providers_[index];
  return true;
}

template <typename List>
bool GroupReader::providers_at(const Indices& indices, List& into) {
  std::vector<bool> seen(providers_.size());
  for (const std::uint32_t index : indices) {
    MemberPtr provider;
    if (!in_.take(sizeof index) || !provider_at(index, provider)) return false;
    if (seen[index]) return in_.fail("a provider that is twice in one list");
    seen[index] = true;
    into.push_back(std::move(provider));
  }
  return true;
}

bool GroupReader::read_values() {
  for (const fb::Value* from : *from_.values()) {
    SharedBytes bytes;
    if (!in_.take_table() || !in_.value(bytes)) return false;
    const Payer payer{value_of(from->session()), from->user()};
    auto charge = std::make_shared<const Ledger::Charge>(state_.ledger, payer, bytes->size());
    values_.push_back({std::move(bytes), std::move(charge)});
  }
  return true;
}

bool GroupReader::read_providers() {
  for (const fb::Provider* from : *from_.providers())
    if (!in_.take_table() || !read_provider(*from)) return false;
  return true;
}

bool GroupReader::read_provider(const fb::Provider& from) {
  auto m = std::make_shared<Member>();
  m->to = {value_of(from.session()), from.token()};
  m->user = from.user();
  m->id = {from.instance(), static_cast<std::int16_t>(m->to.session.node)};
  m->stage = Member::Stage::kOut;  // until it is found in a list
  m->leaving = from.leaving();
  m->gone_code = from.gone_code();
  if (!in_.require((m->gone_code & ~kLeaveCodeBits) == 0, "flags that do not exist") ||
      !in_.name(from.local_name(), kMaxLocalName, m->local_name) ||
      (from.ballot() && !read_ballot(*from.ballot(), m->ballot)))
    return false;
  JoinRequest request;
  request.local_name = m->local_name;
  m->charge = Ledger::Charge(state_.ledger, m->payer(), room_for(request));
  providers_.push_back(std::move(m));
  return true;
}

bool GroupReader::read_ballot(const fb::Ballot& from, Ballot& into) {
  into.open = from.open();
  into.summary = from.summary();
  return in_.take_table() && in_.enumeration(from.vote(), into.vote) &&
         in_.enumeration(from.default_vote(), into.default_vote) &&
         in_.require(into.vote <= WYX_VOTE_REJECT && into.default_vote <= WYX_VOTE_REJECT &&
                         into.default_vote != WYX_VOTE_CONTINUE,
                     "a vote that nobody can cast") &&
         in_.require((into.summary & ~kSummaryBits) == 0, "flags that do not exist") &&
         value_at(from.proposed_state(), into.proposed_state) && value_at(from.message(), into.message);
}

bool GroupReader::read_members() {
  if (from_.members() > providers_.size()) return in_.fail("more members than providers");
  group_.members_.assign(providers_.begin(), providers_.begin() + from_.members());
  Membership ids;
  for (const MemberPtr& m : group_.members_) {
    m->stage = Member::Stage::kJoined;
    ids.push_back(m->id);
  }
  Membership sorted = ids;
  std::sort(sorted.begin(), sorted.end());
  group_.member_ids_ = std::make_shared<const Membership>(std::move(ids));
  const bool runs_or_born = from_.run() || group_.born();
  return in_.require(std::adjacent_find(sorted.begin(), sorted.end()) == sorted.end(), "two members of one id") &&
         in_.require((group_.attributes_ != nullptr) == runs_or_born, "attributes without a group, or none") &&
         in_.require(group_.born() || from_.state() == 0, "a state value without members") &&
         value_at(from_.state(), group_.state_value_);
}

// ---------------------------------------------------------------------------------------- the running protocol

bool GroupReader::read_run(const fb::Run& from) {
  wyx_request_t type{};
  if (!in_.take_table() || !in_.enumeration(from.protocol(), type)) return false;
  if (!is_protocol(type)) return in_.fail("a running protocol that is none");
  Group::Run run = group_.new_run(type, {WYX_N_PHASE, from.time_limit()}, value_of(from.proposed_by()));
  run.number = from.number();
  run.phase = from.phase();
  run.defaults = from.defaults();
  run.collect = group_.attributes_->batch_control & WYX_COLLECT_ALL_RESULT;
  const std::uint16_t longest = state_.limits.max_phase_time;
  if (!in_.require(run.number > 0 && run.number <= state_.last_protocol, "a protocol not yet numbered") ||
      !in_.require(run.phase > 0, "a protocol in no phase") ||
      !in_.require((run.defaults & ~kSummaryBits) == 0, "flags that do not exist") ||
      !in_.require(longest == 0 || (run.terms.time_limit > 0 && run.terms.time_limit <= longest),
                   "a phase longer than the limit") ||
      !read_changing(from, run) || !read_proposal(from, run) || !read_voters(from, run))
    return false;
  group_.run_ = std::move(run);
  return true;
}

bool GroupReader::read_changing(const fb::Run& from, Group::Run& run) {
  std::vector<MemberPtr> changing;
  const bool leave = run.traits->type == WYX_LEAVE;
  if (!providers_at(*from.changing(), changing) || !in_.take(from.leave_codes()->size() * sizeof(std::uint32_t)) ||
      !in_.require(from.leave_codes()->size() == (leave ? changing.size() : 0), "leave codes that match nobody"))
    return false;
  Membership ids;
  for (const MemberPtr& m : changing) {
    const std::uint32_t flags = run.traits->leave_code != 0 ? run.traits->leave_code : m->gone_code;
    const auto index = static_cast<flatbuffers::uoffset_t>(ids.size());
    ids.push_back(m->id);
    group_.add_changing(run, m, {flags, leave ? from.leave_codes()->Get(index) : 0});
  }
  if (!ids.empty()) run.changing_ids = std::make_shared<const Membership>(std::move(ids));
  return check_changing(run);
}

bool GroupReader::check_changing(const Group::Run& run) {
  const bool changes = run.traits->changing_role != ChangingRole::kNone;
  const bool joins = run.traits->changing_role == ChangingRole::kVote;
  const bool batch = run.traits->type == WYX_JOIN || run.traits->type == WYX_LEAVE;
  if (!in_.require(changes != run.changing.empty(), "a protocol that changes nobody, or should not") ||
      !in_.require(joins || group_.born(), "a protocol without members") ||
      !in_.require(!batch || run.changing.size() <= kMaxBatch, "a batch over the limit"))
    return false;
  for (const MemberPtr& m : run.changing) {
    const bool is_member = m->stage == Member::Stage::kJoined;
    if (!in_.require(is_member != joins, joins ? "a member that joins" : "a leave of one who is no member") ||
        !in_.require(run.traits->type != WYX_FAILURE_LEAVE || m->gone(), "a failure leave of one who lives") ||
        !in_.require(run.traits->type != WYX_LEAVE || m->leaving, "a leave that nobody has asked for"))
      return false;
    m->changing = true;
    if (joins) m->stage = Member::Stage::kJoining;
  }
  return true;
}

bool GroupReader::read_proposal(const fb::Run& from, Group::Run& run) {
  const wyx_request_t type = run.traits->type;
  if (!in_.require((type == WYX_EXPEL) == (from.expel() != nullptr),
                   "an expel without its terms, or terms alone") ||
      !in_.require((type == WYX_GROUP_ATTRIBUTE_CHANGE) == (from.new_attributes() != nullptr),
                   "new attributes without their protocol, or a protocol without them") ||
      !in_.require(type != WYX_PROVIDER_MESSAGE || from.message() != 0, "a message protocol without a message") ||
      !in_.require(type != WYX_STATE_VALUE_CHANGE || from.proposed_state() != 0, "a state change without a value"))
    return false;
  if (from.expel() && !read_expel(*from.expel(), run)) return false;
  if (from.new_attributes()) {
    GroupAttributes attributes;
    if (!in_.attributes(from.new_attributes(), group_.name_, attributes)) return false;
    run.new_attributes = std::make_shared<const GroupAttributes>(std::move(attributes));
  }
  return value_at(from.proposed_state(), run.proposed_state) && value_at(from.message(), run.message) &&
         value_at(from.voted_message(), run.voted_message);
}

bool GroupReader::read_expel(const fb::Expel& from, Group::Run& run) {
  ExpelRequest request;
  request.terms = run.terms;
  request.expelled = *run.changing_ids;
  request.deactivate_phase = from.deactivate_phase();
  if (!in_.take_table() || !in_.bytes(from.flag(), kMaxExpelFlag, request.deactivate_flag) ||
      !in_.require(check_values(request) == WYX_OK, "an expel that nobody can ask for"))
    return false;
  run.expel_info = ExpelInfo{request.deactivate_phase, request.deactivate_flag};
  run.charge = Ledger::Charge(state_.ledger, {value_of(from.session()), from.user()}, room_for(request));
  return true;
}

bool GroupReader::read_voters(const fb::Run& from, Group::Run& run) {
  if (!providers_at(*from.voters(), run.voters)) return false;
  std::vector<const Member*> voters;
  for (const MemberPtr& m : run.voters) {
    if (!check_voter(*m)) return false;
    voters.push_back(m.get());
    run.missing += m->ballot.open;
    for (const Value* kept : {&m->ballot.proposed_state, &m->ballot.message})
      if (*kept) run.collected += kept->bytes->size();
  }
  std::sort(voters.begin(), voters.end());
  for (const MemberPtr& m : providers_) {
    const bool votes = std::binary_search(voters.begin(), voters.end(), m.get());
    const bool has_voted_before = m->stage != Member::Stage::kOut && m->gone() && !m->ballot.open;
    if (!in_.require(votes || m->ballot.unused() || has_voted_before, "a ballot of one who has no vote"))
      return false;
  }
  return in_.require(run.collected <= kMaxCollected, "more collected values than the limit");
}

bool GroupReader::check_voter(const Member& voter) {
  const bool joining = voter.stage == Member::Stage::kJoining;
  const bool may_vote = joining || (voter.stage == Member::Stage::kJoined && !voter.changing);
  const Ballot& ballot = voter.ballot;
  const bool blank =
      ballot.vote == WYX_NULL_VOTE && ballot.summary == 0 && !ballot.proposed_state && !ballot.message;
  return in_.require(may_vote, "a voter who has no vote") &&
         in_.require(!ballot.open || (blank && !voter.gone()), "a vote that is awaited and has been cast") &&
         in_.require(ballot.open || ballot.vote != WYX_NULL_VOTE, "a voter who was not asked");
}

// --------------------------------------------------------------------------------------------------- the queue

bool GroupReader::read_failures() { return providers_at(*from_.failures(), group_.failures_); }

bool GroupReader::read_queue() {
  for (const fb::Queued* from : *from_.queue())
    if (!in_.take_table() || !read_queued(*from)) return false;
  return in_.require(group_.queue_.empty() || group_.queue_.rbegin()->first <= group_.last_place_,
                     "a place in the queue not yet given");
}

bool GroupReader::read_queued(const fb::Queued& from) {
  MemberPtr who;
  const auto& queue = group_.queue_;
  if (!provider_at(from.provider(), who) || !in_.require(who->place == 0, "a provider that waits twice") ||
      !in_.require(from.place() > (queue.empty() ? 0 : queue.rbegin()->first), "a queue out of order") ||
      !in_.require(!who->gone(), "a request of one who is gone") ||
      !in_.require((from.join() != nullptr) != (from.leave() != nullptr), "a wait for nothing, or for two things"))
    return false;
  who->place = from.place();
  if (from.join()) {
    JoinRequest join{who->to.token, {}, who->id.instance, who->local_name};
    if (!in_.require(who->stage == Member::Stage::kOut, "a member that waits to join") ||
        !in_.attributes(from.join(), group_.name_, join.attributes))
      return false;
    who->stage = Member::Stage::kQueued;
    group_.queue_.emplace(from.place(), Group::Queued{std::move(who), std::move(join)});
    return true;
  }
  LeaveRequest leave{who->to.token, {WYX_1_PHASE, from.leave()->time_limit()}, from.leave()->leave_code()};
  if (!in_.take_table() || !in_.enumeration(from.leave()->num_phases(), leave.terms.num_phases) ||
      !in_.require(check_values(leave) == WYX_OK, "a leave that nobody can ask for") ||
      !in_.require(who->stage == Member::Stage::kJoined && who->leaving, "a leave of one who is no member"))
    return false;
  group_.queue_.emplace(from.place(), Group::Queued{std::move(who), leave});
  return true;
}

bool GroupReader::read_announcements() {
  Membership present = *group_.member_ids_;
  std::sort(present.begin(), present.end());
  for (const fb::Announcement* from : *from_.announcements()) {
    const std::uint32_t summary = from->summary();
    if (!in_.take_table() || !in_.take(from->providers()->size() * sizeof(fb::ProviderId)) ||
        !in_.require(summary == WYX_RESPONSIVENESS_RESPONSE || summary == WYX_RESPONSIVENESS_NO_RESPONSE,
                     "an announcement of nothing"))
      return false;
    Membership ids;
    for (const fb::ProviderId* id : *from->providers()) {
      ids.push_back(value_of(id));
      if (!std::binary_search(present.begin(), present.end(), ids.back()))
        return in_.fail("an announcement about one who is no member");
    }
    group_.announcements_.push_back(
        {value_of(from->about()), summary, std::make_shared<const Membership>(std::move(ids))});
  }
  return true;
}

// -------------------------------------------------------------------------------------------- whether all agree

bool GroupReader::check_providers() {
  std::vector<const Member*> failed;
  for (const MemberPtr& m : group_.failures_) failed.push_back(m.get());
  std::sort(failed.begin(), failed.end());
  for (const MemberPtr& m : providers_)
    if (!check_provider(*m, std::binary_search(failed.begin(), failed.end(), m.get()))) return false;
  return true;
}

bool GroupReader::check_provider(const Member& m, bool has_failed) {
  const wyx_request_t runs = group_.run_ ? group_.run_->traits->type : WYX_INTERNAL_REQUEST;
  const bool fails = has_failed || (m.changing && runs == WYX_FAILURE_LEAVE);
  const bool leaves = m.gone() || m.place != 0 || (m.changing && runs == WYX_LEAVE);
  return in_.require(m.gone() == fails, "a failure without a leave, or a leave without a failure") &&
         in_.require(m.stage != Member::Stage::kOut || has_failed, "a provider that is nowhere in it") &&
         in_.require(!m.leaving || leaves, "a leave that has been asked for and never comes") &&
         in_.require(group_.run_ || m.ballot.unused(), "a ballot without a protocol");
}

/// Clients are the providers that are heard and have not been told of their end.
bool GroupReader::enter_clients() {
  for (const MemberPtr& m : providers_) {
    if (m->gone()) continue;
    if (!in_.require(group_.taken_ids_.insert(m->id).second, "two providers of one id") ||
        !enter_client(in_, state_, m->to, {group_.name_, m}))
      return false;
  }
  return true;
}

}  // namespace gs
