#include "client/session.h"

#include <sys/epoll.h>

#include <utility>

#include "client/entry_guard.h"
#include "wire/codec.h"

namespace gs::client {
namespace {

// A dispatch that does not wait comes back after so many at the latest, however fast new ones come in.
constexpr int kMaxDeliveries = 4096;

constexpr int kSupportedResponsiveness =
    WYX_PING_RESPONSIVENESS | WYX_KEEP_CHECK_RESPONSIVENESS | WYX_ANNOUNCEMENT_WHEN_SLOW | WYX_CLOSE_CLIENT_SOCKET;

}  // namespace

/// The right to hand out, for as long as it lives.
class Session::Turn {
 public:
  Turn(Session& session, bool blocking, int cancel_state)
      : session_(session), held_(session.begin_turn(blocking, cancel_state)) {}
  ~Turn() {
    if (held_ && !session_.inherited()) session_.end_turn();  // in a child the lock may be lost
  }
  Turn(const Turn&) = delete;
  Turn& operator=(const Turn&) = delete;

  bool held() const { return held_; }

 private:
  Session& session_;
  const bool held_;
};

Session::Session(std::unique_ptr<Transport> transport, const SessionRoutines& routines)
    : transport_(std::move(transport)), routines_(routines) {}

void Session::follow(std::shared_ptr<Session> previous) {
  if (previous->ended_ || previous->quit_) return;
  previous_ = std::move(previous);
  const int both = epoll_create1(EPOLL_CLOEXEC);
  if (both < 0) return;
  for (const int fd : {previous_->descriptor(), transport_->descriptor()}) {
    epoll_event event{};
    event.events = EPOLLIN;
    epoll_ctl(both, EPOLL_CTL_ADD, fd, &event);
  }
  both_.emplace(both);
}

wyx_rc_t Session::check_token(Token token, Client::Kind kind) {
  if (registry_.has(token, kind)) return WYX_OK;
  return gone() ? WYX_NO_INIT : WYX_BAD_MEMBER_TOKEN;
}

wyx_rc_t Session::call(Request request) {
  // The daemon would close a session that sends it such a thing.
  if (wire::problem_with(request) != nullptr) return WYX_BAD_PARAMETER;
  return transport_->call(std::move(request));
}

wyx_rc_t Session::depart(Token token, Request request) {
  const wyx_rc_t rc = call(std::move(request));
  if (rc == WYX_OK) registry_.remove(token);
  return rc;
}

wyx_rc_t Session::set_responsiveness(const wyx_responsiveness_t& settings) {
  const int type = settings.gs_responsiveness_type;
  if ((type & ~kSupportedResponsiveness) != 0) return WYX_NOT_SUPPORTED;
  const bool ping = (type & WYX_PING_RESPONSIVENESS) != 0;
  if (ping && settings.gs_responsiveness_interval == 0) return WYX_BAD_PARAMETER;

  const wyx_responsiveness_t before = exchange_settings(settings);  // now: the first ping may overtake the answer
  const wyx_rc_t rc =
      transport_->set_responsiveness({static_cast<std::uint32_t>(type), settings.gs_responsiveness_interval,
                                      settings.gs_responsiveness_response_time_limit});
  if (rc != WYX_OK) exchange_settings(before);
  return rc;
}

wyx_responsiveness_t Session::exchange_settings(const wyx_responsiveness_t& settings) {
  MutexLock lock(settings_mutex_);
  return std::exchange(settings_, settings);
}

wyx_rc_t Session::dispatch(bool blocking, int cancel_state) {
  while (!inherited()) {
    {
      Turn turn(*this, blocking, cancel_state);
      if (!turn.held()) return WYX_OK;  // another thread is handing out what there is
      const int delivered = drain(quit_);
      if (inherited()) break;
      if (delivered > 0) return WYX_OK;
    }
    if (quit_ || ended_) return WYX_NO_INIT;
    if (!blocking) return WYX_OK;
    CancelWindow window(cancel_state);
    transport_->wait();
  }
  return WYX_NO_INIT;
}

void Session::quit() {
  quit_ = true;
  transport_->quit();
}

bool Session::has_turn() { return turn_depth_ > 0 && pthread_equal(turn_owner_, pthread_self()) != 0; }

/// False: another thread has the turn, and this one is not to wait for it.
bool Session::begin_turn(bool blocking, int cancel_state) {
  MutexLock lock(turn_mutex_);
  while (turn_depth_ > 0 && !has_turn()) {
    if (!blocking) return false;
    CancelWindow window(cancel_state);
    turn_free_.wait(turn_mutex_);
  }
  turn_owner_ = pthread_self();
  level_ = turn_depth_++;
  if (records_.size() < turn_depth_) records_.emplace_back();
  return true;
}

void Session::end_turn() {
  MutexLock lock(turn_mutex_);
  --turn_depth_;
  if (turn_depth_ > 0) {
    level_ = turn_depth_ - 1;
  } else {
    turn_free_.notify_all();
  }
}

int Session::drain(const std::atomic<bool>& stop) {
  int delivered = 0;
  if (const auto previous = previous_) {  // kept here: a dispatch nested in it may be the one that ends it
    delivered = previous->hand_out_rest(stop);
    if (previous->ended_) previous_.reset();
  }
  while (delivered < kMaxDeliveries && !stop && !inherited()) {
    const Step step = deliver_next();
    if (step == Step::kNothing) break;
    if (step == Step::kDelivered) ++delivered;
  }
  return delivered;
}

/// Of the session before the one that the caller hands out for.
int Session::hand_out_rest(const std::atomic<bool>& stop) {
  Turn turn(*this, false, PTHREAD_CANCEL_DISABLE);
  return turn.held() ? drain(stop) : 0;
}

Session::Step Session::deliver_next() {
  if (gone_seen_) return tell_of_the_end();
  Incoming incoming = transport_->take();
  switch (incoming.kind) {
    case Incoming::Kind::kNothing:
      records_[level_].begin(nullptr);
      return Step::kNothing;
    case Incoming::Kind::kNotification: {
      const Notification& what = *incoming.what;
      records_[level_].begin(std::move(incoming.what));
      return deliver(incoming.token, what);
    }
    case Incoming::Kind::kPing:
      return answer_ping(incoming.ping);
    case Incoming::Kind::kDomain:
      return deliver(*incoming.domain);
    case Incoming::Kind::kGone:
      break;
  }
  if (quit_) return Step::kNothing;
  gone_seen_ = true;
  registry_.close();
  return tell_of_the_end();
}

Session::Step Session::deliver(Token token, const Notification& notification) {
  const auto client = registry_.addressee(token, notification);
  if (!client) return Step::kDropped;
  return std::visit([&](const auto& n) { return deliver(token, *client, n); }, notification);
}

Session::Step Session::deliver(Token token, const Client& client, const ProtocolNotification& n) {
  Records& records = records_[level_];
  if (n.type == WYX_N_PHASE_NOTIFICATION && client.n_phase != nullptr) {
    client.n_phase(records.n_phase(token, n));
    return Step::kDelivered;
  }
  if (n.type == WYX_APPROVED_NOTIFICATION && client.approved != nullptr) {
    client.approved(records.approved(token, n));
    return Step::kDelivered;
  }
  if (n.type == WYX_REJECTED_NOTIFICATION && client.rejected != nullptr) {
    client.rejected(records.rejected(token, n));
    return Step::kDelivered;
  }
  return Step::kDropped;
}

Session::Step Session::deliver(Token token, const Client& client, const AnnouncementNotification& n) {
  if (client.announcement == nullptr) return Step::kDropped;
  client.announcement(records_[level_].announcement(token, n));
  return Step::kDelivered;
}

Session::Step Session::deliver(Token token, const Client& client, const SubscriptionNotification& n) {
  if (client.subscription == nullptr) return Step::kDropped;
  client.subscription(records_[level_].subscription(token, n));
  return Step::kDelivered;
}

Session::Step Session::deliver(Token token, const Client& client, const DelayedErrorNotification& n) {
  if (routines_.delayed_error == nullptr) return Step::kDropped;
  routines_.delayed_error(records_[level_].delayed_error(token, n, client));
  return Step::kDelivered;
}

Session::Step Session::deliver(const DomainNotification& news) {
  if (routines_.domain_control == nullptr) return Step::kDropped;
  if (const auto* quorum = std::get_if<QuorumNotification>(&news)) quorum_ = *quorum;
  routines_.domain_control(records_[level_].domain(news));
  return Step::kDelivered;
}

/// A client without a routine for it answers by dispatching at all.
Session::Step Session::answer_ping(std::uint64_t number) {
  if (routines_.responsiveness == nullptr) {
    transport_->answer_ping(number, true);
    return Step::kDropped;
  }
  wyx_responsiveness_t settings;
  {
    MutexLock lock(settings_mutex_);
    settings = settings_;
  }
  const wyx_callback_rc_t answer = routines_.responsiveness(records_[level_].ping(settings));
  if (!inherited()) transport_->answer_ping(number, answer == WYX_CALLBACK_OK);
  return Step::kDelivered;
}

/// Without group services there is no quorum to rely on, whatever has become of them: told first, and never by a
/// daemon, whose word might not come. Then tells the next client that group services are gone; with the last one
/// the descriptor falls silent.
Session::Step Session::tell_of_the_end() {
  if (quorum_ && quorum_->now != WYX_QUORUM_STATE_NONE)
    return deliver(QuorumNotification{0, quorum_->now, WYX_QUORUM_STATE_NONE, quorum_->seqnum});
  const auto next = registry_.take_oldest();
  if (registry_.drained() && !ended_.exchange(true)) transport_->silence();
  if (!next) return Step::kNothing;
  const auto& [token, client] = *next;
  if (client.kind == Client::Kind::kProvider) {
    return deliver(token, client, AnnouncementNotification{WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY, nullptr});
  }
  SubscriptionNotification end;
  end.type = WYX_SUBSCRIPTION_GS_HAS_DIED;
  return deliver(token, client, end);
}

}  // namespace gs::client
