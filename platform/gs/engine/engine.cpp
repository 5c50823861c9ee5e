#include "engine/engine.h"

#include <algorithm>
#include <limits>

#include "engine/checks.h"
#include "engine/digest.h"
#include "engine/snapshot.h"
#include "engine/state.h"

namespace gs {

struct Engine::State : EngineState {
  using EngineState::EngineState;

  std::size_t work_left = 0;  // of the event that is being applied
  Watch watch;

  Surroundings surroundings(Outcome& out) {
    return {out.deliveries, out.timers, subscribers, clients, last_protocol,
            numbers_above,  watch,      ledger,      limits,  work_left};
  }

  const Group* find_group(const std::string& name) const {
    auto it = groups.find(name);
    return it == groups.end() ? nullptr : &it->second;
  }
  const Client* find_provider(const Payer& from, Token token) const {
    const Client* client = clients.find({from.session, token});
    return client && client->provider ? client : nullptr;
  }

  /// Who makes a request that has been checked. What comes of it may end it as a client.
  std::pair<MemberPtr, Groups::iterator> provider_of(const Payer& from, Token token) {
    const Client& client = *find_provider(from, token);
    return {client.provider, groups.find(client.group)};
  }

  wyx_rc_t check(const Payer& from, const Request& request) const;
  wyx_rc_t check(const Payer& from, const JoinRequest& request) const;
  wyx_rc_t check(const Payer& from, const StateChangeRequest& request) const;
  wyx_rc_t check(const Payer& from, const MessageRequest& request) const;
  wyx_rc_t check(const Payer& from, const LeaveRequest& request) const;
  wyx_rc_t check(const Payer& from, const ExpelRequest& request) const;
  wyx_rc_t check(const Payer& from, const AttributeChangeRequest& request) const;
  wyx_rc_t check(const Payer& from, const GoodbyeRequest& request) const;
  wyx_rc_t check(const Payer& from, const VoteRequest& request) const;
  wyx_rc_t check(const Payer& from, const SubscribeRequest& request) const;
  wyx_rc_t check(const Payer& from, const UnsubscribeRequest& request) const;
  wyx_rc_t check_new_token(const Payer& from, Token token) const;
  wyx_rc_t check_new_client(const Payer& from) const;
  template <typename R>
  wyx_rc_t check_room(const Payer& from, const R& request) const;

  void perform(const Payer& from, const JoinRequest& request, Outcome& out);
  void perform(const Payer& from, const LeaveRequest& request, Outcome& out);
  void perform(const Payer& from, const GoodbyeRequest& request, Outcome& out);
  void perform(const Payer& from, const VoteRequest& request, Outcome& out);
  void perform(const Payer& from, const SubscribeRequest& request, Outcome& out);
  void perform(const Payer& from, const UnsubscribeRequest& request, Outcome& out);
  template <typename Proposal>
  void perform(const Payer& from, const Proposal& request, Outcome& out);

  void apply(const RequestEvent& event, Outcome& out);
  void apply(const SessionGoneEvent& event, Outcome& out);
  void apply(const HostGoneEvent& event, Outcome& out);
  void apply(const HostCameEvent& event, Outcome& out);
  void apply(const TimerExpiredEvent& event, Outcome& out);
  void apply(const ResponsivenessEvent& event, Outcome& out);
  void apply(const ContinueEvent& event, Outcome& out);
  void apply(const NumbersEvent& event, Outcome& out);
  void apply(const AdaptersEvent& event, Outcome& out);

