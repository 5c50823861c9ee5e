// What the clients of an engine believe, kept as a client library would keep it, what must come of their votes,
// and the promises that must hold between them. Fed with every event and its outcome; every broken promise is an
// error text.
#pragma once

#include <map>
#include <set>

#include "engine/engine.h"
#include "engine/protocols.h"
#include "gs/engine_text.h"
#include "gs/same.h"

namespace gs::test {

/// A provider as its own process sees it.
struct ProviderView {
  std::string group;
  ProviderId id;
  GroupAttributes attributes;  // that it joined with
  LeaveRequest leave;          // that it asked for
  bool joined = false;
  bool asked = false;                             // a phase waits for its vote
  wyx_vote_value_t default_vote = WYX_NULL_VOTE;  // that it gave in the running protocol
  std::uint64_t seqnum = 0;                       // of the last event it saw; 0: none
  std::map<wyx_request_t, int> pending;           // answered WYX_OK and not ended
  std::map<ProviderId, std::uint32_t> unheard;    // announcements' summaries, by whom they are about
};

struct SubscriberView {
  std::string group;
  std::uint32_t control = 0;
  bool subscribed = false;
  std::set<ProviderId> members;
  Bytes value;
};

/// A group as its members have been told of it. They all believe the same: an event is the same for all, and
/// nobody misses one.
struct GroupModel {
  std::uint64_t seqnum = 0;
  Membership members;
  Bytes value;
  GroupAttributes attributes;
  std::map<ProviderId, std::uint32_t> lost;     // and not yet taken out: with which leave code
  const ProtocolNotification* event = nullptr;  // the last of this step
  // The phase that is being voted on, and what its votes have come to.
  bool open = false;
  bool unfinished = false;  // work is left for a ContinueEvent
  bool heard = false;       // there are members who are alive
  wyx_request_t protocol = WYX_JOIN;
  std::vector<LeaveCode> leave_codes;
  bool any_continue = false;
  std::uint32_t rejects = 0;   // summary flags of this phase's rejects
  std::uint32_t defaults = 0;  // of the default votes of all phases
  SharedBytes proposed, message, voted_message;
  std::optional<TimerId> timer;
};

class Model {
 public:
  /// `engine` is the one that gave the outcome, after it.
  void follow(const Event& event, const Outcome& outcome, const Engine& engine) {
    for (auto& [name, group] : groups_) group.event = nullptr;
    refused_.reset();
    std::visit([&](const auto& e) { before(e, outcome); }, event);
    for (const Delivery& d : outcome.deliveries) {
      if (gone_.contains(d.to.session)) error(d.to, "is gone and is sent " + text(*d.what));
      std::visit([&](const auto& n) { receive(d.to, n); }, *d.what);
    }
    follow_domain(outcome.domain, engine);
    follow_timers(outcome);
    if (refused_) error(refused_to_, "never got the delayed error of a request answered WYX_OK");
    check_groups(engine);
    busy_ = engine.busy();
  }

  /// Empty: no promise has been broken so far.
  const std::string& errors() const { return errors_; }
  const std::map<Endpoint, ProviderView>& providers() const { return providers_; }
  const std::map<std::string, GroupModel>& groups() const { return groups_; }

 private:
  using Providers = std::map<Endpoint, ProviderView>;

  void error(const Endpoint& to, const std::string& what) { errors_ += name_of(to) + " " + what + "\n"; }

  static bool contains(const SharedMembership& ids, ProviderId id) {
    return ids && std::find(ids->begin(), ids->end(), id) != ids->end();
  }
  static ChangingRole role_of(wyx_request_t protocol) { return traits_of(protocol).changing_role; }

  // ------------------------------------------------------------------------------------------- what clients do

  void before(const RequestEvent& event, const Outcome& outcome) {
    const Token token = std::visit([](const auto& r) { return r.token; }, event.request);
    const Endpoint from{event.session, token};
    auto view = providers_.find(from);
    if (std::holds_alternative<VoteRequest>(event.request) && view != providers_.end() &&
        view->second.asked != (outcome.rc != WYX_VOTE_NOT_EXPECTED))
      error(from, "has a vote judged against what it was asked");
    if (outcome.rc == WYX_OK) {
      std::visit([&](const auto& r) { accept(from, r); }, event.request);
      return expect_end(from, protocol_of(event.request));
    }
    if (!event.answered && !outcome.deliveries.empty()) error(from, "is refused at once, yet something is sent");
    if (!event.answered || gone_hosts_.contains(event.session.node)) return;
    refused_to_ = from;
    refused_.emplace(DelayedErrorNotification{WYX_JOIN, outcome.rc, event.request, nullptr});
  }

