// The daemon without its descriptors: who is connected, what they may say when, what they are sent.
//
// It is given packets and the time and gives back packets; sockets, signals and the loop are the server's. It puts
// requests through the ordering, applies the ordered events to the engine and hands the notifications to the
// clients.
//
// A connection's life, as state x message -> what happens; any other message closes the connection as malformed:
//
//   state     Hello              Attach             Call        SetResp.    QueryNode  PingAnswer  Quit
//   fresh     Welcome->request   Answer->event      close       close       NodeInfo   close       close
//   request   close              close              Answer (1)  Answer      NodeInfo   close       Answer, end
//   event     close              close              close       close       close      noted       close
//
//   (1) once the session's event channel is attached; before that: close.
//
// A session lives while both its connections do. However it ends, its providers fail and its subscriptions end.
#pragma once

#include <spdlog/logger.h>

#include <array>
#include <functional>
#include <memory>
#include <string>
#include <unordered_map>

#include "common/client_log.h"
#include "daemon/ordering.h"
#include "daemon/out_queue.h"
#include "daemon/pinger.h"
#include "daemon/timers.h"
#include "daemon/transport.h"
#include "engine/engine.h"
#include "wire/codec.h"

namespace gs::daemon {

/// Not safe for concurrent use; one thread drives it. No member may be called from inside the transport.
class SessionLayer : private PingSink {
 public:
  struct Settings {
    std::uint32_t node_number = 0;
    std::size_t queue_bound = 0;       // bytes that may wait for each of a client's channels
    Duration handshake_limit{10'000};  // to say Hello or Attach, and to attach after Hello
    Limits engine;
  };
  /// What it is given of the outside world.
  struct Environment {
    Transport& transport;
    Ordering& ordering;
    std::function<Time()> now;
    std::function<std::uint64_t()> random;  // not to be guessed by a client
    std::shared_ptr<spdlog::logger> log;
    std::function<void()> continue_soon;  // asks for one call of continue_work, after what else is ready
  };

  SessionLayer(const Settings& settings, Environment environment);
  SessionLayer(const SessionLayer&) = delete;
  SessionLayer& operator=(const SessionLayer&) = delete;

  // What happened below. A connection that was closed meanwhile is ignored.
  void opened(ConnectionId id, const Peer& peer);
  void received(ConnectionId id, std::span<const std::byte> packet);
  void writable(ConnectionId id);
  /// The peer is gone; `why` is for the log.
  void lost(ConnectionId id, const std::string& why);

  /// When run_timers is to be called next.
  std::optional<Time> next_deadline() const { return timers_.next(); }
  void run_timers() { timers_.run(env_.now()); }

  /// Does the next part of what earlier events have left to do.
  void continue_work();

  /// Tells every client that the daemon is going away; what waits for them still goes out, nothing new does.
  void say_farewell();
  /// True when nothing waits to be sent.
  bool drained() const;

  std::size_t sessions() const { return sessions_.size(); }
  std::size_t phase_timers() const { return phase_timers_.size(); }

  /// For people: a session as it stands.
  struct SessionStatus {
    std::uint64_t number = 0;
    std::string program;
    int pid = 0;
    std::uint32_t uid = 0;
    std::size_t answer_bytes = 0;        // that wait for the client to read them
    std::size_t notification_bytes = 0;  // likewise
  };
  /// In the order of their numbers.
  std::vector<SessionStatus> status() const;
  std::vector<Engine::GroupStatus> groups() const { return engine_.status(); }

  /// Into the log, unless there have been too many such lines of late. `user`: whose doing it is, if anybody's.
  void log_about(std::optional<std::uint32_t> user, spdlog::level::level_enum level, const std::string& line);

  /// Counts for what is queued from now on.
  void set_queue_bound(std::size_t bytes) { settings_.queue_bound = bytes; }

 private:
  enum class Channel { kFresh, kRequest, kEvent };
  struct Connection {
    Peer peer;
    Channel channel = Channel::kFresh;
    std::uint64_t session = 0;  // 0: none yet
    wire::Assembler in{wire::kMaxClientMessage};
    OutQueue out;
    Timers::Id handshake;
  };
  struct Session {
    Session(std::uint64_t number, SessionLayer& layer) : pinger(number, layer.timers_, layer.env_.now, layer) {}

    ConnectionId request = 0;
    ConnectionId event = 0;  // 0: not attached yet
    std::uint64_t cookie = 0;
    std::string program;
    bool answer_due = false;  // of a Call that is being ordered
    Timers::Id attach_limit;
    Pinger pinger;
  };
  enum class End { kQuit, kGone, kFault };
  static constexpr std::size_t kFewTimers = 64;
  static constexpr std::chrono::seconds kLongPhase{60};  // after which the log names those who have not voted
  static constexpr std::size_t kNamedVoters = 8;

  // One message of a client; each may close the connection it came on.
  void on_message(ConnectionId id, Connection& connection, const wire::ClientMessage& message);
  void on_fresh(ConnectionId id, Connection& connection, const wire::ClientMessage& message);
  void on_request_channel(ConnectionId id, Connection& connection, const wire::ClientMessage& message);
  void on_hello(ConnectionId id, Connection& connection, const wire::Hello& hello);
  void on_attach(ConnectionId id, Connection& connection, const wire::Attach& attach);
  void on_call(ConnectionId id, Connection& connection, const wire::Call& call);
  void on_query_node(ConnectionId id);

  // Of the pingers.
  void send_ping(std::uint64_t session, std::uint64_t ping) override;
  void responding_changed(std::uint64_t session, bool responding) override;
  void too_slow(std::uint64_t session) override;

  // The ordered side.
  void ordered(const Event& event);
  void trace(const Event& event, const Outcome& outcome);
  void answer_request(SessionId asker, wyx_rc_t rc);
  void deliver(const Delivery& delivery);
  void arm(const TimerRequest& timer);
  void drop_stale_timers();
  void warn_of_missing_votes(const TimerId& phase);
  std::string describe(const MissingVoter& voter);
  SessionId id_of(std::uint64_t number) const { return {settings_.node_number, number}; }

  void send(ConnectionId to, const wire::Encoded& message, Token token = -1);
  void answer(ConnectionId to, wyx_rc_t rc) { send(to, answers_.at(rc)); }

  /// Closes a connection and, where it has one, its session, with a line in the log.
  void end(ConnectionId id, End how, const std::string& why);
  void end_session(std::uint64_t number, End how, const std::string& why);
  void drop(ConnectionId id);
  std::string describe(const Connection& connection) const;

  Connection* find(ConnectionId id);
  Session* find_session(std::uint64_t number);

  Settings settings_;
  const Environment env_;
  platform::ClientLog client_log_;
  Engine engine_;
  Timers timers_;
  std::unordered_map<ConnectionId, Connection> connections_;
  std::unordered_map<std::uint64_t, Session> sessions_;
  struct PhaseTimer {
    TimerId phase;
    Timers::Id timer;
    Timers::Id warning;
  };
  std::unordered_map<std::string, PhaseTimer> phase_timers_;        // by group, which runs one protocol at a time
  std::size_t sweep_timers_at_ = kFewTimers;                        // phase timers, those of ended phases included
  std::unordered_map<const Notification*, wire::Encoded> encoded_;  // of the outcome being delivered
  std::array<wire::Encoded, WYX_UNEXPECTED_QUORUM_RESP + 1> answers_;
  std::uint64_t last_session_ = 0;
  bool said_farewell_ = false;  // nothing is sent after it
  bool continue_due_ = false;   // was asked for
};

}  // namespace gs::daemon