  void tell(const RequestEvent& event, wyx_rc_t rc) const;
  void tell_failure(const Client& client, std::uint32_t leave_code);
  void lose_clients(SessionId first, SessionId last, std::uint32_t leave_code, Outcome& out);
  void settle(Groups::iterator group, Outcome& out);
  void stand_in_line(const std::string& group);
  void go_on(Outcome& out);
};

// ------------------------------------------------------------------------------------------------------ checks

wyx_rc_t Engine::State::check(const Payer& from, const Request& request) const {
  if (hosts.is_gone(from.session.node)) return WYX_NO_INIT;
  return std::visit([&](const auto& r) { return check(from, r); }, request);
}

wyx_rc_t Engine::State::check_new_token(const Payer& from, Token token) const {
  return token >= 0 && !clients.find({from.session, token}) ? WYX_OK : WYX_BAD_MEMBER_TOKEN;
}

/// No session makes the daemon's memory grow without bound; nor does what it brings (see ledger.h).
wyx_rc_t Engine::State::check_new_client(const Payer& from) const {
  return clients.of(from.session).size() < kMaxSessionClients ? WYX_OK : WYX_NO_MEMORY;
}

template <typename R>
wyx_rc_t Engine::State::check_room(const Payer& from, const R& request) const {
  return ledger.has_room(from, room_for(request)) ? WYX_OK : WYX_NO_MEMORY;
}

wyx_rc_t Engine::State::check(const Payer& from, const JoinRequest& request) const {
  if (wyx_rc_t rc = check_new_token(from, request.token); rc != WYX_OK) return rc;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  const Group* group = find_group(request.attributes.group_name);
  const ProviderId id{request.instance, static_cast<std::int16_t>(from.session.node)};
  if (wyx_rc_t rc = group ? group->check_join(request.attributes, id) : WYX_OK; rc != WYX_OK) return rc;
  if (wyx_rc_t rc = check_new_client(from); rc != WYX_OK) return rc;
  return check_room(from, request);
}

wyx_rc_t Engine::State::check(const Payer& from, const StateChangeRequest& request) const {
  const Client* client = find_provider(from, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  if (wyx_rc_t rc = find_group(client->group)->check_proposal(*client->provider); rc != WYX_OK) return rc;
  return check_room(from, request);
}

wyx_rc_t Engine::State::check(const Payer& from, const MessageRequest& request) const {
  const Client* client = find_provider(from, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  if (wyx_rc_t rc = find_group(client->group)->check_proposal(*client->provider); rc != WYX_OK) return rc;
  return check_room(from, request);
}

wyx_rc_t Engine::State::check(const Payer& from, const LeaveRequest& request) const {
  const Client* client = find_provider(from, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  return find_group(client->group)->check_leave(*client->provider);
}

wyx_rc_t Engine::State::check(const Payer& from, const ExpelRequest& request) const {
  const Client* client = find_provider(from, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  const Group& group = *find_group(client->group);
  if (wyx_rc_t rc = group.check_expel(request.expelled); rc != WYX_OK) return rc;
  if (wyx_rc_t rc = group.check_proposal(*client->provider); rc != WYX_OK) return rc;
  return check_room(from, request);
}

wyx_rc_t Engine::State::check(const Payer& from, const AttributeChangeRequest& request) const {
  const Client* client = find_provider(from, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  const Group& group = *find_group(client->group);
  if (wyx_rc_t rc = group.check_new_attributes(request.attributes); rc != WYX_OK) return rc;
  return group.check_proposal(*client->provider);
}

wyx_rc_t Engine::State::check(const Payer& from, const GoodbyeRequest& request) const {
  return find_provider(from, request.token) ? WYX_OK : WYX_BAD_MEMBER_TOKEN;
}

wyx_rc_t Engine::State::check(const Payer& from, const VoteRequest& request) const {
  const Client* client = find_provider(from, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = find_group(client->group)->check_vote(*client->provider); rc != WYX_OK) return rc;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  return check_room(from, request);
}

wyx_rc_t Engine::State::check(const Payer& from, const SubscribeRequest& request) const {
  if (wyx_rc_t rc = check_new_token(from, request.token); rc != WYX_OK) return rc;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  const Group* group = find_group(request.group_name);
  const bool waits = request.control & WYX_SUBSCRIBE_PERSISTENCE;
  if (!waits && !(group && group->born())) return WYX_UNKNOWN_GROUP;
  if (subscribers.count(request.group_name) >= kMaxSubscribers) return WYX_NO_MEMORY;
  if (wyx_rc_t rc = check_new_client(from); rc != WYX_OK) return rc;
  return check_room(from, request);
}

wyx_rc_t Engine::State::check(const Payer& from, const UnsubscribeRequest& request) const {
  const Client* client = clients.find({from.session, request.token});
  return client && !client->provider ? WYX_OK : WYX_BAD_MEMBER_TOKEN;
}

// ---------------------------------------------------------------------------------------------------- requests

void Engine::State::apply(const RequestEvent& event, Outcome& out) {
  const Payer from{event.session, event.user};
  out.rc = check(from, event.request);
  if (watch.observer != nullptr) tell(event, out.rc);
  if (out.rc == WYX_OK) {
    std::visit([&](const auto& r) { perform(from, r, out); }, event.request);
    return;
  }
  if (!event.answered || hosts.is_gone(event.session.node)) return;
  const Token token = std::visit([](const auto& r) { return r.token; }, event.request);
  std::shared_ptr<const GroupAttributes> reason;
  const auto* join = std::get_if<JoinRequest>(&event.request);
  if (join && out.rc == WYX_BAD_GROUP_ATTRIBUTES) {
    const Group* group = find_group(join->attributes.group_name);
    if (group) reason = group->attributes();
  }
  out.deliveries.push_back(delayed_error({event.session, token}, event.request, out.rc, std::move(reason)));
}

void Engine::State::perform(const Payer& from, const JoinRequest& request, Outcome& out) {
  const std::string& name = request.attributes.group_name;
  auto joiner = std::make_shared<Member>();
  joiner->to = {from.session, request.token};
  joiner->user = from.user;
  joiner->id = {request.instance, static_cast<std::int16_t>(from.session.node)};
  joiner->local_name = request.local_name;
  joiner->charge = Ledger::Charge(ledger, from, room_for(request));
  clients.add(joiner->to, {name, joiner});
  const auto group = groups.try_emplace(name, name, ended_number).first;
  group->second.join(std::move(joiner), request);
  settle(group, out);
}

void Engine::State::perform(const Payer& from, const LeaveRequest& request, Outcome& out) {
  const auto [provider, group] = provider_of(from, request.token);
  group->second.leave(provider, request);
  settle(group, out);
}

void Engine::State::perform(const Payer& from, const GoodbyeRequest& request, Outcome& out) {
  const auto [provider, group] = provider_of(from, request.token);
  tell_failure({group->first, provider}, WYX_PROVIDER_SAID_GOODBYE);
  clients.erase({from.session, request.token});
  group->second.lose(provider, WYX_PROVIDER_SAID_GOODBYE);
  settle(group, out);
}

void Engine::State::perform(const Payer& from, const VoteRequest& request, Outcome& out) {
  const auto [provider, group] = provider_of(from, request.token);
  Surroundings env = surroundings(out);
  group->second.vote(*provider, request, env);
  settle(group, out);
}

void Engine::State::perform(const Payer& from, const SubscribeRequest& request, Outcome& out) {
  const Endpoint to{from.session, request.token};
  Subscriber subscriber{to, request.control, Ledger::Charge(ledger, from, room_for(request))};
  clients.add(to, {request.group_name, nullptr, subscribers.add(request.group_name, std::move(subscriber))});
  const Group* group = find_group(request.group_name);
  if (group && group->born()) SubscriberTable::greet(to, request.control, group->view(), out.deliveries);
}

void Engine::State::perform(const Payer& from, const UnsubscribeRequest& request, Outcome&) {
  const Endpoint endpoint{from.session, request.token};
  const Client& client = *clients.find(endpoint);
  subscribers.remove(client.group, client.subscription);
  clients.erase(endpoint);
}

template <typename Proposal>
void Engine::State::perform(const Payer& from, const Proposal& request, Outcome& out) {
  const auto [provider, group] = provider_of(from, request.token);
  Surroundings env = surroundings(out);
  group->second.propose(*provider, request, env);
  settle(group, out);
}

// ------------------------------------------------------------------------------------------------ other events

void Engine::State::apply(const SessionGoneEvent& event, Outcome& out) {
  lose_clients(event.session, event.session, WYX_PROVIDER_FAILURE, out);
}

void Engine::State::apply(const HostGoneEvent& event, Outcome& out) {
  hosts.go(event.node, numbers_above, out.domain);
  const auto code = event.leave_code != 0 ? event.leave_code : std::uint32_t{WYX_HOST_FAILURE};
  lose_clients({event.node, 0}, {event.node, std::numeric_limits<std::uint64_t>::max()}, code, out);
}

void Engine::State::apply(const HostCameEvent& event, Outcome& out) {
  hosts.come(event.node, numbers_above, out.domain);
}

void Engine::State::apply(const AdaptersEvent& event, Outcome&) { hosts.set_adapters(event); }

void Engine::State::apply(const TimerExpiredEvent& event, Outcome& out) {
  auto it = groups.find(event.timer.group);
  if (it == groups.end()) return;
  if (watch.observer != nullptr && it->second.awaits(event.timer)) {
    Happening told;
    told.kind = Happening::Kind::kTimer;
    told.group = it->first;
    told.protocol = it->second.running_protocol();
    told.number = event.timer.protocol;
    told.phase = event.timer.phase;
    told.n_phase = true;
    watch.observer->happened(told);
  }
  it->second.expire(event.timer);
  settle(it, out);
}

void Engine::State::apply(const ResponsivenessEvent& event, Outcome& out) {
  std::map<std::string, Membership> concerned;
  for (const auto& [token, client] : clients.of(event.session)) {
    if (client.provider && client.provider->stage == Member::Stage::kJoined)
      concerned[client.group].push_back(client.provider->id);
  }
  const std::uint32_t summary = event.responding ? WYX_RESPONSIVENESS_RESPONSE : WYX_RESPONSIVENESS_NO_RESPONSE;
  for (auto& [name, ids] : concerned) {
    groups.at(name).announce({event.session, summary, std::make_shared<const Membership>(std::move(ids))});
    stand_in_line(name);
  }
  go_on(out);
}

void Engine::State::apply(const ContinueEvent&, Outcome& out) { go_on(out); }

void Engine::State::apply(const NumbersEvent& event, Outcome&) {
  numbers_above = std::max(numbers_above, event.above);
  last_protocol = std::max(last_protocol, event.above);
}

void Engine::State::tell(const RequestEvent& event, wyx_rc_t rc) const {
  constexpr const char* kNames[] = {"join",       "state",   "message", "leave",     "expel",
                                    "attributes", "goodbye", "vote",    "subscribe", "unsubscribe"};
  static_assert(std::size(kNames) == std::variant_size_v<Request>);
  Happening told;
  told.protocol = kNames[event.request.index()];
  told.session = event.session;
  told.rc = rc;
  const Token token = std::visit([](const auto& r) { return r.token; }, event.request);
  if (const auto* join = std::get_if<JoinRequest>(&event.request)) {
    told.group = join->attributes.group_name;
    told.name = join->local_name;
    told.who = ProviderId{join->instance, static_cast<std::int16_t>(event.session.node)};
  } else if (const auto* subscribe = std::get_if<SubscribeRequest>(&event.request)) {
    told.group = subscribe->group_name;
  } else if (const Client* client = clients.find({event.session, token})) {
    told.group = client->group;
    if (client->provider) {
      told.name = client->provider->local_name;
      told.who = client->provider->id;
    }
  }
  watch.observer->happened(told);
}

void Engine::State::tell_failure(const Client& client, std::uint32_t leave_code) {
  ++watch.tally.failures;
  if (watch.observer == nullptr) return;
  Happening told;
  told.kind = Happening::Kind::kFailure;
  told.group = client.group;
  told.who = client.provider->id;
  told.name = client.provider->local_name;
  told.session = client.provider->to.session;
  told.leave_code = leave_code;
  watch.observer->happened(told);
}

/// All are taken out before any group is told, so that nobody who is lost in this event is sent anything.
void Engine::State::lose_clients(SessionId first, SessionId last, std::uint32_t leave_code, Outcome& out) {
  while (const auto session = clients.take_session(first, last)) {
    for (const auto& [token, client] : session.mapped()) {
      if (!client.provider) {
        subscribers.remove(client.group, client.subscription);
        continue;
      }
      tell_failure(client, leave_code);
      groups.at(client.group).lose(client.provider, leave_code);
      stand_in_line(client.group);
    }
  }
  go_on(out);
}

/// A group in line waits for its turn, so that what it has left comes before what came later.
void Engine::State::settle(Groups::iterator group, Outcome& out) {
  if (group->second.in_line()) return;
  Surroundings env = surroundings(out);
  group->second.settle(env);
  if (group->second.unfinished()) stand_in_line(group->first);
  if (!group->second.finished()) return;
  ended_number = std::max(ended_number, group->second.seqnum());
  groups.erase(group);
}

void Engine::State::stand_in_line(const std::string& name) {
  Group& group = groups.at(name);
  if (group.in_line()) return;
  group.set_in_line(true);
  line.push_back(name);
}

/// One that uses up the event's work goes to the end of the line.
void Engine::State::go_on(Outcome& out) {
  while (!line.empty() && work_left > 0) {
    const std::string name = std::move(line.front());
    line.pop_front();
    const auto group = groups.find(name);
    group->second.set_in_line(false);
    settle(group, out);
  }
}

// -------------------------------------------------------------------------------------------------- the engine

Engine::Engine(const Limits& limits) : state_(std::make_unique<State>(limits)) {}
Engine::~Engine() = default;

Outcome Engine::apply(const Event& event, Moment now) {
  Outcome out;
  state_->watch.now = now;
  state_->work_left = std::max<std::size_t>(state_->limits.slice, 1);
  std::visit([&](const auto& e) { state_->apply(e, out); }, event);
  return out;
}

bool Engine::busy() const { return !state_->line.empty(); }

wyx_rc_t Engine::precheck(SessionId session, const Request& request, std::uint32_t user) const {
  return state_->check({session, user}, request);
}

bool Engine::awaits(const TimerId& timer) const {
  const Group* group = state_->find_group(timer.group);
  return group && group->awaits(timer);
}

std::vector<TimerRequest> Engine::running_phases() const {
  std::vector<TimerRequest> timers;
  for (const auto& [name, group] : state_->groups) {
    if (const auto timer = group.running_timer()) timers.push_back(*timer);
  }
  return timers;
}

DomainView Engine::domain() const { return state_->hosts.view(); }

const std::map<std::uint32_t, DomainHost>& Engine::hosts() const { return state_->hosts.here(); }

std::size_t Engine::kept_bytes() const { return state_->ledger.total(); }

MissingVotes Engine::missing_votes(const std::string& name, std::size_t at_most) const {
  const Group* group = state_->find_group(name);
  if (!group) return {};
  return {group->running_protocol(), group->running_phase(), group->missing_votes(),
          group->missing_voters(at_most)};
}

void Engine::observe(Observer* observer) { state_->watch.observer = observer; }

const Tally& Engine::tally() const { return state_->watch.tally; }

Totals Engine::totals() const {
  Totals totals{state_->groups.size()};
  for (const auto& [name, group] : state_->groups) {
    totals.members += group.member_ids().size();
    if (group.running_phase() != 0) ++totals.running;
  }
  for (const auto& [name, subscribers] : state_->subscribers.groups()) totals.subscribers += subscribers.size();
  return totals;
}

std::optional<GroupStatus> Engine::status_of(const std::string& name) const {
  const Group* group = state_->find_group(name);
  if (group == nullptr) return std::nullopt;
  GroupStatus status = group->status();
  status.subscribers = state_->subscribers.count(name);
  return status;
}

std::vector<GroupStatus> Engine::status(const std::string& after, std::size_t at_most) const {
  std::vector<GroupStatus> found;
  const auto& groups = state_->groups;
  auto at = after.empty() ? groups.begin() : groups.upper_bound(after);
  for (; at != groups.end() && found.size() < at_most; ++at) found.push_back(*status_of(at->first));
  return found;
}

std::vector<MemberStatus> Engine::members_of(const std::string& name, std::size_t from,
                                             std::size_t at_most) const {
  const Group* group = state_->find_group(name);
  return group == nullptr ? std::vector<MemberStatus>() : group->member_status(from, at_most);
}

std::vector<SubscriberStatus> Engine::subscribers_of(const std::string& name, std::uint64_t above,
                                                     std::size_t at_most) const {
  std::vector<SubscriberStatus> found;
  const auto of_group = state_->subscribers.groups().find(name);
  if (of_group == state_->subscribers.groups().end()) return found;
  auto at = of_group->second.upper_bound(above);
  for (; at != of_group->second.end() && found.size() < at_most; ++at)
    found.push_back({name, at->first, at->second.to, at->second.control});
  return found;
}

std::string Engine::next_subscribed(const std::string& after) const {
  const auto at = state_->subscribers.groups().upper_bound(after);
  return at == state_->subscribers.groups().end() ? "" : at->first;
}

std::pair<std::size_t, std::size_t> Engine::clients_of(SessionId session) const {
  const auto& clients = state_->clients.of(session);
  const auto providers =
      std::ranges::count_if(clients, [](const auto& client) { return client.second.provider != nullptr; });
  return {static_cast<std::size_t>(providers), clients.size() - static_cast<std::size_t>(providers)};
}

SnapshotBytes Engine::snapshot() const { return write_snapshot(*state_); }

bool Engine::restore(const SnapshotBytes& snapshot, std::string* error) {
  auto restored = std::make_unique<State>(state_->limits);
  if (!read_snapshot(snapshot, *restored, error)) return false;
  restored->watch = state_->watch;
  state_ = std::move(restored);
  return true;
}

std::uint64_t Engine::digest() const {
  Digest digest;
  digest.add(state_->last_protocol);
  digest.add(state_->numbers_above);
  digest.add(state_->ended_number);
  state_->hosts.add_to(digest);
  digest.add(state_->ledger.total());
  for (const std::string& name : state_->line) digest.add(name);
  for (const auto& [session, clients] : state_->clients.sessions()) {
    for (const auto& [token, client] : clients) {
      digest.add(Endpoint{session, token});
      digest.add(client.group);
      digest.add(client.provider != nullptr);
    }
  }
  state_->subscribers.add_to(digest);
  digest.add(state_->groups.size());
  for (const auto& [name, group] : state_->groups) group.add_to(digest);
  return digest.value();
}

}  // namespace gs