  void accept(const Endpoint& from, const JoinRequest& r) {
    if (providers_.contains(from) || subscribers_.contains(from)) error(from, "joins with a token that is in use");
    const ProviderId id{r.instance, static_cast<std::int16_t>(from.session.node)};
    providers_[from] = {r.attributes.group_name, id, r.attributes, {}, false, false, WYX_NULL_VOTE, 0, {}, {}};
  }
  template <typename Proposal>
  void accept(const Endpoint&, const Proposal&) {}
  void accept(const Endpoint& from, const LeaveRequest& r) { providers_[from].leave = r; }
  void accept(const Endpoint& from, const SubscribeRequest& r) {
    subscribers_[from] = {r.group_name, r.control, false, {}, {}};
  }
  void accept(const Endpoint& from, const UnsubscribeRequest&) { subscribers_.erase(from); }
  void accept(const Endpoint& from, const GoodbyeRequest&) {
    lose(providers_.find(from), WYX_PROVIDER_SAID_GOODBYE);
  }
  void accept(const Endpoint& from, const VoteRequest& r) {
    auto it = providers_.find(from);
    if (it == providers_.end()) return error(from, "votes without being a provider");
    GroupModel& group = groups_[it->second.group];
    it->second.asked = false;
    group.any_continue |= r.vote == WYX_VOTE_CONTINUE;
    if (r.vote == WYX_VOTE_REJECT) group.rejects |= WYX_EXPLICIT_REJECT;
    if (r.default_vote != WYX_NULL_VOTE) it->second.default_vote = r.default_vote;
    if (r.proposed_state) group.proposed = std::make_shared<const Bytes>(*r.proposed_state);
    if (r.message) group.voted_message = std::make_shared<const Bytes>(*r.message);
  }
  void expect_end(const Endpoint& from, wyx_request_t protocol) {
    if (protocol == WYX_INTERNAL_REQUEST || protocol == WYX_SUBSCRIPTION) return;
    auto it = providers_.find(from);
    if (it == providers_.end()) return error(from, "is answered WYX_OK without being a provider");
    ++it->second.pending[protocol];
  }

  Providers::iterator lose(Providers::iterator it, std::uint32_t code) {
    if (it->second.asked) cast_default(it->second, WYX_PROVIDER_FAILED);
    if (it->second.seqnum != 0) groups_[it->second.group].lost[it->second.id] = code;
    return providers_.erase(it);
  }
  void lose(SessionId session, std::uint32_t code) {
    gone_.insert(session);
    for (auto it = providers_.lower_bound({session, 0}); it != providers_.end() && it->first.session == session;)
      it = lose(it, code);
    std::erase_if(subscribers_, [&](const auto& s) { return s.first.session == session; });
  }
  void cast_default(ProviderView& view, std::uint32_t cause) {
    GroupModel& group = groups_[view.group];
    auto vote = view.default_vote != WYX_NULL_VOTE ? view.default_vote : group.attributes.default_vote;
    const bool reject = vote == WYX_VOTE_REJECT;
    const std::uint32_t summary = (reject ? WYX_DEFAULT_REJECT : WYX_DEFAULT_APPROVE) | cause;
    group.defaults |= summary;
    if (reject) group.rejects |= summary;
    view.asked = false;
  }

  void before(const SessionGoneEvent& event, const Outcome&) { lose(event.session, WYX_PROVIDER_FAILURE); }
  void before(const HostGoneEvent& event, const Outcome&) {
    gone_hosts_.insert(event.node);
    std::set<SessionId> sessions;
    for (const auto& [endpoint, view] : providers_) sessions.insert(endpoint.session);
    for (const auto& [endpoint, view] : subscribers_) sessions.insert(endpoint.session);
    for (const SessionId& session : sessions)
      if (session.node == event.node) lose(session, event.leave_code);
  }
  void before(const HostCameEvent& event, const Outcome&) { gone_hosts_.erase(event.node); }
  void before(const AdaptersEvent& event, const Outcome&) { adapters_[event.node] = event.adapters; }

