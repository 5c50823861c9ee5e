// The daemon without its descriptors: who is connected, what they may say when, what they are sent.
//
// It is given packets and the time and gives back packets; sockets, signals and the loop are the server's. It puts
// requests through the ordering, applies the ordered events to the engine and hands the notifications to the
// clients.
//
// A connection's life, as state x message -> what happens; any other message closes the connection as malformed:
//
//   state     Hello              Attach             Call (2)    SetResp.    Query (3)  PingAnswer  Quit
//   fresh     Welcome->request   Answer->event      close       close       answer     close       close
//   request   close              close              Answer (1)  Answer      answer     close       Answer, end
//   event     close              close              close       close       close      noted       close
//   inspect   close              close              close       close       close      close       close
//
// Inspect makes a fresh connection one of those that inspect, on which nothing else is said: each is answered with
// a Report. From the one that asks for a tap on, Reports come unasked, and any message closes it.
//
//   (1) once the session's event channel is attached; before that: close.
//   (2) or QuorumAnswer. (3) QueryNode: NodeInfo. QueryAdapters: NodeAdapters.
//
// A Hello waits while the ordering does not serve but will; where there is no hope of that it is refused.
//
// A session lives while both its connections and the process that opened it do. However it ends, its providers
// fail and its subscriptions end.
//
// A client that does not read has what waits for it up to the queue bound, and for a while more: one event may
// bring it any number of notifications at once. Where a user's clients, or all, are over their bound together, who
// has taken nothing for a second is closed at once; over twice the bound whoever has the most to read is.
#pragma once

#include <spdlog/logger.h>

#include <array>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>

#include "common/client_log.h"
#include "daemon/accounts.h"
#include "daemon/inspection.h"
#include "daemon/ordering.h"
#include "daemon/out_queue.h"
#include "daemon/pinger.h"
#include "daemon/taps.h"
#include "daemon/timers.h"
#include "daemon/transport.h"
#include "engine/domain_listener.h"
#include "engine/engine.h"
#include "wire/codec.h"

