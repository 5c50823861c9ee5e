// One session with group services, from wyx_setup to wyx_quit: its clients, its requests, the handing out of its
// notifications.
#pragma once

#include <atomic>
#include <deque>
#include <memory>
#include <optional>

#include "client/fork.h"
#include "client/records.h"
#include "client/registry.h"
#include "client/transport.h"

namespace gs::client {

struct SessionRoutines {
  wyx_responsiveness_cb_t* responsiveness = nullptr;
  wyx_delayed_error_cb_t* delayed_error = nullptr;
  wyx_domain_control_cb_t* domain_control = nullptr;
};

/// Any thread may call any function, also from inside a callback. No lock is held while a callback runs.
class Session {
 public:
  Session(std::unique_ptr<Transport> transport, const SessionRoutines& routines);

  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;

  /// Before the first use: takes over what `previous`, whose group services are gone, has not handed out yet.
  void follow(std::shared_ptr<Session> previous);

  /// This process is the child of a fork in the one that the session belongs to: it must not be used. A dispatch
  /// that is under way across the fork ends.
  bool inherited() const { return generation_ != fork_generation(); }

  int descriptor() const { return both_ ? both_->get() : transport_->descriptor(); }
  std::uint32_t node_number() const { return transport_->node_number(); }
  /// Group services have gone or the session was quit.
  bool gone() { return transport_->gone(); }
  wyx_rc_t query_node(wire::NodeInfo* info) { return transport_->query_node(info); }
  wyx_rc_t query_adapters(const wire::QueryAdapters& query, wire::NodeAdapters* found) {
    return transport_->query_adapters(query, found);
  }
  wyx_rc_t answer_quorum(std::uint64_t sequence) { return transport_->answer_quorum(sequence); }

  /// WYX_OK: `token` is a live client of this kind. WYX_BAD_MEMBER_TOKEN: it is not. WYX_NO_INIT: it is not, and
  /// group services are gone.
  wyx_rc_t check_token(Token token, Client::Kind kind);
  /// A join or a subscription: gives the client its token, in `request` and, when it was accepted, in `*token`.
  template <typename T>
  wyx_rc_t enter(const Client& client, T request, wyx_token_t* token);
  /// Any other request of an existing client.
  wyx_rc_t call(Request request);
  /// A goodbye or the end of a subscription: the client is forgotten when it is accepted.
  wyx_rc_t depart(Token token, Request request);
  wyx_rc_t set_responsiveness(const wyx_responsiveness_t& settings);

  /// Hands out what is there; see wyx_dispatch. `cancel_state` is the caller's, in force while it waits.
  wyx_rc_t dispatch(bool blocking, int cancel_state);
  void quit();

 private:
  enum class Step { kDelivered, kDropped, kNothing };
  class Turn;

  wyx_responsiveness_t exchange_settings(const wyx_responsiveness_t& settings);
  bool begin_turn(bool blocking, int cancel_state);
  void end_turn();
  bool has_turn() GS_REQUIRES(turn_mutex_);

  int drain(const std::atomic<bool>& stop);
  int hand_out_rest(const std::atomic<bool>& stop);
  Step deliver_next();
  Step deliver(Token token, const Notification& notification);
  Step deliver(Token token, const Client& client, const ProtocolNotification& n);
  Step deliver(Token token, const Client& client, const AnnouncementNotification& n);
  Step deliver(Token token, const Client& client, const SubscriptionNotification& n);
  Step deliver(Token token, const Client& client, const DelayedErrorNotification& n);
  Step deliver(const DomainNotification& news);
  Step answer_ping(std::uint64_t number);
  Step tell_of_the_end();

  const std::unique_ptr<Transport> transport_;
  const SessionRoutines routines_;
  const unsigned generation_ = fork_generation();
  std::optional<Descriptor> both_;  // holds the transport's descriptor beside the previous session's
  Registry registry_;
  std::atomic<bool> quit_ = false;
  std::atomic<bool> ended_ = false;  // group services are gone and every client has been told

  Mutex settings_mutex_;
  wyx_responsiveness_t settings_ GS_GUARDED_BY(settings_mutex_) = {};

  // Who hands out: one thread at a time, which may do so again from inside a callback.
  Mutex turn_mutex_;
  Condition turn_free_;  // notified when turn_depth_ becomes 0
  pthread_t turn_owner_ GS_GUARDED_BY(turn_mutex_) = {};
  unsigned turn_depth_ GS_GUARDED_BY(turn_mutex_) = 0;

  // Of the thread that hands out.
  std::deque<Records> records_;  // one for each level of nesting, so that an inner callback spoils no outer record
  std::size_t level_ = 0;
  std::shared_ptr<Session> previous_;  // until its clients have been told
  bool gone_seen_ = false;
  std::optional<QuorumNotification> quorum_;  // as it was told last
};

template <typename T>
wyx_rc_t Session::enter(const Client& client, T request, wyx_token_t* token) {
  const auto added = registry_.add(client);
  if (!added) return WYX_NO_INIT;
  request.token = *added;
  wyx_rc_t rc = call(std::move(request));
  if (rc == WYX_OK && !registry_.accept(*added)) rc = WYX_NO_INIT;
  if (rc == WYX_OK) {
    *token = *added;
  } else {
    registry_.remove(*added);
  }
  return rc;
}

}  // namespace gs::client