  /// Who begins to listen now and who has always listened believe the same, and only changes are told.
  void follow_domain(const std::vector<DomainNotification>& told, const Engine& engine) {
    std::map<std::uint32_t, std::uint32_t> nodes;
    for (const DomainNotification& news : told) {
      const auto* changed = std::get_if<NodesNotification>(&news);
      if (changed == nullptr) {
        const std::uint32_t master = std::get<MasterNotification>(news).master.number;
        if (master == std::exchange(master_, master)) errors_ += "a master that was one before\n";
        continue;
      }
      for (const DomainNode& node : changed->removed) nodes_.erase(node.number);
      for (const DomainNode& node : changed->added)
        if (!nodes_.emplace(node.number, node.epoch).second) errors_ += "a node that comes twice\n";
      for (const DomainNode& node : changed->current) nodes.emplace(node.number, node.epoch);
      if (nodes_ != nodes) errors_ += "nodes that are not what those before and the change make\n";
    }
    nodes.clear();
    for (const DomainNode& node : engine.domain().nodes) nodes.emplace(node.number, node.epoch);
    if (nodes_ != nodes) errors_ += "nodes that nobody was told of\n";
    if (nodes.empty()) master_ = 0;
    if (!nodes.empty() && master_ != nodes.begin()->first) errors_ += "a master that nobody was told of\n";
    std::erase_if(adapters_, [&](const auto& of) { return !nodes.contains(of.first); });
    for (const auto& [node, host] : engine.hosts())
      if (host.adapters != adapters_[node]) errors_ += "adapters that are not those of the node\n";
  }
  void before(const ResponsivenessEvent& event, const Outcome&) {
    const std::uint32_t summary = event.responding ? WYX_RESPONSIVENESS_RESPONSE : WYX_RESPONSIVENESS_NO_RESPONSE;
    for (const auto& [endpoint, about] : providers_) {
      if (endpoint.session != event.session || !about.joined) continue;
      for (auto& [to, view] : providers_)
        if (view.joined && view.group == about.group) view.unheard[about.id] = summary;
    }
  }
  void before(const ContinueEvent&, const Outcome&) {}
  void before(const NumbersEvent&, const Outcome&) {}
  void before(const TimerExpiredEvent& event, const Outcome& outcome) {
    const std::string& name = event.timer.group;
    const bool awaited = groups_.contains(name) && groups_[name].timer == event.timer;
    const bool later = groups_[name].unfinished || busy_;  // it may have to wait for its turn
    if (awaited ? !later && outcome.deliveries.empty() : !outcome.deliveries.empty())
      errors_ += name + (awaited ? ": the end of its time is ignored\n" : ": obeys a timer that is over\n");
    for (auto& [endpoint, view] : providers_)
      if (awaited && view.group == name && view.asked) cast_default(view, WYX_TIME_LIMIT_EXCEEDED);
  }

  void follow_timers(const Outcome& outcome) {
    std::map<std::string, const TimerRequest*> wanted;
    for (const TimerRequest& timer : outcome.timers) wanted[timer.id.group] = &timer;
    for (auto& [name, group] : groups_) {
      if (!group.event || group.event->type != WYX_N_PHASE_NOTIFICATION) continue;
      const TimerRequest* timer = wanted[name];
      if (timer && timer->seconds != 0) group.timer = timer->id;
      if (!timer || group.event->time_limit != timer->seconds)
        errors_ += name + ": the phase has another time limit than its timer\n";
    }
  }

  // ----------------------------------------------------------------------------------------- what clients hear

  void receive(const Endpoint& to, const ProtocolNotification& n) {
    auto it = providers_.find(to);
    if (it == providers_.end()) return error(to, "is no provider and is sent " + text(Notification(n)));
    ProviderView& view = it->second;
    parts_match_bits(to, n);
    group_event(view, n);
    number(to, view, n);
    if (n.type != WYX_N_PHASE_NOTIFICATION) return close(to, view, n);
    if (role_of(n.protocol) == ChangingRole::kHearEnd && contains(n.proposal.changing_providers, view.id))
      error(to, "votes on its own end");
    if (n.proposal.phase == 1) view.default_vote = WYX_NULL_VOTE;
    view.asked = true;
  }

