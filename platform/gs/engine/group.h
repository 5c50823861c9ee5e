// One group: its members, its values, the protocol it runs and the queue behind it.
#pragma once

#include <deque>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <variant>
#include <vector>

#include "engine/clients.h"
#include "engine/protocols.h"
#include "engine/status.h"
#include "engine/subscribers.h"

namespace gs {

/// What a group reaches outside itself while an event is applied.
struct Surroundings {
  std::vector<Delivery>& deliveries;
  std::vector<TimerRequest>& timers;
  SubscriberTable& subscribers;
  ClientTable& clients;
  std::uint64_t& last_protocol;  // numbers are never used twice, so a timer of a dead group's protocol finds none
  const std::uint64_t& numbers_above;
  Watch& watch;
  Ledger& ledger;
  const Limits& limits;
  std::size_t& work_left;  // units, of this event

  /// Nobody pays for what is gone when the event is over.
  static Value pass_on(const Bytes& bytes) { return {std::make_shared<const Bytes>(bytes), nullptr}; }
  Value keep(const Member& whose, const Bytes& bytes) const {
    return {std::make_shared<const Bytes>(bytes),
            std::make_shared<const Ledger::Charge>(ledger, whose.payer(), bytes.size())};
  }
};

/// The error that reaches a client after it has been told WYX_OK.
Delivery delayed_error(const Endpoint& to, const Request& request, wyx_rc_t rc,
                       std::shared_ptr<const GroupAttributes> group_attributes = nullptr);

/// A client does not respond, or does again: to be told to all members.
struct Announcement {
  SessionId about;
  std::uint32_t summary = 0;  // flags of wyx_summary_code_t
  SharedMembership ids;       // its providers in the group
};

/// Lives from the first join's request until it has neither members nor work. Members that have died or said
/// goodbye stay in the membership until their failure leave is approved, and are sent nothing.
///
/// Every call but `settle` only takes note; `settle` then runs what can run. What it leaves when the event's work
/// is used up makes the group unfinished: until it is gone on with, it answers as one whose protocol runs. The
/// check_ functions say what the request of the same name is answered; a request is made only when its check says
/// WYX_OK.
class Group {
 public:
  /// Its events are numbered above `last_number`.
  Group(std::string name, std::uint64_t last_number);

  wyx_rc_t check_join(const GroupAttributes& attributes, ProviderId id) const;
  wyx_rc_t check_leave(const Member& member) const;
  wyx_rc_t check_proposal(const Member& member) const;
  wyx_rc_t check_expel(const Membership& expelled) const;
  wyx_rc_t check_new_attributes(const GroupAttributes& attributes) const;
  wyx_rc_t check_vote(const Member& member) const;

  void join(MemberPtr joiner, const JoinRequest& request);
  void leave(const MemberPtr& member, const LeaveRequest& request);
  void propose(const Member& proposer, const StateChangeRequest& request, Surroundings& env);
  void propose(const Member& proposer, const MessageRequest& request, Surroundings& env);
  void propose(const Member& proposer, const ExpelRequest& request, Surroundings& env);
  void propose(const Member& proposer, const AttributeChangeRequest& request, Surroundings& env);
  void vote(Member& voter, const VoteRequest& request, Surroundings& env);

  /// The provider is dead or has said goodbye. The caller has taken it out of the client table.
  void lose(const MemberPtr& member, std::uint32_t leave_code);
  /// Whether this is the phase that runs.
  bool awaits(const TimerId& timer) const;
  /// Nothing: no phase runs.
  std::optional<TimerRequest> running_timer() const;
  /// Ignored unless that phase runs and has a time limit.
  void expire(const TimerId& timer);
  /// Comes before whatever else the group has left to do, so while those it is about are still members.
  void announce(Announcement announcement);

  /// Runs the protocol and the queue on until they wait for a vote, there is nothing left to do, or the event's
  /// work is used up. A protocol's start, a phase's end with what follows at once, is one step.
  void settle(Surroundings& env);
  bool unfinished() const {
    return !announcements_.empty() || (run_ ? run_->missing == 0 : !failures_.empty() || !queue_.empty());
  }
  /// Whether it stands in the engine's line of unfinished groups.
  bool in_line() const { return in_line_; }
  void set_in_line(bool is) { in_line_ = is; }

  bool born() const { return !members_.empty(); }
  bool finished() const {
    return members_.empty() && !run_ && queue_.empty() && failures_.empty() && announcements_.empty();
  }
  const std::string& name() const { return name_; }
  std::shared_ptr<const GroupAttributes> attributes() const { return attributes_; }
  const Membership& member_ids() const { return *member_ids_; }
  std::size_t state_length() const { return state_value_.bytes->size(); }
  std::uint64_t seqnum() const { return seqnum_; }
  const char* running_protocol() const { return run_ ? run_->traits->name : ""; }
  std::uint32_t running_phase() const { return run_ ? run_->phase : 0; }
  std::size_t missing_votes() const { return run_ ? run_->missing : 0; }
  /// The first of those who have not voted, in the order in which they were asked.
  std::vector<MissingVoter> missing_voters(std::size_t at_most) const;
  /// But for its subscribers. Everything but the lists of voters is shared.
  GroupStatus status() const;
  /// Oldest first, then who joins: from this place on, so many.
  std::vector<MemberStatus> member_status(std::size_t from, std::size_t at_most) const;
  GroupView view() const;
  void add_to(Digest& digest) const;

