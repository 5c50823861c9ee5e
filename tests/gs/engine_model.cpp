#include "gs/engine_model.h"

#include <algorithm>
#include <utility>

#include "gs/engine_text.h"

namespace gs::test {
namespace {

bool contains(const SharedMembership& ids, ProviderId id) {
  return ids && std::find(ids->begin(), ids->end(), id) != ids->end();
}

std::optional<wyx_request_t> protocol_of(const Request& request) {
  if (std::holds_alternative<JoinRequest>(request)) return WYX_JOIN;
  if (std::holds_alternative<StateChangeRequest>(request)) return WYX_STATE_VALUE_CHANGE;
  if (std::holds_alternative<MessageRequest>(request)) return WYX_PROVIDER_MESSAGE;
  if (std::holds_alternative<LeaveRequest>(request)) return WYX_LEAVE;
  if (std::holds_alternative<ExpelRequest>(request)) return WYX_EXPEL;
  if (std::holds_alternative<AttributeChangeRequest>(request)) return WYX_GROUP_ATTRIBUTE_CHANGE;
  return std::nullopt;
}

bool takes_out(wyx_request_t protocol) {
  return protocol == WYX_LEAVE || protocol == WYX_FAILURE_LEAVE || protocol == WYX_EXPEL;
}

}  // namespace

void Model::error(const Endpoint& to, const std::string& what) { errors_ += name_of(to) + " " + what + "\n"; }

void Model::follow(const Event& event, const Outcome& outcome, const Engine& engine) {
  event_.clear();
  refused_.reset();
  timer_ = false;
  std::visit([&](const auto& e) { before(e, outcome); }, event);
  for (const Delivery& d : outcome.deliveries) receive(d);
  follow_timers(outcome);
  if (refused_) error(refused_to_, "never got the delayed error of a request answered WYX_OK");
  check_groups(engine);
}

// --------------------------------------------------------------------------------------------- what clients do

void Model::before(const RequestEvent& event, const Outcome& outcome) {
  const Token token = std::visit([](const auto& r) { return r.token; }, event.request);
  const Endpoint from{event.session, token};
  auto view = providers_.find(from);
  if (std::holds_alternative<VoteRequest>(event.request) && view != providers_.end()) {
    const bool expected = outcome.rc != WYX_VOTE_NOT_EXPECTED;
    if (view->second.asked != expected) error(from, "has a vote judged against what it was asked");
  }
  if (outcome.rc == WYX_OK) return accept(event.session, event.request);
  if (!event.answered) {
    if (!outcome.deliveries.empty()) error(from, "is refused at once, yet something is sent");
    return;
  }
  if (gone_hosts_.contains(event.session.node)) return;
  refused_to_ = from;
  refused_.emplace();
  refused_->rc = outcome.rc;
  refused_->failing_request = event.request;
}

void Model::accept(const SessionId& session, const Request& request) {
  const Token token = std::visit([](const auto& r) { return r.token; }, request);
  const Endpoint from{session, token};
  if (const auto* join = std::get_if<JoinRequest>(&request)) {
    if (providers_.contains(from) || subscribers_.contains(from)) error(from, "joins with a token that is in use");
    ProviderView view;
    view.group = join->attributes.group_name;
    view.id = {join->instance, static_cast<std::int16_t>(session.node)};
    providers_[from] = std::move(view);
  }
  if (const auto* subscribe = std::get_if<SubscribeRequest>(&request))
    subscribers_[from] = {subscribe->group_name, subscribe->control, false, {}, {}};
  if (std::holds_alternative<UnsubscribeRequest>(request)) subscribers_.erase(from);
  if (std::holds_alternative<GoodbyeRequest>(request)) providers_.erase(from);
  if (const auto* vote = std::get_if<VoteRequest>(&request)) accept_vote(from, *vote);
  if (auto protocol = protocol_of(request)) {
    auto it = providers_.find(from);
    if (it == providers_.end()) return error(from, "is answered WYX_OK without being a provider");
    ++it->second.pending[*protocol];
  }
}

void Model::accept_vote(const Endpoint& voter, const VoteRequest& request) {
  auto it = providers_.find(voter);
  if (it == providers_.end()) return error(voter, "votes without being a provider");
  it->second.asked = false;
  Phase& phase = phases_[it->second.group];
  phase.reject |= request.vote == WYX_VOTE_REJECT;
  phase.go_on |= request.vote == WYX_VOTE_CONTINUE;
}

void Model::lose(const SessionId& session) {
  gone_.insert(session);
  std::erase_if(providers_, [&](const auto& p) { return p.first.session == session; });
  std::erase_if(subscribers_, [&](const auto& s) { return s.first.session == session; });
}

void Model::before(const SessionGoneEvent& event, const Outcome&) { lose(event.session); }

void Model::before(const HostGoneEvent& event, const Outcome&) {
  gone_hosts_.insert(event.node);
  std::set<SessionId> sessions;
  for (const auto& [endpoint, view] : providers_) sessions.insert(endpoint.session);
  for (const auto& [endpoint, view] : subscribers_) sessions.insert(endpoint.session);
  for (const SessionId& session : sessions)
    if (session.node == event.node) lose(session);
}

void Model::before(const TimerExpiredEvent& event, const Outcome& outcome) {
  auto timer = timers_.find(event.timer.group);
  timer_ = timer != timers_.end() && timer->second == event.timer;
  if (timer_ == outcome.deliveries.empty())
    errors_ +=
        event.timer.group + (timer_ ? ": the end of its time is ignored\n" : ": obeys a timer that is over\n");
}

void Model::follow_timers(const Outcome& outcome) {
  for (const TimerRequest& timer : outcome.timers) timers_[timer.id.group] = timer.id;
  for (const auto& [group, note] : event_) {
    if (note->type != WYX_N_PHASE_NOTIFICATION) continue;
    std::uint16_t seconds = 0;
    for (const TimerRequest& timer : outcome.timers)
      if (timer.id.group == group) seconds = timer.seconds;
    if (note->time_limit != seconds) errors_ += group + ": the phase has another time limit than its timer\n";
  }
}

// ------------------------------------------------------------------------------------------- what clients hear

void Model::receive(const Delivery& delivery) {
  if (gone_.contains(delivery.to.session)) error(delivery.to, "is gone and is sent " + text(*delivery.what));
  std::visit([&](const auto& n) { receive(delivery.to, n); }, *delivery.what);
}

void Model::receive(const Endpoint& to, const ProtocolNotification& n) {
  auto it = providers_.find(to);
  if (it == providers_.end()) return error(to, "is no provider and is sent " + text(Notification(n)));
  ProviderView& view = it->second;
  parts_match_bits(to, n);
  number(to, view, n);
  same_for_all(view.group, n);
  if (n.type != WYX_N_PHASE_NOTIFICATION) return close(to, view, n);

  if (view.asked && view.asked_protocol == n.protocol && view.asked_phase >= n.proposal.phase)
    error(to, "is asked twice in one phase");
  if (takes_out(n.protocol) && contains(n.proposal.changing_providers, view.id)) error(to, "votes on its own end");
  view.asked = true;
  view.asked_protocol = n.protocol;
  view.asked_phase = n.proposal.phase;
}

/// A member misses only the phases of a leave or expel that is about itself.
void Model::number(const Endpoint& to, ProviderView& view, const ProtocolNotification& n) {
  std::uint64_t& last = seqnum_[view.group];
  auto joined = [&](const auto& p) {
    return p.second.group == view.group && p.second.state == ProviderView::State::kJoined;
  };
  const bool born_again = n.seqnum == 1 && (last > 1 || !event_.contains(view.group));
  if (born_again) phases_.erase(view.group);
  if (born_again && std::any_of(providers_.begin(), providers_.end(), joined))
    error(to, "sees the numbers start again in a group with members");
  if (n.seqnum != last && n.seqnum != last + 1 && !born_again)
    error(to, "sees event " + std::to_string(n.seqnum) + " after the group's " + std::to_string(last));
  last = n.seqnum;

  const std::uint64_t step = n.seqnum - view.seqnum;
  const bool unasked = takes_out(n.protocol) && contains(n.proposal.changing_providers, view.id);
  const bool ok = view.seqnum == 0 || step == 1 || (unasked && step == 1u + n.proposal.phase);
  if (!ok) error(to, "sees a gap before event " + std::to_string(n.seqnum));
  view.seqnum = n.seqnum;
}

/// One event is the same for all; only the proposer may differ, for those who read their own id there.
void Model::same_for_all(const std::string& group, const ProtocolNotification& n) {
  const ProtocolNotification* last = std::exchange(event_[group], &n);
  if (last && last->seqnum == n.seqnum) {
    const bool same =
        last->type == n.type && last->protocol == n.protocol && last->summary == n.summary &&
        last->proposal.phase == n.proposal.phase && last->proposal.whats_changed == n.proposal.whats_changed &&
        last->proposal.current_providers == n.proposal.current_providers &&
        last->proposal.changing_providers == n.proposal.changing_providers &&
        last->proposal.current_state == n.proposal.current_state &&
        last->proposal.proposed_state == n.proposal.proposed_state && last->proposal.message == n.proposal.message;
    if (!same) errors_ += group + ": event " + std::to_string(n.seqnum) + " is not the same for all\n";
    return;
  }
  phase_over(group, n);
}

bool Model::anybody_to_ask(const std::string& group, const ProtocolNotification& n) const {
  return std::any_of(providers_.begin(), providers_.end(), [&](const auto& p) {
    const ProviderView& view = p.second;
    const bool changes = contains(n.proposal.changing_providers, view.id);
    if (view.group != group) return false;
    if (n.protocol == WYX_JOIN && changes) return true;
    return view.state == ProviderView::State::kJoined && !(changes && takes_out(n.protocol));
  });
}

/// An outcome must be one that the votes allow, and no phase ends while a vote is missing unless time is over.
void Model::phase_over(const std::string& group, const ProtocolNotification& n) {
  Phase& phase = phases_[group];
  if (phase.open) {
    const std::string event = group + ": event " + std::to_string(n.seqnum);
    const bool preventable = n.protocol != WYX_LEAVE && n.protocol != WYX_FAILURE_LEAVE;
    const bool by_default = n.summary & WYX_DEFAULT_REJECT;
    if (n.type == WYX_APPROVED_NOTIFICATION) {
      if (preventable && phase.reject) errors_ += event + " approves what was rejected\n";
      if (phase.go_on && !phase.reject && !by_default && anybody_to_ask(group, n))
        errors_ += event + " approves where a voter said continue\n";
    }
    if (n.type == WYX_REJECTED_NOTIFICATION && !phase.reject && !by_default)
      errors_ += event + " rejects what nobody rejected\n";
    if (n.type == WYX_N_PHASE_NOTIFICATION && (phase.reject || !phase.go_on))
      errors_ += event + " goes on where the votes do not\n";
    for (auto& [endpoint, view] : providers_) {
      if (view.group == group && view.asked && !timer_) error(endpoint, "was not waited for");
      if (view.group == group) view.asked = false;
    }
  }
  timers_.erase(group);
  phase = {};
  phase.open = n.type == WYX_N_PHASE_NOTIFICATION;
}

void Model::close(const Endpoint& to, ProviderView& view, const ProtocolNotification& n) {
  const Proposal& p = n.proposal;
  const bool approved = n.type == WYX_APPROVED_NOTIFICATION;
  view.asked = false;
  const bool mine = p.proposed_by == view.id;
  const bool my_join = n.protocol == WYX_JOIN && view.state == ProviderView::State::kJoining;
  if (my_join && !mine) error(to, "does not read its own id in its join's end");
  if (view.state == ProviderView::State::kJoining && !my_join) error(to, "is told of a protocol before its join");
  if (approved) new_members(to, view, p);
  view.value = *p.current_state;
  if (mine && n.protocol != WYX_FAILURE_LEAVE && --view.pending[n.protocol] < 0)
    error(to, "is told the end of a protocol that it did not ask for");
  if (my_join && approved) view.state = ProviderView::State::kJoined;
  const bool over = (my_join && !approved) || (n.protocol == WYX_LEAVE && mine);
  if (over) providers_.erase(to);
}

void Model::new_members(const Endpoint& to, ProviderView& view, const Proposal& p) {
  if (!(p.whats_changed & WYX_UPDATED_MEMBERSHIP)) {
    if (view.members != *p.current_providers) error(to, "sees members change without being told");
    return;
  }
  const bool joins = p.leave_codes.empty();
  if (!joins && p.leave_codes.size() != p.changing_providers->size()) error(to, "misses leave codes");
  if (view.state == ProviderView::State::kJoined) {
    Membership expected = view.members;
    if (joins) expected.insert(expected.end(), p.changing_providers->begin(), p.changing_providers->end());
    if (!joins) std::erase_if(expected, [&](ProviderId id) { return contains(p.changing_providers, id); });
    if (expected != *p.current_providers) error(to, "sees a membership that is not its last one and the change");
  }
  view.members = *p.current_providers;
}

void Model::parts_match_bits(const Endpoint& to, const ProtocolNotification& n) {
  constexpr std::uint32_t kMembers =
      WYX_PROPOSED_MEMBERSHIP | WYX_ONGOING_MEMBERSHIP | WYX_UPDATED_MEMBERSHIP | WYX_REJECTED_MEMBERSHIP;
  constexpr std::uint32_t kAttributes = WYX_PROPOSED_GROUP_ATTRIBUTES | WYX_ONGOING_GROUP_ATTRIBUTES |
                                        WYX_UPDATED_GROUP_ATTRIBUTES | WYX_REJECTED_GROUP_ATTRIBUTES;
  const Proposal& p = n.proposal;
  const std::uint32_t bits = p.whats_changed;
  const bool matches =
      p.current_providers && p.current_state && (bits & WYX_CURRENT_STATE_VALUE) &&
      ((bits & kMembers) != 0) == (p.changing_providers != nullptr) &&
      ((bits & (WYX_PROPOSED_STATE_VALUE | WYX_ONGOING_STATE_VALUE)) != 0) == (p.proposed_state != nullptr) &&
      ((bits & WYX_UPDATED_PROVIDER_MESSAGE) != 0) == (p.message != nullptr) &&
      ((bits & kAttributes) != 0) == (p.new_attributes != nullptr) &&
      ((bits & WYX_EXPEL_INFORMATION) != 0) == p.expel_info.has_value();
  if (!matches) error(to, "gets parts that its bits do not name: " + text(Notification(n)));
}

void Model::receive(const Endpoint& to, const AnnouncementNotification& n) {
  auto it = providers_.find(to);
  if (it == providers_.end()) return error(to, "is no provider and is sent " + text(Notification(n)));
  if (n.summary != WYX_GROUP_DISSOLVED) return;
  for (const auto& [protocol, count] : it->second.pending)
    if (count != 0) error(to, "is expelled with a request that never ended");
  providers_.erase(it);
}

void Model::receive(const Endpoint& to, const DelayedErrorNotification& n) {
  if (refused_ && to == refused_to_ && n.rc == refused_->rc && n.failing_request == refused_->failing_request) {
    refused_.reset();
    return;
  }
  auto it = providers_.find(to);
  if (it == providers_.end() || --it->second.pending[n.protocol] < 0)
    return error(to, "gets the error of a request it did not make: " + text(Notification(n)));
  if (n.protocol == WYX_JOIN) providers_.erase(it);
}

void Model::receive(const Endpoint& to, const SubscriptionNotification& n) {
  auto it = subscribers_.find(to);
  if (it == subscribers_.end()) return error(to, "is no subscriber and is sent " + text(Notification(n)));
  SubscriberView& view = it->second;
  const std::uint32_t end = WYX_SUBSCRIPTION_DISSOLVED | WYX_SUBSCRIPTION_PERSISTENT;
  if (n.type & ~(view.control | end)) error(to, "gets what it did not ask for: " + text(Notification(n)));
  if (n.type & WYX_SUBSCRIPTION_DISSOLVED) {
    subscribers_.erase(it);
    return;
  }
  view.subscribed = !(n.type & WYX_SUBSCRIPTION_PERSISTENT);
  if (n.type & WYX_SUBSCRIPTION_STATE) view.value = *n.state;
  if (n.type & WYX_SUBSCRIPTION_MEMBERSHIP) {
    view.members = {n.full_membership->begin(), n.full_membership->end()};
  } else if (n.type & WYX_SUBSCRIPTION_DELTA_JOIN) {
    view.members.insert(n.changing_membership->begin(), n.changing_membership->end());
  } else if (n.type & WYX_SUBSCRIPTION_DELTA_LEAVE) {
    for (ProviderId id : *n.changing_membership) view.members.erase(id);
  }
  if ((n.type & WYX_SUBSCRIPTION_DELTA_LEAVE) && n.leave_codes.size() != n.changing_membership->size())
    error(to, "misses leave codes");
}

// ----------------------------------------------------------------------------------------------- after each step

void Model::check_groups(const Engine& engine) {
  std::map<std::string, Membership> groups;
  for (const Engine::GroupStatus& status : engine.status()) {
    check_group(status);
    groups[status.name] = status.members;
  }
  for (const auto& [endpoint, view] : providers_)
    if (!groups.contains(view.group)) error(endpoint, "is left in a group that is no more");
  std::erase_if(seqnum_, [&](const auto& s) { return !groups.contains(s.first); });
  std::erase_if(timers_, [&](const auto& t) { return !groups.contains(t.first); });
  for (const auto& [group, timer] : timers_)
    if (!engine.awaits(timer)) errors_ += group + ": does not await the timer of its phase\n";
  std::erase_if(phases_, [&](const auto& p) { return !groups.contains(p.first); });
  check_subscribers(groups);
}

/// All that have joined believe the same. While a protocol runs it waits for somebody; at rest nothing is owed and
/// only the living are members.
void Model::check_group(const Engine::GroupStatus& status) {
  const ProviderView* first = nullptr;
  bool waits = false;
  std::set<ProviderId> alive;
  const bool at_rest = status.running_protocol.empty();
  for (const auto& [endpoint, view] : providers_) {
    if (view.group != status.name) continue;
    waits |= view.asked;
    if (at_rest && std::any_of(view.pending.begin(), view.pending.end(), [](const auto& p) { return p.second; }))
      error(endpoint, "has a request that was answered WYX_OK and never ended");
    if (view.state != ProviderView::State::kJoined) continue;
    alive.insert(view.id);
    if (!first) first = &view;
    if (view.members != status.members) error(endpoint, "has another membership than the group");
    if (view.value != first->value || view.value.size() != status.state_length)
      error(endpoint, "has another state value than the group");
    if (at_rest && view.seqnum != status.seqnum) error(endpoint, "has not seen the group's last event");
  }
  if (!at_rest && !waits) errors_ += status.name + ": runs a protocol and waits for nobody\n";
  if (at_rest && std::set<ProviderId>(status.members.begin(), status.members.end()) != alive)
    errors_ += status.name + ": is at rest with members that are not alive\n";
}

void Model::check_subscribers(const std::map<std::string, Membership>& groups) {
  for (const auto& [endpoint, view] : subscribers_) {
    auto group = groups.find(view.group);
    const bool born = group != groups.end() && !group->second.empty();
    if (view.subscribed != born) error(endpoint, born ? "was not told of its group" : "was not told of its end");
    const bool knows_members = (view.control & WYX_SUBSCRIBE_MEMBERSHIP) ||
                               (view.control & WYX_SUBSCRIBE_DELTAS_ONLY) == WYX_SUBSCRIBE_DELTAS_ONLY;
    if (!born || !knows_members) continue;
    if (view.members != std::set<ProviderId>(group->second.begin(), group->second.end()))
      error(endpoint, "has another membership than its group");
    for (const auto& [member, provider] : providers_)
      if (provider.group == view.group && provider.state == ProviderView::State::kJoined &&
          (view.control & WYX_SUBSCRIBE_STATE) && provider.value != view.value)
        error(endpoint, "has another state value than its group");
  }
}

}  // namespace gs::test