  /// A member misses only the phases of a leave or expel that is about itself.
  void number(const Endpoint& to, ProviderView& view, const ProtocolNotification& n) {
    const std::uint64_t step = n.seqnum - view.seqnum;
    const bool unasked =
        role_of(n.protocol) == ChangingRole::kHearEnd && contains(n.proposal.changing_providers, view.id);
    const bool ok = view.seqnum == 0 || step == 1 || (unasked && step == 1u + n.proposal.phase);
    if (!ok) error(to, "sees a gap before event " + std::to_string(n.seqnum));
    view.seqnum = n.seqnum;
  }

  /// One event is the same for all; only the proposer may differ, for those who read their own id there.
  static bool only_changing(const Proposal& p) {
    return std::ranges::all_of(*p.current_providers, [&](const ProviderId& id) {
      return std::ranges::find(*p.changing_providers, id) != p.changing_providers->end();
    });
  }

  void group_event(const ProviderView& view, const ProtocolNotification& n) {
    GroupModel& group = groups_[view.group];
    if (group.event && group.event->seqnum == n.seqnum) {
      ProtocolNotification theirs = n;
      theirs.proposal.proposed_by = group.event->proposal.proposed_by;
      if (!same(theirs, *group.event)) complain(view.group, n, "is not the same for all");
      return;
    }
    const bool starts =
        n.proposal.num_phases == WYX_1_PHASE || (n.type == WYX_N_PHASE_NOTIFICATION && n.proposal.phase == 1);
    const bool first = starts && n.protocol == WYX_JOIN && only_changing(n.proposal);
    if (first) {  // born again
      for (const auto& [endpoint, other] : providers_)
        if (other.group == view.group && other.joined)
          complain(view.group, n, "is the first of a group with members");
      if (n.seqnum <= group.seqnum) complain(view.group, n, "goes back");
      group = {};
    } else if (n.seqnum != group.seqnum + 1) {
      complain(view.group, n, "does not follow the last one");
    }
    if (n.protocol == WYX_JOIN && !view.joined) group.attributes = view.attributes;
    if (group.open)
      check_end_of_phase(view.group, group, n);
    else
      check_start(view.group, group, n);
    check_values(view.group, group, n);
    group.open = n.type == WYX_N_PHASE_NOTIFICATION;
    group.seqnum = n.seqnum;
    group.event = &n;
  }
  void complain(const std::string& group, const ProtocolNotification& n, const char* what) {
    errors_ += group + ": #" + std::to_string(n.seqnum) + " " + text(Notification(n)) + " " + what + "\n";
  }

  void check_start(const std::string& name, GroupModel& group, const ProtocolNotification& n) {
    const Proposal& p = n.proposal;
    const bool phases = n.type == WYX_N_PHASE_NOTIFICATION, fails = n.protocol == WYX_FAILURE_LEAVE;
    if (n.type == WYX_REJECTED_NOTIFICATION || p.phase != 1 || n.summary != (phases ? 0 : WYX_EXPLICIT_APPROVE))
      complain(name, n, "is no start");
    const auto lost = [&](ProviderId id) { return group.lost.contains(id); };
    if (fails ? !std::ranges::all_of(*p.changing_providers, lost) : std::ranges::any_of(group.members, lost))
      complain(name, n, "comes before the failures");
    const bool many = p.changing_providers && p.changing_providers->size() > 1 && n.protocol != WYX_EXPEL;
    const auto batching = n.protocol == WYX_JOIN ? WYX_BATCH_JOINS : WYX_BATCH_LEAVES;
    if (many && !(group.attributes.batch_control & batching)) complain(name, n, "is a batch that nobody wanted");

    if (n.protocol == WYX_JOIN)
      for (ProviderId id : *p.changing_providers) group.lost.erase(id);  // a former joiner's
    group.protocol = n.protocol;
    group.any_continue = false;
    group.rejects = group.defaults = 0;
    group.proposed = p.proposed_state;
    group.message = n.protocol == WYX_PROVIDER_MESSAGE ? p.message : nullptr;
    group.voted_message = nullptr;
    group.leave_codes.clear();
    if (role_of(n.protocol) != ChangingRole::kHearEnd) return;
    for (ProviderId id : *p.changing_providers) group.leave_codes.push_back(leave_code(name, group, n, id));
  }

