#include "daemon/session_layer.h"

#include <algorithm>

#include "common/printable.h"
#include "engine/text.h"
#include "gscl/GSUtils.h"

namespace gs::daemon {
namespace {

/// Of what ends something or is waited for there is always room for one more.
bool needs_memory(const Request& request) {
  return !std::holds_alternative<LeaveRequest>(request) && !std::holds_alternative<GoodbyeRequest>(request) &&
         !std::holds_alternative<VoteRequest>(request) && !std::holds_alternative<UnsubscribeRequest>(request);
}

}  // namespace

SessionLayer::SessionLayer(const Settings& settings, Environment environment)
    : settings_(settings),
      env_(std::move(environment)),
      client_log_(*env_.log),
      engine_(std::make_unique<Engine>(settings.engine)),
      accounts_(settings.limits),
      started_(env_.now()) {
  for (std::size_t rc = 0; rc < answers_.size(); ++rc) {
    answers_[rc] = wire::encode(wire::Answer{static_cast<wyx_rc_t>(rc)});
  }
  env_.ordering.start(*this);
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

void SessionLayer::set_bounds(std::size_t queue_bound, Duration drain_time, const ClientLimits& limits) {
  settings_.queue_bound = queue_bound;
  settings_.drain_time = drain_time;
  accounts_.set_limits(limits);
}

void SessionLayer::opened(ConnectionId id, const Peer& peer) {
  Connection& connection = connections_.try_emplace(id, peer, accounts_, recent_).first->second;
  ++counters_.connections;
  if (const char* problem = accounts_.problem_with_connection(connection.share.account())) {
    return refuse(id, problem);
  }
  connection.handshake = timers_.arm(env_.now() + settings_.handshake_limit, [this, id] { handshake_over(id); });
}

void SessionLayer::handshake_over(ConnectionId id) {
  if (!find(id)->hello) return end(id, End::kFault, "said neither Hello nor Attach in time");
  answer(id, WYX_CONNECT_FAILED);
  end(id, End::kGone, "this host still waits for others");
}

void SessionLayer::received(ConnectionId id, std::span<const std::byte> packet) {
  Connection* connection = find(id);
  if (connection == nullptr) return;
  std::string error;
  if (!connection->in.add(packet, &error)) return end(id, End::kFault, "malformed: " + error);
  if (!connection->in.complete()) return on_part_of_message(id, *connection);
  timers_.cancel(connection->message_limit);
  connection->share.set_half_received(0);
  auto message = connection->in.take_client_message(&error);
  if (!message) return end(id, End::kFault, "malformed: " + error);
  on_message(id, *connection, *message);
  enforce_bounds();
}

void SessionLayer::writable(ConnectionId id) { flush(id, kFlushShare); }

void SessionLayer::flush(ConnectionId id, std::size_t share) {
  Connection* connection = find(id);
  if (connection == nullptr) return;
  const std::uint64_t sent = connection->out.sent();
  if (!handle(id, connection->out.flush(env_.transport, id, share))) return;
  if (connection->out.sent() != sent) connection->progressed = env_.now();
  if (!connection->out.empty()) env_.transport.wait_writable(id);
  if (connection->channel == Channel::kTap) feed_taps_soon();
  watch_bound(id, *connection);
  note_freed();
}

void SessionLayer::failed(ConnectionId id, const std::string& why) { end(id, End::kFault, why); }

void SessionLayer::set_short_of_memory(bool is_short) {
  short_of_memory_ = is_short;
  if (!is_short) return;
  recent_.drop();
  ConnectionId id = 0;
  for (const auto of : {Accounts::Overdraft::Of::kAllButRoot, Accounts::Overdraft::Of::kRoot}) {
    const Connection* most = most_waiting({of}, false, &id);
    if (most == nullptr || most->out.bytes() < kWorthClosing) continue;
    return end(id, End::kFault, "out of memory, and it has the most to read");
  }
}

void SessionLayer::lost(ConnectionId id, const std::string& why) {
  if (find(id) != nullptr) end(id, End::kGone, why);
}

void SessionLayer::say_farewell() {
  client_log_.tell_left_out();
  std::vector<ConnectionId> channels;
  for (const auto& [number, session] : sessions_) {
    if (session.event != 0) channels.push_back(session.event);
  }
  said_farewell_ = true;  // to those who end meanwhile too nothing else is said
  for (const ConnectionId id : channels) put(id, {farewell_}, true);
}

bool SessionLayer::drained() const {
  return std::all_of(connections_.begin(), connections_.end(), [](const auto& c) { return c.second.out.empty(); });
}

// ---------------------------------------------------------------------------------------------------- messages

/// It comes to its end in time, and a user has so much of them and no more.
void SessionLayer::on_part_of_message(ConnectionId id, Connection& connection) {
  connection.share.set_half_received(connection.in.held());
  if (const char* problem = accounts_.problem_with_half_received(connection.share.account())) {
    return end(id, End::kFault, problem);
  }
  if (connection.message_limit.number != 0) return;
  connection.message_limit = timers_.arm(env_.now() + settings_.handshake_limit, [this, id] {
    end(id, End::kFault, "has not finished its message in time");
  });
}

void SessionLayer::on_message(ConnectionId id, Connection& connection, wire::ClientMessage& message) {
  switch (connection.channel) {
    case Channel::kFresh:
      return on_fresh(id, connection, message);
    case Channel::kRequest:
      return on_request_channel(id, connection, message);
    case Channel::kEvent:
      break;
    case Channel::kInspect:
    case Channel::kTap: {
      const auto* inspect = std::get_if<wire::Inspect>(&message);
      if (inspect != nullptr && connection.channel == Channel::kInspect)
        return on_inspect(id, connection, *inspect);
      return end(id, End::kFault, "out of order: a message not for a connection that inspects");
    }
  }
  const auto* ping_answer = std::get_if<wire::PingAnswer>(&message);
  if (ping_answer == nullptr) return end(id, End::kFault, "out of order: a message not for the event channel");
  if (Session* session = find_session(connection.session)) session->pinger.answered(*ping_answer);
}

void SessionLayer::on_fresh(ConnectionId id, Connection& connection, const wire::ClientMessage& message) {
  if (const auto* hello = std::get_if<wire::Hello>(&message)) return on_hello(id, connection, *hello);
  if (const auto* attach = std::get_if<wire::Attach>(&message)) return on_attach(id, connection, *attach);
  if (const auto* inspect = std::get_if<wire::Inspect>(&message)) return on_inspect(id, connection, *inspect);
  if (on_query(id, message)) return;
  end(id, End::kFault, "out of order: neither Hello nor Attach came first");
}

void SessionLayer::on_request_channel(ConnectionId id, Connection& connection, wire::ClientMessage& message) {
  if (auto* call = std::get_if<wire::Call>(&message)) return on_call(id, connection, *call);
  if (const auto* wanted = std::get_if<wire::SetResponsiveness>(&message)) {
    return answer(id, find_session(connection.session)->pinger.set(*wanted));
  }
  if (const auto* answer = std::get_if<wire::QuorumAnswer>(&message)) {
    return on_quorum_answer(id, connection, *answer);
  }
  if (on_query(id, message)) return;
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
  if (serving_) return begin_session(id, connection, hello);
  if (env_.ordering.will_serve()) return void(connection.hello = hello);
  answer(id, WYX_CONNECT_FAILED);
  end(id, End::kGone, "this host has no quorum, or no Corosync");
}

/// Of those who wait for it: clients are served now, or there is no hope of it.
void SessionLayer::answer_hellos() {
  std::vector<ConnectionId> waiting;
  for (const auto& [id, connection] : connections_)
    if (connection.hello) waiting.push_back(id);
  std::ranges::sort(waiting);
  for (const ConnectionId id : waiting) {
    Connection* connection = find(id);
    if (connection == nullptr || !connection->hello) continue;
    const wire::Hello hello = *std::exchange(connection->hello, std::nullopt);
    on_hello(id, *connection, hello);
  }
}

void SessionLayer::begin_session(ConnectionId id, Connection& connection, const wire::Hello& hello) {
  Account& account = connection.share.account();
  const char* problem = short_of_memory_ ? "out of memory" : accounts_.problem_with_session(account);
  if (problem != nullptr) return refuse(id, problem);
  if (!env_.transport.watch_process(id)) return end(id, End::kGone, "its process has ended");
  const std::uint64_t number = ++last_session_;
  timers_.cancel(connection.handshake);
  Session& session = sessions_.try_emplace(number, number, account, *this).first->second;
  connection.channel = Channel::kRequest;
  connection.session = number;
  session.request = id;
  session.cookie = env_.random();
  session.since = env_.now();
  ++counters_.sessions;
  session.domain = DomainListener(hello.socket_control);
  session.program = printable(hello.program);
  session.program.resize(platform::utf8_length(std::string_view(session.program).substr(0, kProgramName)));
  session.attach_limit = timers_.arm(env_.now() + settings_.handshake_limit, [this, number] {
    end_session(number, End::kFault, "did not attach its event channel in time");
  });
  send(id, wire::Welcome{domain_.self, number, session.cookie});
}

void SessionLayer::on_attach(ConnectionId id, Connection& connection, const wire::Attach& attach) {
  Session* session = find_session(attach.session_number);
  const bool known = session != nullptr && session->event == 0 && session->cookie == attach.cookie;
  const Peer* opener = known ? &find(session->request)->peer : nullptr;
  if (!known || opener->uid != connection.peer.uid || opener->pid != connection.peer.pid)
    return end(id, End::kFault, "attaches to a session that is not its own");
  timers_.cancel(connection.handshake);
  timers_.cancel(session->attach_limit);
  connection.channel = Channel::kEvent;
  connection.session = attach.session_number;
  connection.share.settle();
  find(session->request)->share.settle();
  session->event = id;
  log_about(connection.peer.uid, spdlog::level::info, describe(connection) + ": connected");
  const auto greeting = session->domain.greeting(engine_->domain());
  answer(id, WYX_OK);  // may end the session
  for (const DomainNotification& news : greeting) tell_of_domain(attach.session_number, packets_of(news), true);
}

void SessionLayer::on_call(ConnectionId id, Connection& connection, wire::Call& call) {
  Session* session = find_session(connection.session);
  if (session->event == 0) return end(id, End::kFault, "out of order: a request before its event channel");
  if (session->answer_due) return end(id, End::kFault, "out of order: a request before the answer to the last");
  const bool has_room = !short_of_memory_ && env_.ordering.has_room();
  if (!has_room && needs_memory(call.request)) return answer(id, WYX_NO_MEMORY);
  session->answer_due = true;
  ++counters_.requests;
  env_.ordering.submit(
      RequestEvent{id_of(connection.session), std::move(call.request), false, connection.peer.uid});
}

/// A refusal is also told where quorum is told: who answers need not be who looks at the result.
void SessionLayer::on_quorum_answer(ConnectionId id, const Connection& connection,
                                    const wire::QuorumAnswer& quorum_answer) {
  const std::uint64_t number = connection.session;
  Session* session = find_session(number);
  if (session->event == 0) return end(id, End::kFault, "out of order: an answer before its event channel");
  const wyx_rc_t rc = session->domain.answered(quorum_answer.sequence);
  const DomainNotification refusal = QuorumErrorNotification{quorum_answer.sequence, rc};
  if (rc != WYX_OK && session->domain.hears(refusal)) tell_of_domain(number, packets_of(refusal), true);
  answer(id, rc);
}

/// False: it is none.
bool SessionLayer::on_query(ConnectionId id, const wire::ClientMessage& message) {
  const auto* adapters = std::get_if<wire::QueryAdapters>(&message);
  if (adapters == nullptr && !std::holds_alternative<wire::QueryNode>(message)) return false;
  if (!serving_)
    answer(id, WYX_CONNECT_FAILED);
  else if (adapters != nullptr)
    on_query_adapters(id, *adapters);
  else
    on_query_node(id);
  return true;
}

void SessionLayer::on_query_node(ConnectionId id) {
  send(id, wire::NodeInfo{domain_.self, engine_->hosts().begin()->first});
}

void SessionLayer::on_query_adapters(ConnectionId id, const wire::QueryAdapters& query) {
  const auto& hosts = engine_->hosts();
  if (!query.address) {
    const auto host = hosts.find(query.node);
    return send(id, wire::NodeAdapters{query.node, host == hosts.end() ? Adapters() : host->second.adapters});
  }
  for (const auto& [node, host] : hosts) {
    const auto found = std::ranges::find(host.adapters, *query.address, &Adapter::address);
    if (found != host.adapters.end()) return send(id, wire::NodeAdapters{node, {*found}});
  }
  send(id, wire::NodeAdapters{});
}

// ----------------------------------------------------------------------------------------------------- pingers

void SessionLayer::send_ping(std::uint64_t session, std::uint64_t ping) {
  const Session* found = find_session(session);
  if (found == nullptr || found->event == 0) return;
  ++counters_.pings;
  try {
    send(found->event, wire::Ping{ping});
  } catch (const std::exception& error) {
    end_session(session, End::kFault, std::string("it could not be sent its ping: ") + error.what());
  }
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

void SessionLayer::apply(const Event& event) {
  const char* failed = "finished: ";
  try {
    const Outcome outcome = engine_->apply(event, env_.now().count());
    failed = "told: ";
    deliver(event, outcome);
  } catch (const std::exception& error) {
    return env_.ordering.fail(std::string("an event could not be ") + failed + error.what());
  }
  enforce_bounds();
  note_freed();
}

// What a request brings its own client is written before the answer, the rest after it: a client that wakes for
// its answer finds its notifications there and need not sleep again, and no answer waits for hundreds of sends.
void SessionLayer::deliver(const Event& event, const Outcome& outcome) {
  if (env_.log->should_log(spdlog::level::debug)) trace(event, outcome);
  const auto* request = std::get_if<RequestEvent>(&event);
  const SessionId asker = request != nullptr ? request->session : SessionId{};
  sent_at_once_ = 0;
  for (const DomainNotification& news : outcome.domain) tell_of_domain(news);
  if (request != nullptr) {
    deliver_to(outcome.deliveries, [&](const Delivery& d) { return d.to.session == asker; });
    if (!request->answered) answer_request(asker, outcome.rc);
  }
  deliver_to(outcome.deliveries, [&](const Delivery& d) { return request == nullptr || d.to.session != asker; });
  forget_outgoing();
  if (accounts_.waiting() == 0) recent_.drop();
  for (const TimerRequest& timer : outcome.timers) arm(timer);
  continue_later();
  if (!taps_.empty()) feed_taps_soon();
}

/// The first of the hosts does, and each next one a while later: it may be gone.
void SessionLayer::continue_later() {
  if (!engine_->busy() || std::exchange(continue_due_, true)) return;
  if (domain_.rank == 0) return env_.continue_soon();
  timers_.arm(env_.now() + turn(), [this] { continue_work(); });
}

/// Most outcomes have one notification, which needs no table.
std::shared_ptr<Outgoing> SessionLayer::outgoing_of(const std::shared_ptr<const Notification>& what) {
  if (last_outgoing_ && last_outgoing_->what() == what.get()) return last_outgoing_;
  if (last_outgoing_) outgoing_.try_emplace(last_outgoing_->what(), last_outgoing_);
  const auto found = outgoing_.find(what.get());
  last_outgoing_ = found != outgoing_.end() ? found->second : std::make_shared<Outgoing>(what);
  return last_outgoing_;
}

void SessionLayer::tell_of_domain(const DomainNotification& news) {
  std::vector<std::uint64_t> listeners;
  for (const auto& [number, session] : sessions_)
    if (session.event != 0 && session.domain.hears(news)) listeners.push_back(number);
  if (listeners.empty()) return;
  const wire::Encoded packets = packets_of(news);
  for (const std::uint64_t number : listeners) {
    const bool at_once = sent_at_once_ < kEventShare;
    if (at_once) sent_at_once_ += packets.size();
    tell_of_domain(number, packets, at_once);
  }
}

void SessionLayer::tell_of_domain(std::uint64_t number, const wire::Encoded& news, bool at_once) {
  const Session* session = find_session(number);
  if (session == nullptr) return;
  try {
    put(session->event, {news}, at_once);
  } catch (const std::exception& error) {
    end_session(number, End::kFault, std::string("it could not be told of the domain: ") + error.what());
  }
}

/// To clear a table costs what it once held: after a large outcome a new one.
void SessionLayer::forget_outgoing() {
  last_outgoing_.reset();
  if (outgoing_.bucket_count() > kFewOutgoing)
    outgoing_ = {};
  else if (!outgoing_.empty())
    outgoing_.clear();
}

void SessionLayer::continue_work() {
  continue_due_ = false;
  if (engine_->busy()) env_.ordering.submit(ContinueEvent{});
}

void SessionLayer::serve(const Domain& domain) {
  domain_ = domain;
  if (std::exchange(serving_, true)) return;
  last_session_ = std::max(last_session_, domain.sessions_above);
  for (const TimerRequest& timer : engine_->running_phases()) arm(timer);
  continue_later();
  if (env_.adapters) look_at_adapters_ = timers_.arm(env_.now(), [this] { publish_adapters(); });
  answer_hellos();
}

/// Whenever they are other ones than the others know.
void SessionLayer::publish_adapters() {
  look_at_adapters_ = timers_.arm(env_.now() + kBetweenAdapterLooks, [this] { publish_adapters(); });
  Adapters now = env_.adapters();
  if (published_ == now) return;
  env_.ordering.submit(AdaptersEvent{domain_.self, now});
  published_ = std::move(now);
}

bool SessionLayer::restore(const SnapshotBytes& snapshot, std::string* error) {
  return engine_->restore(snapshot, error);
}

void SessionLayer::drop_clients(const std::string& why) {
  env_.log->error("{}; all sessions are closed", why);
  forget_sessions();
}

void SessionLayer::reset(const std::string& why) {
  env_.log->critical("{}; all sessions are closed and all groups end", why);
  forget_sessions();
  engine_ = std::make_unique<Engine>(settings_.engine);
  engine_->observe(taps_.empty() ? nullptr : &taps_);
  return_memory_soon();
}

void SessionLayer::forget_sessions() {
  serving_ = false;
  timers_.cancel(look_at_adapters_);
  published_.reset();
  while (!sessions_.empty()) {
    const ConnectionId request = sessions_.begin()->second.request, event = sessions_.begin()->second.event;
    timers_.cancel(sessions_.begin()->second.attach_limit);
    sessions_.erase(sessions_.begin());
    drop(request);
    if (event != 0) drop(event);
  }
  for (auto& [group, of_group] : phase_timers_) timers_.cancel(of_group.timer);
  phase_timers_.clear();
  feed_taps();
  for (const ConnectionId id : taps_.ids()) drop(id);  // what they saw does not go on
  answer_hellos();
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
  if (asker.node != domain_.self) return;
  Session* session = find_session(asker.number);
  if (session == nullptr || !session->answer_due) return;
  session->answer_due = false;
  if (rc != WYX_OK) ++counters_.refused;
  answer(session->request, rc);
}

template <typename Wanted>
void SessionLayer::deliver_to(const std::vector<Delivery>& deliveries, Wanted wanted) {
  run_.clear();
  for (const Delivery& delivery : deliveries) {
    if (delivery.to.session.node != domain_.self || !wanted(delivery)) continue;
    if (!run_.empty() && run_.back()->what != delivery.what) deliver_run();
    run_.push_back(&delivery);
  }
  deliver_run();
}

/// One notification to all of the run. Each endpoint has the notifications in their order, also when the endpoints
/// of a session are served together.
void SessionLayer::deliver_run() {
  if (run_.empty()) return;
  const auto session_of = [](const Delivery* d) { return d->to.session.number; };
  if (!std::ranges::is_sorted(run_, {}, session_of)) std::ranges::stable_sort(run_, {}, session_of);
  const std::shared_ptr<Outgoing> what = outgoing_of(run_.front()->what);
  for (auto first = run_.begin(); first != run_.end();) {
    const auto last =
        std::find_if(first, run_.end(), [&](const Delivery* d) { return d->to.session != (*first)->to.session; });
    deliver_to_session({first, last}, what);
    first = last;
  }
  run_.clear();
}

void SessionLayer::deliver_to_session(std::span<const Delivery* const> to, const std::shared_ptr<Outgoing>& what) {
  const std::uint64_t number = to.front()->to.session.number;
  const Session* session = find_session(number);
  if (session == nullptr) return;
  const ConnectionId event = session->event;
  const bool at_once = sent_at_once_ < kEventShare;
  if (at_once) sent_at_once_ += what->size();
  counters_.notifications += to.size();
  try {
    if (to.size() == 1) return void(put(event, {{}, what, to.front()->to.token}, at_once));
    wire::Fanout fanout;
    for (const Delivery* delivery : to) fanout.tokens.push_back(delivery->to.token);
    if (put(event, {wire::encode(fanout)}, at_once) && put(event, {{}, what}, at_once)) {
      put(event, {fanout_end_}, at_once);
    }
  } catch (const std::exception& error) {
    end_session(number, End::kFault, std::string("it could not be sent its notification: ") + error.what());
  }
}

void SessionLayer::arm(const TimerRequest& timer) {
  drop_stale_timers();
  const Time now = env_.now();
  PhaseTimer& of_group = phase_timers_[timer.id.group];
  timers_.cancel(of_group.timer);
  of_group = {timer.id, {}, now};
  const std::chrono::seconds limit(timer.seconds);
  if (limit.count() == 0 || limit > kLongPhase) look_at_phases_later();
  if (limit.count() == 0) return;
  of_group.timer = timers_.arm(now + limit + turn(), [this, id = timer.id] {
    phase_timers_.erase(id.group);
    if (engine_->awaits(id)) env_.ordering.submit(TimerExpiredEvent{id});
  });
}

void SessionLayer::look_at_phases_later() {
  if (look_at_phases_.number != 0) return;
  look_at_phases_ = timers_.arm(env_.now() + kBetweenPhaseLooks, [this] { look_at_phases(); });
}

/// One timer for all phases: most of them end long before anybody needs to be warned of them. Looks at some, then
/// others are served before it looks at more.
void SessionLayer::look_at_phases() {
  look_at_phases_ = {};
  const Time now = env_.now();
  auto at = after(looked_at_);
  for (int i = 0; i < kPhasesAtOnce && at != phase_timers_.end(); ++i) {
    looked_at_ = at->first;
    PhaseTimer& of_group = at->second;
    if (drop_if_stale(at)) continue;
    const Duration waited = now - of_group.since;
    if (waited >= kLongPhase && !std::exchange(of_group.warned_of, true))
      warn_of_missing_votes(looked_at_, waited);
    ++at;
  }
  if (at != phase_timers_.end()) {
    look_at_phases_ = timers_.arm(now, [this] { look_at_phases(); });
    return;
  }
  looked_at_.clear();
  if (!phase_timers_.empty()) look_at_phases_later();
}

SessionLayer::PhaseTimers::iterator SessionLayer::after(const std::string& group) {
  return group.empty() ? phase_timers_.begin() : phase_timers_.upper_bound(group);
}

void SessionLayer::warn_of_missing_votes(const std::string& group, Duration waited) {
  const MissingVotes missing = engine_->missing_votes(group, kNamedVoters);
  if (missing.voters.empty()) return;
  std::string names;
  for (const MissingVoter& voter : missing.voters) names += (names.empty() ? "" : ", ") + describe(voter);
  if (missing.count > missing.voters.size()) {
    names += " and " + std::to_string(missing.count - missing.voters.size()) + " more";
  }
  const Connection* first = connection_of(missing.voters.front());
  log_about(first == nullptr ? std::nullopt : std::optional(first->peer.uid), spdlog::level::warn,
            "group \"" + printable(group) + "\": phase " + std::to_string(missing.phase) + " of a " +
                missing.protocol + " protocol has waited " + std::to_string(waited.count() / 1000) +
                " s for the votes of " + names);
}

/// Null: it is no client of this daemon's.
const SessionLayer::Connection* SessionLayer::connection_of(const MissingVoter& voter) {
  if (voter.to.session.node != domain_.self) return nullptr;
  const Session* session = find_session(voter.to.session.number);
  return session == nullptr ? nullptr : find(session->request);
}

std::string SessionLayer::describe(const MissingVoter& voter) {
  const std::string provider = "\"" + printable(voter.local_name) + "\" (" + std::to_string(voter.id.instance) +
                               "@" + std::to_string(voter.id.node);
  const Connection* connection = connection_of(voter);
  return provider + (connection == nullptr ? ")" : ", " + describe(*connection) + ")");
}

/// A phase may end hours before its limit: without this, groups that come and go would leave their timers behind.
/// Two for each new one, so that those of ended phases are never many more than the others.
void SessionLayer::drop_stale_timers() {
  if (phase_timers_.size() < kFewTimers) return;
  auto at = after(swept_);
  for (int i = 0; i < 2 && at != phase_timers_.end(); ++i) {
    swept_ = at->first;
    if (!drop_if_stale(at)) ++at;
  }
  if (at == phase_timers_.end()) swept_.clear();
}

/// Then `at` is the next one.
bool SessionLayer::drop_if_stale(PhaseTimers::iterator& at) {
  if (engine_->awaits(at->second.phase)) return false;
  timers_.cancel(at->second.timer);
  at = phase_timers_.erase(at);
  return true;
}

// --------------------------------------------------------------------------------------------- sending, ending

/// Sends, `at_once` where nothing waits, or queues. False: the connection is not there, or no longer.
bool SessionLayer::put(ConnectionId to, OutQueue::Item&& item, bool at_once) {
  Connection* connection = find(to);
  if (connection == nullptr || (said_farewell_ && item.packets != farewell_)) return false;
  const bool waited = !connection->out.empty();
  if (at_once) {
    if (!handle(to, connection->out.send(std::move(item), env_.transport, to))) return false;
  } else {
    connection->out.push(std::move(item));
  }
  if (connection->out.empty()) return true;
  queued_ = true;
  if (!waited) {
    connection->progressed = env_.now();
    env_.transport.wait_writable(to);
  }
  watch_bound(to, *connection);
  return find(to) != nullptr;
}

/// False: the connection is closed.
bool SessionLayer::handle(ConnectionId id, OutQueue::Sent sent) {
  if (sent == OutQueue::Sent::kGone) end(id, End::kGone, "the peer is gone");
  if (sent == OutQueue::Sent::kTooLarge)
    end(id, End::kFault, "a notification for it is over the limit of a message");
  return sent != OutQueue::Sent::kGone && sent != OutQueue::Sent::kTooLarge;
}

/// Answers come one to a request: whom so many wait for asks without reading them. Of notifications one event may
/// bring a client more than any bound.
void SessionLayer::watch_bound(ConnectionId id, Connection& connection) {
  const std::size_t bytes = connection.out.bytes();
  if (bytes <= settings_.queue_bound || connection.channel == Channel::kTap)
    return timers_.cancel(connection.drain_limit);
  if (connection.channel != Channel::kEvent) {
    return end(id, End::kFault, "asks and does not read the answers: " + std::to_string(bytes) + " bytes wait");
  }
  if (connection.drain_limit.number != 0) return;
  connection.drain_limit = timers_.arm(env_.now() + settings_.drain_time, [this, id] { drain_time_over(id); });
}

/// Before it is judged: all that it has made room for counts. Null: it is closed.
SessionLayer::Connection* SessionLayer::flushed(ConnectionId id) {
  try {
    flush(id, connections_.at(id).out.bytes());
  } catch (const std::exception& error) {
    end(id, End::kFault, std::string("it could not be sent its notifications: ") + error.what());
  }
  return find(id);
}

void SessionLayer::drain_time_over(ConnectionId id) {
  Connection* connection = flushed(id);
  if (connection == nullptr) return;
  connection->drain_limit = {};
  const std::size_t bytes = connection->out.bytes();
  if (bytes <= settings_.queue_bound) return;
  end(id, End::kFault, "does not drain its notifications: " + std::to_string(bytes) + " bytes wait");
}

/// Who goes on reading, or is under the queue bound, loses nothing by what others leave unread, up to twice the
/// bounds: past them nothing else keeps the memory bounded.
void SessionLayer::enforce_bounds() {
  if (!std::exchange(queued_, false)) return;
  note_freed();
  while (close_worst(2)) {
  }
  if (env_.now() < next_look_) return;
  while (close_worst(1)) {
  }
}

/// Of those who are over `times` their bound; once over it, only who is stalled. False: there is nothing more to
/// close, or of no use: a notification that others wait for too stays, and the drain time decides about them.
bool SessionLayer::close_worst(std::size_t times) {
  const auto overdraft = accounts_.overdraft(times);
  if (overdraft.of == Accounts::Overdraft::Of::kNobody) return false;
  const bool only_stalled = times == 1;
  ConnectionId id = 0;
  const Connection* worst = most_waiting(overdraft, only_stalled, &id);
  if (worst == nullptr) {
    next_look_ = env_.now() + kBetweenLooks;
    return false;
  }
  if (only_stalled) {
    worst = flushed(id);
    if (worst == nullptr || !stalled(*worst)) return true;
  }
  const std::size_t bytes = worst->out.bytes();
  const std::size_t before = accounts_.waiting();
  const bool one_user = overdraft.of == Accounts::Overdraft::Of::kUser;
  end(id, End::kFault,
      std::string(one_user ? "its user is over " : "all are over ") + (only_stalled ? "" : "twice ") +
          (one_user ? "user-queue-bound" : "total-queue-bound") +
          (only_stalled ? " and it reads nothing: " : " and it has the most to read: ") + std::to_string(bytes) +
          " bytes wait");
  if (!only_stalled || before >= accounts_.waiting() + bytes / 4) return true;
  next_look_ = env_.now() + settings_.drain_time;
  return false;
}

bool SessionLayer::stalled(const Connection& connection) const {
  return connection.out.bytes() > settings_.queue_bound && env_.now() - connection.progressed >= kStalled;
}

/// Among those whom the overdraft is of.
SessionLayer::Connection* SessionLayer::most_waiting(const Accounts::Overdraft& overdraft, bool only_stalled,
                                                     ConnectionId* id) {
  Connection* most = nullptr;
  for (auto& [candidate, connection] : connections_) {
    if (connection.out.empty() || !overdraft.covers(connection.share.account())) continue;
    if (only_stalled && !stalled(connection)) continue;
    if (most != nullptr && connection.out.bytes() <= most->out.bytes()) continue;
    most = &connection;
    *id = candidate;
  }
  return most;
}

void SessionLayer::note_freed() {
  most_held_ = std::max(most_held_, held());
  const std::size_t freed = most_held_ - held();
  if (freed >= kReturnedAtOnce) return return_memory();
  if (freed >= kMuchFreed) return_memory_soon();
}

void SessionLayer::return_memory_soon() {
  if (return_memory_.number != 0) return;
  return_memory_ = timers_.arm(env_.now() + kBetweenReturns, [this] { return_memory(); });
}

void SessionLayer::return_memory() {
  timers_.cancel(return_memory_);
  most_held_ = held();
  env_.return_memory();
}

/// With an answer, so that the client can say why.
void SessionLayer::refuse(ConnectionId id, const std::string& why) {
  answer(id, WYX_NO_MEMORY);
  const Connection* connection = find(id);
  if (connection == nullptr) return;
  log_about(connection->peer.uid, spdlog::level::warn, describe(*connection) + ": refused: " + why);
  drop(id);
}

void SessionLayer::end(ConnectionId id, End how, const std::string& why) {
  Connection* connection = find(id);
  if (connection == nullptr) return;
  if (connection->session != 0) return end_session(connection->session, how, why);
  if (how == End::kFault) ++counters_.faults;
  // A connection that asks for the node and goes is nothing to speak of.
  log_about(connection->peer.uid, how == End::kFault ? spdlog::level::warn : spdlog::level::debug,
            describe(*connection) + ": closed: " + why);
  drop(id);
}

void SessionLayer::end_session(std::uint64_t number, End how, const std::string& why) {
  const auto found = sessions_.find(number);
  if (found == sessions_.end()) return;
  const Connection& closed = *find(found->second.request);
  if (how == End::kFault) ++counters_.faults;
  log_about(closed.peer.uid, how == End::kFault ? spdlog::level::warn : spdlog::level::info,
            describe(closed) + ": closed: " + why);
  const ConnectionId request = found->second.request;
  const ConnectionId event = found->second.event;
  timers_.cancel(found->second.attach_limit);
  sessions_.erase(found);
  drop(request);
  if (event != 0) drop(event);
  if (said_farewell_) return;  // to other hosts all of this one's end at once, with the reason
  try {
    env_.ordering.submit(SessionGoneEvent{id_of(number)});
  } catch (const std::exception& error) {  // else its members would stay for ever
    env_.ordering.fail(std::string("the end of a session could not be told: ") + error.what());
  }
}

void SessionLayer::drop(ConnectionId id) {
  const auto found = connections_.find(id);
  timers_.cancel(found->second.handshake);
  timers_.cancel(found->second.message_limit);
  timers_.cancel(found->second.drain_limit);
  if (found->second.channel == Channel::kTap) remove_tap(id);
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

}  // namespace gs::daemon