 private:
  // The two sides of a snapshot (snapshot.h).
  friend class GroupWriter;
  friend class GroupReader;

  struct Queued {
    MemberPtr who;
    std::variant<JoinRequest, LeaveRequest> request;
  };
  /// The protocol that runs.
  struct Run {
    const ProtocolTraits* traits = nullptr;
    std::uint64_t number = 0;
    ProtocolTerms terms;
    std::uint32_t phase = 1;
    ProviderId proposed_by;
    std::vector<MemberPtr> changing;
    SharedMembership changing_ids;
    std::shared_ptr<std::vector<LeaveCode>> leave_codes;  // null: a join, or no change of members
    std::optional<ExpelInfo> expel_info;
    std::shared_ptr<const GroupAttributes> new_attributes;
    Value proposed_state;
    Value message;
    Value voted_message;            // the last one of this phase's votes
    Ledger::Charge charge;          // for what else its request has brought
    std::vector<MemberPtr> voters;  // of this phase
    std::size_t missing = 0;        // votes
    std::uint32_t collect = 0;      // WYX_COLLECT_ flags of the group as it was at the start
    std::size_t collected = 0;      // bytes of values kept for this phase's vote results
    std::uint32_t defaults = 0;     // summary flags of the default votes counted so far
    Moment since = 0;               // no part of the state, like the next
    Moment phase_since = 0;
  };

  using Queue = std::map<std::uint64_t, Queued>;  // by place

  static void add_to(Digest& digest, const Run& run);

  // The queue (group.cpp).
  void send_announcement(Surroundings& env);
  void start_next(Surroundings& env);
  bool start_failure_leave(Surroundings& env);
  void start_leave(Surroundings& env);
  void start_join(Surroundings& env);
  void enqueue(MemberPtr who, std::variant<JoinRequest, LeaveRequest> request);
  Queued dequeue(Queue::iterator& entry);
  void release(const Member& member, Surroundings& env);
  bool batches(wyx_batch_ctrl_t what) const { return (attributes_->batch_control & what) != 0; }
  Run new_run(wyx_request_t type, const ProtocolTerms& terms, ProviderId proposed_by) const;
  void add_changing(Run& run, MemberPtr member, LeaveCode code) const;

  // The running protocol (group_protocol.cpp).
  void start(Run&& run, Surroundings& env);
  void open_phase(Surroundings& env);
  void end_phase(Surroundings& env);
  void collect(const Value& value, std::uint32_t flag, Value& into);
  void cast_default(Member& voter, std::uint32_t cause);
  // The run is over: it is not the group's any more.
  void approve(const Run& run, std::uint32_t summary, Surroundings& env);
  void reject(const Run& run, std::uint32_t summary, Surroundings& env);
  static void end(const Run& run, const std::vector<MemberPtr>& audience);
  void change_membership(const Run& run);
  void dismiss(const Run& run, Surroundings& env);
  void tell_subscribers(const Run& run, bool was_born, Surroundings& env);
  std::uint64_t next_number(const Surroundings& env);
  void forget_values();
  std::vector<MissingVoter> voters(bool who_voted, std::size_t at_most) const;

  // What observers are told (group_status.cpp).
  Happening happening(Happening::Kind kind, const Run& run) const;
  void tell(Happening::Kind kind, const Run& run, const Surroundings& env, std::uint32_t summary = 0) const;
  void tell_vote(Happening::Kind kind, const Member& voter, const Surroundings& env) const;
  void tell_default_votes(const Surroundings& env) const;

  // What a protocol says (group_protocol.cpp).
  ProtocolNotification compose(const Run& run, wyx_notification_type_t type, std::uint32_t summary) const;
  void add_vote_results(const Run& run, Proposal& proposal) const;
  void send(const Run& run, ProtocolNotification&& notification, const std::vector<MemberPtr>& to,
            Surroundings& env) const;

  std::string name_;
  std::shared_ptr<const GroupAttributes> attributes_;  // null until the first join starts
  std::vector<MemberPtr> members_;                     // in join order
  SharedMembership member_ids_;                        // theirs
  std::set<ProviderId> taken_ids_;                     // of members, joiners and queued joins that are not gone
  Value state_value_;
  std::uint64_t seqnum_ = 0;  // of the last event, also of those that had the name before
  Moment since_ = 0;          // that event; no part of the state
  std::optional<Run> run_;
  std::deque<MemberPtr> failures_;  // gone; those that are no members when their turn comes are passed over
  Queue queue_;                     // joins and leaves
  std::deque<Announcement> announcements_;  // that wait
  std::uint64_t last_place_ = 0;
  bool in_line_ = false;
};

}  // namespace gs