  LeaveCode leave_code(const std::string& name, GroupModel& group, const ProtocolNotification& n, ProviderId id) {
    if (n.protocol == WYX_EXPEL) return {WYX_PROVIDER_EXPELLED, 0};
    if (n.protocol == WYX_FAILURE_LEAVE) return {group.lost[id], 0};
    const auto leaver = std::ranges::find_if(
        providers_, [&](const auto& p) { return p.second.group == name && p.second.id == id && p.second.joined; });
    if (leaver == providers_.end()) return {};
    const LeaveRequest& leave = leaver->second.leave;
    if (leave.terms.num_phases != n.proposal.num_phases ||
        (n.type == WYX_N_PHASE_NOTIFICATION && leave.terms.time_limit != n.time_limit))
      complain(name, n, "has other terms than were asked for");
    return {WYX_VOLUNTARY_LEAVE, leave.leave_code};
  }

  /// What the votes have come to is what must happen.
  void check_end_of_phase(const std::string& name, GroupModel& group, const ProtocolNotification& n) {
    for (auto& [endpoint, view] : providers_)
      if (view.group == name && std::exchange(view.asked, false)) error(endpoint, "was not waited for");
    const ProtocolTraits& traits = traits_of(n.protocol);
    auto type = WYX_APPROVED_NOTIFICATION;
    std::uint32_t summary = group.defaults;
    if (group.rejects != 0) {
      if (traits.preventable) type = WYX_REJECTED_NOTIFICATION;
      summary = group.rejects;
      group.proposed = nullptr;
    } else if (group.any_continue && anybody_to_ask(name, n)) {
      type = WYX_N_PHASE_NOTIFICATION;
    } else if (summary == 0) {
      summary = WYX_EXPLICIT_APPROVE;
    }
    if (n.type != type || n.summary != summary || n.protocol != group.protocol)
      complain(name, n, "is not what the votes have come to");
    const bool rejected = type == WYX_REJECTED_NOTIFICATION;
    if (!same(n.proposal.message, group.voted_message || rejected ? group.voted_message : group.message))
      complain(name, n, "carries another message");

    if (group.voted_message && traits.message_is_proposal) group.message = group.voted_message;
    group.voted_message = nullptr;
    group.any_continue = false;
    group.rejects = 0;
    group.timer.reset();
  }

  bool anybody_to_ask(const std::string& group, const ProtocolNotification& n) const {
    return std::ranges::any_of(providers_, [&](const auto& p) {
      const ProviderView& view = p.second;
      const bool changes = contains(n.proposal.changing_providers, view.id);
      if (view.group != group) return false;
      if (n.protocol == WYX_JOIN && changes) return true;
      return view.joined && !(changes && role_of(n.protocol) == ChangingRole::kHearEnd);
    });
  }

  void check_values(const std::string& name, GroupModel& group, const ProtocolNotification& n) {
    const Proposal& p = n.proposal;
    const bool approved = n.type == WYX_APPROVED_NOTIFICATION;
    if (n.type == WYX_N_PHASE_NOTIFICATION && !same(p.proposed_state, group.proposed))
      complain(name, n, "proposes another state value");
    const bool new_value = approved && (p.whats_changed & WYX_UPDATED_STATE_VALUE) != 0;
    if (group.open && approved && new_value != (group.proposed != nullptr))
      complain(name, n, "changes the state value, or not");
    if (new_value) group.value = group.open ? *group.proposed : *p.current_state;
    if (*p.current_state != group.value) complain(name, n, "has another state value than the group");
    if (approved && p.new_attributes) group.attributes = *p.new_attributes;

    if ((p.leave_codes ? *p.leave_codes : std::vector<LeaveCode>()) != group.leave_codes)
      complain(name, n, "has other leave codes");
    if (n.type != WYX_N_PHASE_NOTIFICATION && p.changing_providers) change_membership(group, n);
    if (*p.current_providers != group.members)
      complain(name, n, "has other members than the last one and the change");
  }

