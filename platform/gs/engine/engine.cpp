#include "engine/engine.h"

#include <limits>
#include <map>
#include <set>

#include "engine/checks.h"
#include "engine/digest.h"
#include "engine/group.h"
#include "engine/subscribers.h"

namespace gs {

struct Engine::State {
  std::map<std::string, Group> groups;
  SubscriberTable subscribers;
  ClientTable clients;
  std::set<std::uint32_t> gone_hosts;
  std::uint64_t last_protocol = 0;

  Surroundings surroundings(Outcome& out) {
    return {out.deliveries, out.timers, subscribers, clients, last_protocol};
  }

  const Group* find_group(const std::string& name) const {
    auto it = groups.find(name);
    return it == groups.end() ? nullptr : &it->second;
  }
  const Client* find(SessionId session, Token token) const {
    auto it = clients.find({session, token});
    return it == clients.end() ? nullptr : &it->second;
  }
  const Client* find_provider(SessionId session, Token token) const {
    const Client* client = find(session, token);
    return client && client->provider ? client : nullptr;
  }

  wyx_rc_t check(SessionId session, const Request& request) const;
  wyx_rc_t check(SessionId session, const JoinRequest& request) const;
  wyx_rc_t check(SessionId session, const StateChangeRequest& request) const;
  wyx_rc_t check(SessionId session, const MessageRequest& request) const;
  wyx_rc_t check(SessionId session, const LeaveRequest& request) const;
  wyx_rc_t check(SessionId session, const ExpelRequest& request) const;
  wyx_rc_t check(SessionId session, const AttributeChangeRequest& request) const;
  wyx_rc_t check(SessionId session, const GoodbyeRequest& request) const;
  wyx_rc_t check(SessionId session, const VoteRequest& request) const;
  wyx_rc_t check(SessionId session, const SubscribeRequest& request) const;
  wyx_rc_t check(SessionId session, const UnsubscribeRequest& request) const;
  wyx_rc_t check_new_token(SessionId session, Token token) const;
  wyx_rc_t check_room(SessionId session) const;

  void perform(SessionId session, const JoinRequest& request, Outcome& out);
  void perform(SessionId session, const LeaveRequest& request, Outcome& out);
  void perform(SessionId session, const GoodbyeRequest& request, Outcome& out);
  void perform(SessionId session, const VoteRequest& request, Outcome& out);
  void perform(SessionId session, const SubscribeRequest& request, Outcome& out);
  void perform(SessionId session, const UnsubscribeRequest& request, Outcome& out);
  template <typename Proposal>
  void perform(SessionId session, const Proposal& request, Outcome& out);

  void apply(const RequestEvent& event, Outcome& out);
  void apply(const SessionGoneEvent& event, Outcome& out);
  void apply(const HostGoneEvent& event, Outcome& out);
  void apply(const HostCameEvent& event, Outcome& out);
  void apply(const TimerExpiredEvent& event, Outcome& out);
  void apply(const ResponsivenessEvent& event, Outcome& out);

