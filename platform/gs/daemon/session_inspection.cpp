// The session layer asked about itself: reports and taps.
#include <algorithm>

#include "common/printable.h"
#include "daemon/session_layer.h"

namespace gs::daemon {
namespace {

bool names_sessions(inspect::What what) {
  return what == inspect::What::Members || what == inspect::What::Subscribers || what == inspect::What::Sessions;
}

}  // namespace

void SessionLayer::on_inspect(ConnectionId id, Connection& connection, const wire::Inspect& inspect) {
  std::string error;
  const auto ask = inspect::read_ask(std::as_bytes(std::span(inspect.ask)), &error);
  if (!ask) return end(id, End::kFault, "malformed: " + error);
  timers_.cancel(connection.handshake);
  connection.channel = Channel::kInspect;
  if (ask->what == inspect::What::Tap) return begin_tap(id, connection, *ask);
  send(id, wire::Report{inspect::write(this->inspect(*ask))});
}

inspect::ReportT SessionLayer::inspect(const inspect::AskT& ask) const {
  return report(ask, {.engine = *engine_,
                      .domain = domain(),
                      .will_serve = env_.ordering.will_serve(),
                      .ordering = settings_.ordering,
                      .version = settings_.version,
                      .node = settings_.node,
                      .now = env_.now(),
                      .started = started_,
                      .counters = counters_,
                      .waiting_bytes = accounts_.waiting(),
                      .session_count = sessions_.size(),
                      .sessions = names_sessions(ask.what) ? session_statuses() : std::vector<SessionStatus>()});
}

std::vector<SessionStatus> SessionLayer::session_statuses() const {
  std::vector<SessionStatus> all;
  const auto bytes_for = [&](ConnectionId id) {
    const auto found = connections_.find(id);
    return found == connections_.end() ? 0 : found->second.out.bytes();
  };
  for (const auto& [number, session] : sessions_) {
    const Peer& peer = connections_.at(session.request).peer;
    all.push_back({number, session.program, peer.pid, peer.uid, bytes_for(session.request),
                   bytes_for(session.event), session.pinger.responding(), session.since});
  }
  std::ranges::sort(all, {}, &SessionStatus::number);
  return all;
}

// ---------------------------------------------------------------------------------------------------- taps

void SessionLayer::begin_tap(ConnectionId id, Connection& connection, const inspect::AskT& ask) {
  if (taps_.full()) return refuse(id, "there are " + std::to_string(Taps::kMost) + " taps already");
  connection.channel = Channel::kTap;
  taps_.add(id, ask);
  engine_->observe(&taps_);
  send(id, wire::Report{inspect::write(inspect::ReportT())});  // from here on nothing is left out
}

void SessionLayer::remove_tap(ConnectionId id) {
  taps_.remove(id);
  if (taps_.empty()) engine_->observe(nullptr);
}

void SessionLayer::feed_taps_soon() {
  if (feed_taps_.number != 0 || !taps_.waiting()) return;
  feed_taps_ = timers_.arm(std::max(env_.now(), fed_taps_ + kTapPause), [this] { feed_taps(); });
}

void SessionLayer::feed_taps() {
  feed_taps_ = {};
  fed_taps_ = env_.now();
  for (const ConnectionId id : taps_.ids()) feed_tap(id);
}

/// With so much for each, all taps together bring no user near the bound over which connections are closed.
std::size_t SessionLayer::tap_bound() const {
  return std::min(kTapBound, accounts_.limits().user_queue_bound / (2 * Taps::kMost));
}

/// Only what it has room for; what it misses is counted, and told when it has taken something.
void SessionLayer::feed_tap(ConnectionId id) {
  for (;;) {
    const Connection* connection = find(id);
    if (connection == nullptr) return;
    if (connection->out.bytes() > tap_bound()) return void(counters_.missed += taps_.drop(id));
    const inspect::ReportT report = taps_.take(id);
    if (report.happenings.empty() && report.missed == 0) return;
    send(id, wire::Report{inspect::write(report)});
  }
}

}  // namespace gs::daemon