  static void change_membership(GroupModel& group, const ProtocolNotification& n) {
    const bool approved = n.type == WYX_APPROVED_NOTIFICATION, joins = n.protocol == WYX_JOIN;
    for (ProviderId id : *n.proposal.changing_providers) {
      if (approved != joins) group.lost.erase(id);
      if (!approved) continue;
      if (joins)
        group.members.push_back(id);
      else
        std::erase(group.members, id);
    }
  }

  void close(const Endpoint& to, ProviderView& view, const ProtocolNotification& n) {
    const bool approved = n.type == WYX_APPROVED_NOTIFICATION;
    const bool mine = n.proposal.proposed_by == view.id;
    const bool my_join = n.protocol == WYX_JOIN && !view.joined;
    if (my_join && !mine) error(to, "does not read its own id in its join's end");
    if (!view.joined && !my_join) error(to, "is told of a protocol before its join");
    if (mine && n.protocol != WYX_FAILURE_LEAVE && --view.pending[n.protocol] < 0)
      error(to, "is told the end of a protocol that it did not ask for");
    view.joined |= my_join && approved;
    if ((my_join && !approved) || (n.protocol == WYX_LEAVE && mine)) providers_.erase(to);
  }

  /// Each part is there when its bit is, and the bit says how far the protocol has come.
  void parts_match_bits(const Endpoint& to, const ProtocolNotification& n) {
    constexpr std::uint32_t kMembers[] = {WYX_PROPOSED_MEMBERSHIP, WYX_ONGOING_MEMBERSHIP, WYX_UPDATED_MEMBERSHIP,
                                          WYX_REJECTED_MEMBERSHIP};
    constexpr std::uint32_t kState[] = {WYX_PROPOSED_STATE_VALUE, WYX_ONGOING_STATE_VALUE, WYX_UPDATED_STATE_VALUE,
                                        0};
    constexpr std::uint32_t kAttributes[] = {WYX_PROPOSED_GROUP_ATTRIBUTES, WYX_ONGOING_GROUP_ATTRIBUTES,
                                             WYX_UPDATED_GROUP_ATTRIBUTES, WYX_REJECTED_GROUP_ATTRIBUTES};
    const Proposal& p = n.proposal;
    const int stage = n.type == WYX_APPROVED_NOTIFICATION   ? 2
                      : n.type == WYX_REJECTED_NOTIFICATION ? 3
                                                            : p.phase > 1;
    std::uint32_t bits = WYX_CURRENT_STATE_VALUE;
    if (p.changing_providers) bits |= kMembers[stage];
    if (p.proposed_state) bits |= kState[stage];
    if (p.new_attributes) bits |= kAttributes[stage];
    if (p.message) bits |= WYX_UPDATED_PROVIDER_MESSAGE;
    if (p.expel_info) bits |= WYX_EXPEL_INFORMATION;
    if (stage == 2) bits |= p.whats_changed & WYX_UPDATED_STATE_VALUE;
    if (!p.current_providers || !p.current_state || p.whats_changed != bits)
      error(to, "gets parts that its bits do not name: " + text(Notification(n)));
  }

  void receive(const Endpoint& to, const AnnouncementNotification& n) {
    auto it = providers_.find(to);
    if (it == providers_.end()) return error(to, "is no provider and is sent " + text(Notification(n)));
    if (n.summary == WYX_GROUP_DISSOLVED) {
      if (owed(it->second)) error(to, "is expelled with a request that never ended");
      providers_.erase(it);
      return;
    }
    for (ProviderId id : *n.providers) {
      const auto unheard = it->second.unheard.find(id);
      if (unheard == it->second.unheard.end() || std::ranges::count(groups_[it->second.group].members, id) == 0)
        error(to, "hears of a client that is not in its group");
      else if (unheard->second == n.summary)
        it->second.unheard.erase(unheard);
    }
  }

  void receive(const Endpoint& to, const DelayedErrorNotification& n) {
    if (refused_ && to == refused_to_ && n.rc == refused_->rc && n.failing_request == refused_->failing_request)
      return refused_.reset();
    auto it = providers_.find(to);
    if (it == providers_.end() || --it->second.pending[n.protocol] < 0)
      return error(to, "gets the error of a request it did not make: " + text(Notification(n)));
    if (n.protocol == WYX_JOIN) providers_.erase(it);
  }

