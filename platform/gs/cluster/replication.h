// One engine on several hosts: which of the daemons have its state, and in which order they apply what is sent.
//
// A state machine without sockets, clock or threads. It is told what a group of processes with extended virtual
// synchrony tells its members, and what the quorum says; it says what is to be sent, and what the engine is to
// apply. What it promises is said in docs/cluster.md: whoever serves has applied a prefix of one sequence of
// events, only hosts with quorum serve, and what has been applied anywhere is never taken back while a majority
// lives.
//
// Its states, and what each input leads to:
//
//   state     view, ring     quorate      begin of my ring       the last word     event            piece
//   out       joined: wait   join         -                      -                 -                -
//   waiting   wait (1)       begin (2)    exchange: word (3)     -                 kept             -
//   exchange  wait           word         exchange: word         running (4)       kept             -
//   running   wait           -            exchange: word         -                 kept, confirmed  taken (5)
//
//   (1) Every view and every ring, and every eviction, ends what runs and asks for an exchange of its own.
//   (2) By the lowest daemon of the view that is not evicted.
//   (3) Words and begins wait for the verdict that this ring is quorate. Not quorate, this or a later ring: lose.
//   (4) Who has the greatest history is a holder and goes on; it serves once all have confirmed the decision. Who
//       has it not has lost its clients and catches up: it takes the state as the lowest holder sends it.
//   (5) With the last of them it has the state and orders a begin, in which it is a holder.
//
// To lose is to leave the group, drop all clients and all state and begin a new life; who has quorum comes back.
#pragma once

#include <functional>
#include <set>

#include "cluster/exchange.h"
#include "cluster/replica.h"
#include "common/clock.h"

namespace gs::cluster {

using platform::Duration;
using platform::Time;

/// What carries the messages. Nothing is delivered from inside a call.
class Order {
 public:
  virtual ~Order() = default;
  virtual void join() = 0;
  virtual void leave() = 0;
  /// Into the order; to everybody in the view, the sender included, or to nobody who goes on.
  virtual void send(const Message& message) = 0;
  /// Beside the order: may be lost, doubled, late.
  virtual void confirm(const Confirmed& confirmed) = 0;
  /// Who may confirm from now on, as far as they are known, with their addresses and keys: others may have read
  /// the last word before.
  virtual void set_peers(const std::map<Node, Word>& peers) = 0;
  /// Of this daemon, for its words.
  virtual std::string address() const = 0;
  virtual std::string key() const = 0;
};

/// The daemon around it.
class Host {
 public:
  virtual ~Host() = default;
  virtual void log(const std::string& line) = 0;
  /// It cannot be one of these daemons.
  virtual void give_up(const std::string& why) = 0;
};

struct Verdict {
  RingId ring;
  bool quorate = false;
  std::map<Node, std::uint32_t> votes;
  std::uint32_t needed = 0;  // votes that make quorum
};

struct View {
  std::vector<Process> members;
  std::vector<Process> joined;
  std::map<Process, std::uint32_t> left;  // with their leave codes
};

/// What the simulation leaves out to see that it is found.
enum class Rule {
  kNone,
  kVerdictFirst,
  kEveryRing,
  kWordNamesBegin,
  kConfirmDecision,
  kConfirmNamesExchange,
  kConfirmAll,
  kHostsAreState,
  kLives,
  kAside,
  kBeginWhenCaughtUp,
  kVotesOfHolders,
  kEvictedIsToldToLose,
  kEvictedBeginsAgain,
  kNumbersGoOn,
  kHistoryOfRing,
  kHistoryOfExchanges,
  kHistoryOfMessages,
};

/// A state that is being received.
struct CatchingUp {
  Track track;
  std::uint32_t next = 0;  // piece
  SnapshotReceiver state;
};

/// A state that is being sent.
struct Donation {
  SnapshotBytes state;
  std::uint32_t sent = 0;   // pieces
  std::uint32_t count = 0;  // likewise
};

/// Not safe for concurrent use. `advance` comes before any other input that has happened later.
class Replication {
 public:
  struct Settings {
    Process self;
    bool safe = true;  // false: events are applied as they are ordered
    Duration member_timeout{5'000};
    std::size_t piece = 16 * 1024;  // bytes of a state that is sent: what others send waits behind those under way
    std::uint64_t limits = 0;       // of the engine, in one number
    Rule without = Rule::kNone;
  };
  /// `random`: 64 bits that nobody has had before. `clock`: milliseconds since 1970.
  Replication(const Settings& settings, Order& order, Replica& replica, Host& host,
              std::function<std::uint64_t()> random, std::function<std::uint64_t()> clock);
  Replication(const Replication&) = delete;
  Replication& operator=(const Replication&) = delete;