namespace gs::daemon {

/// Not safe for concurrent use; one thread drives it. No member may be called from inside the transport.
class SessionLayer : private PingSink, private Replica {
 public:
  struct Settings {
    std::size_t queue_bound = 0;  // bytes that may wait for each of a client's channels
    Duration drain_time{10'000};  // that more may wait for its event channel
    ClientLimits limits{};
    Duration handshake_limit{10'000};  // to say Hello or Attach, to attach after Hello, to finish a message
    Limits engine{};
    // For people.
    const char* ordering = "local";
    const char* version = "";
    std::uint32_t node = 0;  // before the ordering names it; 0: not known
  };
  /// What it is given of the outside world.
  struct Environment {
    Transport& transport;
    Ordering& ordering;
    std::function<Time()> now;
    std::function<std::uint64_t()> random;  // not to be guessed by a client
    std::shared_ptr<spdlog::logger> log;
    std::function<void()> continue_soon;          // asks for one call of continue_work, after what else is ready
    std::function<void()> return_memory = [] {};  // that was freed, to the system
    std::function<Adapters()> adapters =
        nullptr;  // of this host, as they are now; null: the others are told of none
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

  /// What was done for this connection has failed; `why` is for the log.
  void failed(ConnectionId id, const std::string& why);
  /// While it is so, whatever would need more memory for long is refused. Closes the client that most waits for.
  void set_short_of_memory(bool is_short);

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

  /// Null: no client is served.
  const Domain* domain() const { return serving_ ? &domain_ : nullptr; }
  /// What it tells of itself; not for a tap.
  inspect::ReportT inspect(const inspect::AskT& ask) const;

  /// Into the log, unless there have been too many such lines of late. `user`: whose doing it is, if anybody's.
  void log_about(std::optional<std::uint32_t> user, spdlog::level::level_enum level, const std::string& line);

  /// Counts for what is queued and who connects from now on.
  void set_bounds(std::size_t queue_bound, Duration drain_time, const ClientLimits& limits);

 private:
  enum class Channel { kFresh, kRequest, kEvent, kInspect, kTap };
  struct Connection {
    Connection(const Peer& of, Accounts& accounts, RecentPackets& recent)
        : peer(of), share(accounts, of.uid), out(share.account(), recent) {}

    const Peer peer;
    Channel channel = Channel::kFresh;
    std::uint64_t session = 0;  // 0: none yet
    ConnectionShare share;
    wire::Assembler in{wire::kMaxClientMessage};
    OutQueue out;
    std::optional<wire::Hello> hello;  // that waits until clients are served
    Timers::Id handshake;
    Timers::Id message_limit;  // while a message is there in part
    Timers::Id drain_limit;    // while more than the queue bound waits
    Time progressed{};         // since when it has been sent nothing, while something waits
  };
  struct Session {
    Session(std::uint64_t number, Account& account, SessionLayer& layer)
        : share(layer.accounts_, account), pinger(number, layer.timers_, layer.env_.now, layer) {}

    ConnectionId request = 0;
    ConnectionId event = 0;  // 0: not attached yet
    std::uint64_t cookie = 0;
    std::string program;
    bool answer_due = false;  // of a Call that is being ordered
    DomainListener domain;
    Time since{};
    Timers::Id attach_limit;
    SessionShare share;
    Pinger pinger;
  };
  struct PhaseTimer {
    TimerId phase;
    Timers::Id timer;
    Time since{};
    bool warned_of = false;
  };
  using PhaseTimers = std::map<std::string, PhaseTimer>;  // by group, which runs one protocol at a time
  enum class End { kQuit, kGone, kFault };
  static constexpr std::size_t kFewOutgoing = 64;
  static constexpr std::size_t kFewTimers = 64;
  static constexpr int kPhasesAtOnce = 256;
  static constexpr std::chrono::seconds kLongPhase{60};  // after which the log names those who have not voted
  static constexpr Duration kBetweenPhaseLooks{10'000};
  static constexpr std::size_t kNamedVoters = 8;
  static constexpr Duration kBetweenRanks{50};
  static constexpr Duration kBetweenAdapterLooks{30'000};
  static constexpr std::size_t kProgramName = 64;                   // bytes of it that the log shows
  static constexpr std::size_t kFlushShare = 64 * 1024;             // bytes to one client before others are served
  static constexpr std::size_t kEventShare = 128 * 1024;            // bytes of one event that are sent at once
  static constexpr std::size_t kWorthClosing = 256 * 1024;          // bytes that wait, when memory is short
  static constexpr std::size_t kMuchFreed = 16 * 1024 * 1024;       // bytes
  static constexpr std::size_t kReturnedAtOnce = 64 * 1024 * 1024;  // bytes; more would keep the loop for long
  static constexpr Duration kBetweenReturns{100};                   // of memory to the system
  static constexpr Duration kStalled{1'000};                        // without progress
  static constexpr Duration kBetweenLooks{100};                     // for those who are stalled
  static constexpr Duration kTapPause{10};                          // in which more is gathered
  static constexpr std::size_t kTapBound = 1024 * 1024;             // bytes that may wait for a tap

  // One message of a client; each may close the connection it came on.
  void handshake_over(ConnectionId id);
  void on_part_of_message(ConnectionId id, Connection& connection);
  void on_message(ConnectionId id, Connection& connection, wire::ClientMessage& message);
  void on_fresh(ConnectionId id, Connection& connection, const wire::ClientMessage& message);
  void on_request_channel(ConnectionId id, Connection& connection, wire::ClientMessage& message);
  void on_hello(ConnectionId id, Connection& connection, const wire::Hello& hello);
  void begin_session(ConnectionId id, Connection& connection, const wire::Hello& hello);
  void answer_hellos();
  void on_attach(ConnectionId id, Connection& connection, const wire::Attach& attach);
  void on_call(ConnectionId id, Connection& connection, wire::Call& call);
  void on_quorum_answer(ConnectionId id, const Connection& connection, const wire::QuorumAnswer& answer);
  bool on_query(ConnectionId id, const wire::ClientMessage& message);
  void on_query_node(ConnectionId id);
  void on_query_adapters(ConnectionId id, const wire::QueryAdapters& query);
  void on_inspect(ConnectionId id, Connection& connection, const wire::Inspect& inspect);
  void begin_tap(ConnectionId id, Connection& connection, const inspect::AskT& ask);
  void remove_tap(ConnectionId id);
  void feed_taps_soon();
  std::size_t tap_bound() const;
  void feed_taps();
  void feed_tap(ConnectionId id);
  std::vector<SessionStatus> session_statuses() const;

  // Of the pingers.
  void send_ping(std::uint64_t session, std::uint64_t ping) override;
  void responding_changed(std::uint64_t session, bool responding) override;
  void too_slow(std::uint64_t session) override;

  // The ordered side.
  void apply(const Event& event) override;
  SnapshotBytes snapshot() override { return engine_->snapshot(); }
  bool restore(const SnapshotBytes& snapshot, std::string* error) override;
  void serve(const Domain& domain) override;
  void wait_no_more() override { answer_hellos(); }
  void drop_clients(const std::string& why) override;
  void reset(const std::string& why) override;
  void forget_sessions();
  void trace(const Event& event, const Outcome& outcome);
  void answer_request(SessionId asker, wyx_rc_t rc);
  void deliver(const Event& event, const Outcome& outcome);
  template <typename Wanted>
  void deliver_to(const std::vector<Delivery>& deliveries, Wanted wanted);
  void deliver_run();
  std::shared_ptr<Outgoing> outgoing_of(const std::shared_ptr<const Notification>& what);
  void tell_of_domain(const DomainNotification& news);
  void tell_of_domain(std::uint64_t session, const wire::Encoded& news, bool at_once);
  static wire::Encoded packets_of(const DomainNotification& news) {
    return wire::encode(wire::DomainControl{std::make_shared<const DomainNotification>(news)});
  }
  void forget_outgoing();
  void deliver_to_session(std::span<const Delivery* const> to, const std::shared_ptr<Outgoing>& what);
  void continue_later();
  Duration turn() const { return kBetweenRanks * domain_.rank; }
  void arm(const TimerRequest& timer);
  void drop_stale_timers();
  bool drop_if_stale(PhaseTimers::iterator& at);
  PhaseTimers::iterator after(const std::string& group);
  void publish_adapters();
  void look_at_phases();
  void look_at_phases_later();
  void warn_of_missing_votes(const std::string& group, Duration waited);
  std::string describe(const MissingVoter& voter);
  const Connection* connection_of(const MissingVoter& voter);
  SessionId id_of(std::uint64_t number) const { return {domain_.self, number}; }

  void send(ConnectionId to, const wire::ServerMessage& message) { put(to, {wire::encode(message)}, true); }
  void answer(ConnectionId to, wyx_rc_t rc) { put(to, {answers_.at(rc)}, true); }
  bool put(ConnectionId to, OutQueue::Item&& item, bool at_once);
  bool handle(ConnectionId id, OutQueue::Sent sent);
  void watch_bound(ConnectionId id, Connection& connection);
  void flush(ConnectionId id, std::size_t share);
  Connection* flushed(ConnectionId id);
  void drain_time_over(ConnectionId id);
  void enforce_bounds();
  bool close_worst(std::size_t times);
  bool stalled(const Connection& connection) const;
  Connection* most_waiting(const Accounts::Overdraft& overdraft, bool only_stalled, ConnectionId* id);
  std::size_t held() const { return accounts_.waiting() + engine_->kept_bytes(); }
  void note_freed();
  void return_memory_soon();
  void return_memory();
  void refuse(ConnectionId id, const std::string& why);

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
  std::unique_ptr<Engine> engine_;
  Timers timers_;
  Accounts accounts_;
  RecentPackets recent_;
  std::unordered_map<ConnectionId, Connection> connections_;
  std::unordered_map<std::uint64_t, Session> sessions_;
  PhaseTimers phase_timers_;  // those of ended phases included
  Timers::Id look_at_phases_;
  Timers::Id look_at_adapters_;
  std::optional<Adapters> published_;  // by this host in this life; nothing: none yet
  std::string looked_at_;              // the group that was looked at last, empty: all were
  std::string swept_;                  // the same, for its timer to be dropped
  // Of the outcome being delivered.
  std::unordered_map<const Notification*, std::shared_ptr<Outgoing>> outgoing_;
  std::shared_ptr<Outgoing> last_outgoing_;
  std::vector<const Delivery*> run_;  // of one notification
  std::size_t sent_at_once_ = 0;      // bytes

  std::array<wire::Encoded, WYX_UNEXPECTED_QUORUM_RESP + 1> answers_;
  const wire::Encoded farewell_ = wire::encode(wire::Farewell{});
  const wire::Encoded fanout_end_ = wire::encode(wire::FanoutEnd{});
  std::uint64_t last_session_ = 0;
  bool queued_ = false;  // something, since the bounds were enforced
  bool short_of_memory_ = false;
  Time next_look_{};           // for those who are stalled
  std::size_t most_held_ = 0;  // bytes, since memory was returned
  Timers::Id return_memory_;
  bool said_farewell_ = false;  // nothing else is sent from then on
  bool continue_due_ = false;   // was asked for
  bool serving_ = false;
  Domain domain_;
  const Time started_;
  Counters counters_;
  Taps taps_;
  Timers::Id feed_taps_;
  Time fed_taps_{};
};

}  // namespace gs::daemon