  void receive(const Endpoint& to, const SubscriptionNotification& n) {
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
    if ((n.type & WYX_SUBSCRIPTION_DELTA_LEAVE) &&
        (!n.leave_codes || n.leave_codes->size() != n.changing_membership->size()))
      error(to, "misses leave codes");
  }

  // --------------------------------------------------------------------------------------------- after each step

  static bool owed(const ProviderView& view) {
    return std::ranges::any_of(view.pending, [](const auto& p) { return p.second != 0; });
  }

  void check_groups(const Engine& engine) {
    std::set<std::string> names;
    for (const GroupStatus& status : engine.status()) {
      names.insert(status.name);
      check_group(engine, status, groups_[status.name]);
    }
    std::erase_if(groups_, [&](const auto& g) { return !names.contains(g.first); });
    for (const auto& [endpoint, view] : providers_)
      if (!names.contains(view.group)) error(endpoint, "is left in a group that is no more");
    for (auto& [name, group] : groups_) {
      if (!group.timer || engine.awaits(*group.timer)) continue;
      if (group.heard && !group.unfinished) errors_ += name + ": does not await its phase's timer\n";
      group.timer.reset();  // its voters are all gone: nobody was left to be told of the phase's end
    }
    for (const auto& [endpoint, view] : subscribers_) check_subscriber(endpoint, view);
  }

  /// While a protocol runs it waits for somebody; at rest nothing is owed and only the living are members.
  void check_group(const Engine& engine, const GroupStatus& status, GroupModel& group) {
    bool waits = false;
    std::set<ProviderId> alive;
    group.unfinished = status.unfinished;
    if (status.unfinished && !engine.busy()) errors_ += status.name + ": has work that nobody asks for\n";
    const bool at_rest = !status.running && !status.unfinished;
    for (const auto& [endpoint, view] : providers_) {
      if (view.group != status.name) continue;
      waits |= view.asked;
      if (at_rest && owed(view)) error(endpoint, "has a request that was answered WYX_OK and never ended");
      if (!view.joined) continue;
      alive.insert(view.id);
      if (at_rest && !view.unheard.empty()) error(endpoint, "was not told of a client that does not respond");
      if (at_rest && view.seqnum != status.seqnum) error(endpoint, "has not seen the group's last event");
    }
    group.heard = !alive.empty();
    if (!group.heard) group.members = *status.members;  // nobody was left to be told
    if (!alive.empty() && (*status.members != group.members || *status.state != group.value))
      errors_ += status.name + ": is not what its members believe\n";
    if (!at_rest && !waits && !status.unfinished)
      errors_ += status.name + ": runs a protocol and waits for nobody\n";
    if (at_rest && std::set<ProviderId>(status.members->begin(), status.members->end()) != alive)
      errors_ += status.name + ": is at rest with members that are not alive\n";
  }

  void check_subscriber(const Endpoint& endpoint, const SubscriberView& view) {
    const auto group = groups_.find(view.group);
    const bool born = group != groups_.end() && !group->second.members.empty();
    if (view.subscribed != born) error(endpoint, born ? "was not told of its group" : "was not told of its end");
    if (!born) return;
    const bool knows_members = (view.control & WYX_SUBSCRIBE_MEMBERSHIP) ||
                               (view.control & WYX_SUBSCRIBE_DELTAS_ONLY) == WYX_SUBSCRIBE_DELTAS_ONLY;
    const Membership& members = group->second.members;
    if (knows_members && view.members != std::set<ProviderId>(members.begin(), members.end()))
      error(endpoint, "has another membership than its group");
    if ((view.control & WYX_SUBSCRIBE_STATE) && group->second.heard && view.value != group->second.value)
      error(endpoint, "has another state value than its group");
  }

  std::string errors_;
  Providers providers_;
  std::map<Endpoint, SubscriberView> subscribers_;
  std::map<std::string, GroupModel> groups_;
  std::set<SessionId> gone_;
  std::set<std::uint32_t> gone_hosts_;
  std::map<std::uint32_t, std::uint32_t> nodes_;  // with their epochs
  std::uint32_t master_ = 0;
  std::map<std::uint32_t, Adapters> adapters_;
  std::optional<DelayedErrorNotification> refused_;  // must come in this step, to refused_to_
  Endpoint refused_to_;
  bool busy_ = false;  // work is left for a ContinueEvent
};

}  // namespace gs::test