  // From the order.
  void view_changed(const View& view);
  void ring_changed(const RingId& ring);
  void received(const Process& from, const Message& message);
  /// All that has arrived so far was given.
  void settle();
  // Beside the order.
  void verdict(const Verdict& verdict);
  void confirmed(Node from, const Confirmed& confirmed);
  /// The order is not there, or no longer.
  void gone(const std::string& why);

  std::optional<Time> next_deadline() const;
  void advance(Time now);

  /// Has an event ordered; while no client is served, drops it.
  void submit(Event event);
  /// The state cannot be relied on.
  void fail(const std::string& why) { lose(why); }

  bool is_member() const { return state_ != State::kOut; }
  /// What this one says counts for the state.
  bool relies_on(Node node) const { return current().lives.contains(node); }
  bool serves() const { return serves_; }
  /// Bytes of what was received and not applied, also to the state that is kept while another is received.
  std::size_t waiting_bytes() const { return own_.bytes + (catching_up_ ? catching_up_->track.bytes : 0); }
  /// Or will as soon as others have answered, as far as this host can know.
  bool will_serve() const { return verdict_ && verdict_->quorate; }
  /// For people.
  const char* state() const;

 private:
  enum class State { kOut, kWaiting, kExchange, kRunning };
  static constexpr std::size_t kPiecesUnderWay = 2;
  static constexpr Duration kRepeat{200};        // of confirmations, by the order
  static constexpr Duration kBetweenRanks{250};  // until the next one asks for an eviction
  static constexpr Duration kFirstPause{250};    // before it joins again
  static constexpr Duration kLongestPause{30'000};

  void on(const Process& from, const Begin& begin);
  void on(const Process& from, const Word& word);
  void on(const Process& from, const Ordered& ordered);
  void on(const Process& from, const Piece& piece);
  void on(const Process& from, const Confirmed& confirmed);
  void on(const Process& from, const Evict& evict);

  bool keeps(Rule rule) const { return settings_.without != rule; }
  bool goes_on() const;
  bool has_lost_quorum() const;
  std::vector<Process> not_evicted() const;
  void stop();
  void begin_if_lowest();
  void order_begin(std::vector<Process> asked);
  void answer_begin();
  void conclude();
  void become_holder(const std::shared_ptr<const Decision>& decision);
  void catch_up(const std::shared_ptr<const Decision>& decision);
  bool fits(const Decision& decision) const;
  Track& current() { return catching_up_ ? catching_up_->track : own_; }
  const Track& current() const { return catching_up_ ? catching_up_->track : own_; }
  std::uint64_t confirmed_by_all() const;
  void apply_confirmed();
  void apply(const Decision& decision);
  void serve(const Decision& decision);
  void donate(const Decision& decision);
  void send_piece();
  void take_state(const Process& from);
  void ask_again();
  void confirm_in_order(std::vector<Node> ask);
  std::vector<Node> unconfirmed() const;
  bool waits_for_others() const;
  std::vector<Process> who_holds_up() const;
  void evict_who_holds_up();
  void progress() { progressed_ = now_; }
  void lose(const std::string& why);
  void join_if_quorate();

  const Settings settings_;
  Order& order_;
  Replica& replica_;
  Host& host_;
  const std::function<std::uint64_t()> random_;
  const std::function<std::uint64_t()> clock_;

  State state_ = State::kOut;
  bool serves_ = false;
  bool joining_ = false;
  Life life_;
  std::uint64_t begins_ = 0;  // in this life
  std::uint64_t sent_ = 0;    // likewise
  RingId ring_;
  std::optional<Verdict> verdict_;  // of the latest ring that one is known of
  std::vector<Process> view_;
  std::set<Process> evicted_;
  std::map<Node, std::uint32_t> left_;  // leave codes, since the last decision
  bool begun_ = false;                  // this daemon has, for this view and ring
  std::optional<Exchange> exchange_;    // under way, or the last
  bool answered_ = false;
  std::optional<History> history_at_begin_;  // of the exchange: all who read it have received the same before
  Track own_;
  bool aside_ = false;  // its own state, while it has not got the others'
  std::optional<CatchingUp> catching_up_;
  std::optional<Donation> donation_;
  std::shared_ptr<const Decision> decision_;     // of the last exchange
  std::map<Node, std::uint64_t> confirmations_;  // positions
  std::uint64_t told_ = 0;                       // position up to which nothing is left to tell the others
  Time now_{};
  Time progressed_{};
  Time repeated_{};
  Time join_from_{};
  Duration pause_ = kFirstPause;
};

}  // namespace gs::cluster