  void lose_clients(SessionId first, SessionId last, std::uint32_t leave_code, Outcome& out);
  void settle(const std::string& group, Outcome& out);
};

// ------------------------------------------------------------------------------------------------------ checks

wyx_rc_t Engine::State::check(SessionId session, const Request& request) const {
  if (gone_hosts.contains(session.node)) return WYX_NO_INIT;
  return std::visit([&](const auto& r) { return check(session, r); }, request);
}

wyx_rc_t Engine::State::check_new_token(SessionId session, Token token) const {
  return token >= 0 && !find(session, token) ? WYX_OK : WYX_BAD_MEMBER_TOKEN;
}

/// No session makes the daemon's memory grow without bound.
wyx_rc_t Engine::State::check_room(SessionId session) const {
  std::size_t count = 0;
  auto it = clients.lower_bound({session, 0});
  for (; it != clients.end() && it->first.session == session && count < kMaxSessionClients; ++it) ++count;
  return count < kMaxSessionClients ? WYX_OK : WYX_NO_MEMORY;
}

wyx_rc_t Engine::State::check(SessionId session, const JoinRequest& request) const {
  if (wyx_rc_t rc = check_new_token(session, request.token); rc != WYX_OK) return rc;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  const Group* group = find_group(request.attributes.group_name);
  const ProviderId id{request.instance, static_cast<std::int16_t>(session.node)};
  if (wyx_rc_t rc = group ? group->check_join(request.attributes, id) : WYX_OK; rc != WYX_OK) return rc;
  return check_room(session);
}

wyx_rc_t Engine::State::check(SessionId session, const StateChangeRequest& request) const {
  const Client* client = find_provider(session, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  return find_group(client->group)->check_proposal(*client->provider);
}

wyx_rc_t Engine::State::check(SessionId session, const MessageRequest& request) const {
  const Client* client = find_provider(session, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  return find_group(client->group)->check_proposal(*client->provider);
}

wyx_rc_t Engine::State::check(SessionId session, const LeaveRequest& request) const {
  const Client* client = find_provider(session, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  return find_group(client->group)->check_leave(*client->provider);
}

wyx_rc_t Engine::State::check(SessionId session, const ExpelRequest& request) const {
  const Client* client = find_provider(session, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  const Group& group = *find_group(client->group);
  if (wyx_rc_t rc = group.check_expel(request.expelled); rc != WYX_OK) return rc;
  return group.check_proposal(*client->provider);
}

wyx_rc_t Engine::State::check(SessionId session, const AttributeChangeRequest& request) const {
  const Client* client = find_provider(session, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  const Group& group = *find_group(client->group);
  if (wyx_rc_t rc = group.check_new_attributes(request.attributes); rc != WYX_OK) return rc;
  return group.check_proposal(*client->provider);
}

wyx_rc_t Engine::State::check(SessionId session, const GoodbyeRequest& request) const {
  return find_provider(session, request.token) ? WYX_OK : WYX_BAD_MEMBER_TOKEN;
}

wyx_rc_t Engine::State::check(SessionId session, const VoteRequest& request) const {
  const Client* client = find_provider(session, request.token);
  if (!client) return WYX_BAD_MEMBER_TOKEN;
  if (wyx_rc_t rc = find_group(client->group)->check_vote(*client->provider); rc != WYX_OK) return rc;
  return check_values(request);
}

wyx_rc_t Engine::State::check(SessionId session, const SubscribeRequest& request) const {
  if (wyx_rc_t rc = check_new_token(session, request.token); rc != WYX_OK) return rc;
  if (wyx_rc_t rc = check_values(request); rc != WYX_OK) return rc;
  const Group* group = find_group(request.group_name);
  const bool waits = request.control & WYX_SUBSCRIBE_PERSISTENCE;
  if (!waits && !(group && group->born())) return WYX_UNKNOWN_GROUP;
  return check_room(session);
}

wyx_rc_t Engine::State::check(SessionId session, const UnsubscribeRequest& request) const {
  const Client* client = find(session, request.token);
  return client && !client->provider ? WYX_OK : WYX_BAD_MEMBER_TOKEN;
}

// ---------------------------------------------------------------------------------------------------- requests

void Engine::State::apply(const RequestEvent& event, Outcome& out) {
  out.rc = check(event.session, event.request);
  if (out.rc == WYX_OK) {
    std::visit([&](const auto& r) { perform(event.session, r, out); }, event.request);
    return;
  }
  if (!event.answered || gone_hosts.contains(event.session.node)) return;
  const Token token = std::visit([](const auto& r) { return r.token; }, event.request);
  std::shared_ptr<const GroupAttributes> reason;
  const auto* join = std::get_if<JoinRequest>(&event.request);
  if (join && out.rc == WYX_BAD_GROUP_ATTRIBUTES) {
    const Group* group = find_group(join->attributes.group_name);
    if (group) reason = group->attributes();
  }
  out.deliveries.push_back(delayed_error({event.session, token}, event.request, out.rc, std::move(reason)));
}

void Engine::State::perform(SessionId session, const JoinRequest& request, Outcome& out) {
  const std::string& name = request.attributes.group_name;
  auto joiner = std::make_shared<Member>();
  joiner->to = {session, request.token};
  joiner->id = {request.instance, static_cast<std::int16_t>(session.node)};
  joiner->local_name = request.local_name;
  clients[joiner->to] = {name, joiner};
  groups.try_emplace(name, name).first->second.join(std::move(joiner), request);
  settle(name, out);
}

void Engine::State::perform(SessionId session, const LeaveRequest& request, Outcome& out) {
  const Client client = *find(session, request.token);
  groups.at(client.group).leave(client.provider, request);
  settle(client.group, out);
}

void Engine::State::perform(SessionId session, const GoodbyeRequest& request, Outcome& out) {
  const Client client = *find(session, request.token);
  clients.erase({session, request.token});
  groups.at(client.group).lose(client.provider, WYX_PROVIDER_SAID_GOODBYE);
  settle(client.group, out);
}

void Engine::State::perform(SessionId session, const VoteRequest& request, Outcome& out) {
  const Client client = *find(session, request.token);
  groups.at(client.group).vote(*client.provider, request);
  settle(client.group, out);
}

void Engine::State::perform(SessionId session, const SubscribeRequest& request, Outcome& out) {
  const Subscriber subscriber{{session, request.token}, request.control};
  clients[subscriber.to] = {request.group_name, nullptr};
  subscribers.add(request.group_name, subscriber);
  const Group* group = find_group(request.group_name);
  if (group && group->born()) SubscriberTable::greet(subscriber, group->view(), out.deliveries);
}

void Engine::State::perform(SessionId session, const UnsubscribeRequest& request, Outcome&) {
  const Endpoint endpoint{session, request.token};
  subscribers.remove(clients.at(endpoint).group, endpoint);
  clients.erase(endpoint);
}

template <typename Proposal>
void Engine::State::perform(SessionId session, const Proposal& request, Outcome& out) {
  const Client client = *find(session, request.token);
  Surroundings env = surroundings(out);
  groups.at(client.group).propose(*client.provider, request, env);
  settle(client.group, out);
}

// ------------------------------------------------------------------------------------------------ other events

void Engine::State::apply(const SessionGoneEvent& event, Outcome& out) {
  lose_clients(event.session, event.session, WYX_PROVIDER_FAILURE, out);
}

void Engine::State::apply(const HostGoneEvent& event, Outcome& out) {
  gone_hosts.insert(event.node);
  const auto code = event.leave_code != 0 ? event.leave_code : std::uint32_t{WYX_HOST_FAILURE};
  lose_clients({event.node, 0}, {event.node, std::numeric_limits<std::uint64_t>::max()}, code, out);
}

void Engine::State::apply(const HostCameEvent& event, Outcome&) { gone_hosts.erase(event.node); }

void Engine::State::apply(const TimerExpiredEvent& event, Outcome& out) {
  auto it = groups.find(event.timer.group);
  if (it == groups.end()) return;
  it->second.expire(event.timer);
  settle(event.timer.group, out);
}

void Engine::State::apply(const ResponsivenessEvent& event, Outcome& out) {
  std::map<std::string, Membership> concerned;
  for (auto it = clients.lower_bound({event.session, 0}); it != clients.end(); ++it) {
    const auto& [endpoint, client] = *it;
    if (endpoint.session != event.session) break;
    if (client.provider && client.provider->stage == Member::Stage::kJoined)
      concerned[client.group].push_back(client.provider->id);
  }
  Surroundings env = surroundings(out);
  const std::uint32_t summary = event.responding ? WYX_RESPONSIVENESS_RESPONSE : WYX_RESPONSIVENESS_NO_RESPONSE;
  for (const auto& [name, ids] : concerned) groups.at(name).announce(summary, ids, env);
}

/// All are taken out before any group is told, so that nobody who is lost in this event is sent anything.
void Engine::State::lose_clients(SessionId first, SessionId last, std::uint32_t leave_code, Outcome& out) {
  std::set<std::string> concerned;
  auto it = clients.lower_bound({first, 0});
  while (it != clients.end() && it->first.session <= last) {
    const auto& [endpoint, client] = *it;
    if (client.provider) {
      groups.at(client.group).lose(client.provider, leave_code);
      concerned.insert(client.group);
    } else {
      subscribers.remove(client.group, endpoint);
    }
    it = clients.erase(it);
  }
  for (const std::string& name : concerned) settle(name, out);
}

void Engine::State::settle(const std::string& name, Outcome& out) {
  auto it = groups.find(name);
  Surroundings env = surroundings(out);
  it->second.settle(env);
  if (it->second.finished()) groups.erase(it);
}

// -------------------------------------------------------------------------------------------------- the engine

Engine::Engine() : state_(std::make_unique<State>()) {}
Engine::~Engine() = default;

Outcome Engine::apply(const Event& event) {
  Outcome out;
  std::visit([&](const auto& e) { state_->apply(e, out); }, event);
  return out;
}

wyx_rc_t Engine::precheck(SessionId session, const Request& request) const {
  return state_->check(session, request);
}

bool Engine::awaits(const TimerId& timer) const {
  const Group* group = state_->find_group(timer.group);
  return group && group->awaits(timer);
}

std::vector<Engine::GroupStatus> Engine::status() const {
  std::vector<GroupStatus> all;
  for (const auto& [name, group] : state_->groups) {
    GroupStatus status;
    status.name = name;
    status.members = group.member_ids();
    status.state_length = group.state_length();
    status.seqnum = group.seqnum();
    status.running_protocol = group.running_protocol();
    status.subscribers = state_->subscribers.count(name);
    all.push_back(std::move(status));
  }
  return all;
}

std::uint64_t Engine::digest() const {
  Digest digest;
  digest.add(state_->last_protocol);
  for (std::uint32_t node : state_->gone_hosts) digest.add(node);
  digest.add(state_->clients.size());
  for (const auto& [endpoint, client] : state_->clients) {
    digest.add(endpoint);
    digest.add(client.group);
    digest.add(client.provider != nullptr);
  }
  state_->subscribers.add_to(digest);
  digest.add(state_->groups.size());
  for (const auto& [name, group] : state_->groups) group.add_to(digest);
  return digest.value();
}

}  // namespace gs
