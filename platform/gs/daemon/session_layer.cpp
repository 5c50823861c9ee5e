#include "daemon/session_layer.h"

#include <algorithm>

#include "engine/text.h"
#include "gscl/GSUtils.h"

namespace gs::daemon {

SessionLayer::SessionLayer(const Settings& settings, Environment environment)
    : settings_(settings), env_(std::move(environment)), client_log_(*env_.log), engine_(settings.engine) {
  for (std::size_t rc = 0; rc < answers_.size(); ++rc) {
    answers_[rc] = wire::encode(wire::Answer{static_cast<wyx_rc_t>(rc)});
  }
  env_.ordering.start([this](const Event& event) { ordered(event); });
}

SessionLayer::Connection* SessionLayer::find(ConnectionId id) {
  const auto found = connections_.find(id);
  return found == connections_.end() ? nullptr : &found->second;
}

SessionLayer::Session* SessionLayer::find_session(std::uint64_t number) {
  const auto found = sessions_.find(number);
  return found == sessions_.end() ? nullptr : &found->second;
}

// -------------------------------------------------------------------------------------------------- from below

void SessionLayer::opened(ConnectionId id, const Peer& peer) {
  Connection& connection = connections_[id];
  connection.peer = peer;
  connection.handshake = timers_.arm(env_.now() + settings_.handshake_limit, [this, id] {
    end(id, End::kFault, "said neither Hello nor Attach in time");
  });
}

void SessionLayer::received(ConnectionId id, std::span<const std::byte> packet) {
  Connection* connection = find(id);
  if (connection == nullptr) return;
  std::string error;
  if (!connection->in.add(packet, &error)) return end(id, End::kFault, "malformed: " + error);
  if (!connection->in.complete()) return;
  const auto message = connection->in.take_client_message(&error);
  if (!message) return end(id, End::kFault, "malformed: " + error);
  on_message(id, *connection, *message);
}

void SessionLayer::writable(ConnectionId id) {
  Connection* connection = find(id);
  if (connection == nullptr) return;
  const auto sent = connection->out.flush(env_.transport, id);
  if (sent == Transport::Sent::kFull) env_.transport.wait_writable(id);
  if (sent == Transport::Sent::kGone) end(id, End::kGone, "the peer is gone");
}

void SessionLayer::lost(ConnectionId id, const std::string& why) {
  if (find(id) != nullptr) end(id, End::kGone, why);
}

void SessionLayer::say_farewell() {
  client_log_.tell_left_out();
  const wire::Encoded farewell = wire::encode(wire::Farewell{});
  std::vector<ConnectionId> channels;
  for (const auto& [number, session] : sessions_) {
    if (session.event != 0) channels.push_back(session.event);
  }
  for (const ConnectionId id : channels) send(id, farewell);
  said_farewell_ = true;
}

bool SessionLayer::drained() const {
  return std::all_of(connections_.begin(), connections_.end(), [](const auto& c) { return c.second.out.empty(); });
}

// ---------------------------------------------------------------------------------------------------- messages

void SessionLayer::on_message(ConnectionId id, Connection& connection, const wire::ClientMessage& message) {
  switch (connection.channel) {
    case Channel::kFresh:
      return on_fresh(id, connection, message);
    case Channel::kRequest:
      return on_request_channel(id, connection, message);
    case Channel::kEvent:
      break;
  }
  const auto* ping_answer = std::get_if<wire::PingAnswer>(&message);
  if (ping_answer == nullptr) return end(id, End::kFault, "out of order: a message not for the event channel");
  if (Session* session = find_session(connection.session)) session->pinger.answered(*ping_answer);
}

void SessionLayer::on_fresh(ConnectionId id, Connection& connection, const wire::ClientMessage& message) {
  if (const auto* hello = std::get_if<wire::Hello>(&message)) return on_hello(id, connection, *hello);
  if (const auto* attach = std::get_if<wire::Attach>(&message)) return on_attach(id, connection, *attach);
  if (std::holds_alternative<wire::QueryNode>(message)) return on_query_node(id);
  end(id, End::kFault, "out of order: neither Hello nor Attach came first");
}

void SessionLayer::on_request_channel(ConnectionId id, Connection& connection,
                                      const wire::ClientMessage& message) {
  if (const auto* call = std::get_if<wire::Call>(&message)) return on_call(id, connection, *call);
  if (const auto* wanted = std::get_if<wire::SetResponsiveness>(&message)) {
    return answer(id, find_session(connection.session)->pinger.set(*wanted));
  }
  if (std::holds_alternative<wire::QueryNode>(message)) return on_query_node(id);
  if (!std::holds_alternative<wire::Quit>(message)) {
    return end(id, End::kFault, "out of order: a message not for the request channel");
  }
  const std::uint64_t session = connection.session;
  answer(id, WYX_OK);
  end_session(session, End::kQuit, "quit");
}

void SessionLayer::on_hello(ConnectionId id, Connection& connection, const wire::Hello& hello) {
  if (hello.protocol_version != wire::kProtocolVersion) {
    answer(id, WYX_NOT_SUPPORTED);
    return end(id, End::kFault, "speaks protocol version " + std::to_string(hello.protocol_version));
  }
  const std::uint64_t number = ++last_session_;
  timers_.cancel(connection.handshake);
  connection.channel = Channel::kRequest;
  connection.session = number;
  Session& session = sessions_.try_emplace(number, number, *this).first->second;
  session.request = id;
  session.cookie = env_.random();
  session.program = printable(hello.program);
  session.attach_limit = timers_.arm(env_.now() + settings_.handshake_limit, [this, number] {
    end_session(number, End::kFault, "did not attach its event channel in time");
  });
  send(id, wire::encode(wire::Welcome{settings_.node_number, number, session.cookie}));
}

void SessionLayer::on_attach(ConnectionId id, Connection& connection, const wire::Attach& attach) {
  Session* session = find_session(attach.session_number);
  const bool right = session != nullptr && session->event == 0 && session->cookie == attach.cookie &&
                     find(session->request)->peer.uid == connection.peer.uid;
  if (!right) return end(id, End::kFault, "attaches to a session that is not its own");
  timers_.cancel(connection.handshake);
  timers_.cancel(session->attach_limit);
  connection.channel = Channel::kEvent;
  connection.session = attach.session_number;
  session->event = id;
  log_about(connection.peer.uid, spdlog::level::info, describe(connection) + ": connected");
  answer(id, WYX_OK);
}

void SessionLayer::on_call(ConnectionId id, Connection& connection, const wire::Call& call) {
  Session* session = find_session(connection.session);
  if (session->event == 0) return end(id, End::kFault, "out of order: a request before its event channel");
  if (session->answer_due) return end(id, End::kFault, "out of order: a request before the answer to the last");
  session->answer_due = true;
  env_.ordering.submit(RequestEvent{id_of(connection.session), call.request, false, connection.peer.uid});
}

void SessionLayer::on_query_node(ConnectionId id) {
  // With one host, that host is the domain's master.
  send(id, wire::encode(wire::NodeInfo{settings_.node_number, settings_.node_number}));
}

// ----------------------------------------------------------------------------------------------------- pingers

void SessionLayer::send_ping(std::uint64_t session, std::uint64_t ping) {
  const Session* found = find_session(session);
  if (found != nullptr && found->event != 0) send(found->event, wire::encode(wire::Ping{ping}));
}

void SessionLayer::responding_changed(std::uint64_t session, bool responding) {
  const Session& found = *find_session(session);
  const Connection& request = *find(found.request);
  log_about(request.peer.uid, responding ? spdlog::level::info : spdlog::level::warn,
            describe(request) + (responding ? ": answers pings again" : ": does not answer pings"));
  env_.ordering.submit(ResponsivenessEvent{id_of(session), responding});
}

void SessionLayer::too_slow(std::uint64_t session) {
  end_session(session, End::kFault, "does not answer pings and has asked to be closed then");
}

// ------------------------------------------------------------------------------------------------ ordered side

// What a request brings its own client is written before the answer, the rest after it: a client that wakes for
// its answer finds its notifications there and need not sleep again, and no answer waits for hundreds of sends.
void SessionLayer::ordered(const Event& event) {
  const Outcome outcome = engine_.apply(event);
  if (env_.log->should_log(spdlog::level::debug)) trace(event, outcome);
  const auto* request = std::get_if<RequestEvent>(&event);
  const SessionId asker = request != nullptr ? request->session : SessionId{};
  for (const Delivery& delivery : outcome.deliveries) {
    if (request != nullptr && delivery.to.session == asker) deliver(delivery);
  }
  if (request != nullptr && !request->answered) answer_request(asker, outcome.rc);
  for (const Delivery& delivery : outcome.deliveries) {
    if (request == nullptr || delivery.to.session != asker) deliver(delivery);
  }
  encoded_.clear();
  for (const TimerRequest& timer : outcome.timers) arm(timer);
  if (!engine_.busy() || continue_due_) return;
  continue_due_ = true;
  env_.continue_soon();
}

void SessionLayer::continue_work() {
  continue_due_ = false;
  env_.ordering.submit(ContinueEvent{});
}

void SessionLayer::trace(const Event& event, const Outcome& outcome) {
  const bool is_request = std::holds_alternative<RequestEvent>(event);
  env_.log->debug("{}{}", text(event), is_request ? std::string(": ") + zelt_gscl::gscl_rc_name(outcome.rc) : "");
  for (const Delivery& delivery : outcome.deliveries) {
    env_.log->trace("  to session {}, token {}: {}", delivery.to.session.number, delivery.to.token,
                    text(*delivery.what));
  }
}

void SessionLayer::answer_request(SessionId asker, wyx_rc_t rc) {
  if (asker.node != settings_.node_number) return;
  Session* session = find_session(asker.number);
  if (session == nullptr || !session->answer_due) return;
  session->answer_due = false;
  answer(session->request, rc);
}

void SessionLayer::deliver(const Delivery& delivery) {
  if (delivery.to.session.node != settings_.node_number) return;
  const Session* session = find_session(delivery.to.session.number);
  if (session == nullptr) return;
  wire::Encoded& message = encoded_[delivery.what.get()];
  if (!message) message = wire::encode(wire::Notify{-1, delivery.what});
  send(session->event, message, delivery.to.token);
}

void SessionLayer::arm(const TimerRequest& timer) {
  if (phase_timers_.size() >= sweep_timers_at_) drop_stale_timers();
  PhaseTimer& of_group = phase_timers_[timer.id.group];
  timers_.cancel(of_group.timer);
  timers_.cancel(of_group.warning);
  of_group.phase = timer.id;
  const std::chrono::seconds limit(timer.seconds);
  if (limit.count() == 0 || limit > kLongPhase) {
    of_group.warning = timers_.arm(env_.now() + kLongPhase, [this, id = timer.id] { warn_of_missing_votes(id); });
  }
  if (limit.count() == 0) return;
  of_group.timer = timers_.arm(env_.now() + limit, [this, id = timer.id] {
    phase_timers_.erase(id.group);
    env_.ordering.submit(TimerExpiredEvent{id});
  });
}

void SessionLayer::warn_of_missing_votes(const TimerId& phase) {
  if (!engine_.awaits(phase)) return;
  const MissingVotes missing = engine_.missing_votes(phase.group, kNamedVoters);
  if (missing.count == 0) return;
  std::string names;
  for (const MissingVoter& voter : missing.voters) names += (names.empty() ? "" : ", ") + describe(voter);
  if (missing.count > missing.voters.size()) {
    names += " and " + std::to_string(missing.count - missing.voters.size()) + " more";
  }
  env_.log->warn("group \"{}\": phase {} of a {} protocol has waited {} s for the votes of {}",
                 printable(phase.group), missing.phase, missing.protocol, kLongPhase.count(), names);
}

std::string SessionLayer::describe(const MissingVoter& voter) {
  const std::string provider = "\"" + printable(voter.local_name) + "\" (" + std::to_string(voter.id.instance) +
                               "@" + std::to_string(voter.id.node);
  const Session* session = find_session(voter.to.session.number);
  if (voter.to.session.node != settings_.node_number || session == nullptr) return provider + ")";
  return provider + ", " + describe(*find(session->request)) + ")";
}

/// A phase may end hours before its limit: without this, groups that come and go would leave their timers behind.
void SessionLayer::drop_stale_timers() {
  std::erase_if(phase_timers_, [this](const auto& of_group) {
    PhaseTimer ended = of_group.second;
    if (engine_.awaits(ended.phase)) return false;
    timers_.cancel(ended.timer);
    timers_.cancel(ended.warning);
    return true;
  });
  sweep_timers_at_ = std::max(kFewTimers, 2 * phase_timers_.size());
}

// --------------------------------------------------------------------------------------------- sending, ending

void SessionLayer::send(ConnectionId to, const wire::Encoded& message, Token token) {
  Connection* connection = find(to);
  if (connection == nullptr || said_farewell_) return;
  if (!message) return end(to, End::kFault, "a notification for it is over the limit of a message");
  const bool waited = !connection->out.empty();
  if (!connection->out.push(message, token, settings_.queue_bound)) {
    return end(to, End::kFault,
               "does not drain its notifications: " + std::to_string(connection->out.bytes()) + " bytes wait");
  }
  if (!waited) writable(to);
}

void SessionLayer::end(ConnectionId id, End how, const std::string& why) {
  Connection* connection = find(id);
  if (connection == nullptr) return;
  if (connection->session != 0) return end_session(connection->session, how, why);
  // A connection that asks for the node and goes is nothing to speak of.
  log_about(connection->peer.uid, how == End::kFault ? spdlog::level::warn : spdlog::level::debug,
            describe(*connection) + ": closed: " + why);
  drop(id);
}

void SessionLayer::end_session(std::uint64_t number, End how, const std::string& why) {
  const auto found = sessions_.find(number);
  if (found == sessions_.end()) return;
  const Connection& closed = *find(found->second.request);
  log_about(closed.peer.uid, how == End::kFault ? spdlog::level::warn : spdlog::level::info,
            describe(closed) + ": closed: " + why);
  const ConnectionId request = found->second.request;
  const ConnectionId event = found->second.event;
  timers_.cancel(found->second.attach_limit);
  sessions_.erase(found);
  drop(request);
  if (event != 0) drop(event);
  env_.ordering.submit(SessionGoneEvent{id_of(number)});
}

void SessionLayer::drop(ConnectionId id) {
  const auto found = connections_.find(id);
  timers_.cancel(found->second.handshake);
  connections_.erase(found);
  env_.transport.close(id);
}

void SessionLayer::log_about(std::optional<std::uint32_t> user, spdlog::level::level_enum level,
                             const std::string& line) {
  const Time now = env_.now();
  if (!client_log_.write(user, level, line, now)) return;
  timers_.arm(now + platform::ClientLog::kTellAfter, [this] { client_log_.tell_left_out(); });
}

std::string SessionLayer::describe(const Connection& connection) const {
  const std::string peer =
      "pid " + std::to_string(connection.peer.pid) + ", uid " + std::to_string(connection.peer.uid);
  const auto session = sessions_.find(connection.session);
  if (session == sessions_.end()) return "connection (" + peer + ")";
  return "session " + std::to_string(session->first) + " (\"" + session->second.program + "\", " + peer + ")";
}

std::vector<SessionLayer::SessionStatus> SessionLayer::status() const {
  std::vector<SessionStatus> result;
  const auto bytes_for = [&](ConnectionId id) {
    const auto found = connections_.find(id);
    return found == connections_.end() ? 0 : found->second.out.bytes();
  };
  for (const auto& [number, session] : sessions_) {
    const auto request = connections_.find(session.request);
    const Peer peer = request == connections_.end() ? Peer{} : request->second.peer;
    result.push_back(
        {number, session.program, peer.pid, peer.uid, bytes_for(session.request), bytes_for(session.event)});
  }
  std::sort(result.begin(), result.end(), [](const auto& a, const auto& b) { return a.number < b.number; });
  return result;
}

}  // namespace gs::daemon
