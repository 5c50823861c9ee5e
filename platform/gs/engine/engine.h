// The group protocols as one deterministic state machine.
//
// No threads, no sockets, no clock, no randomness: it is given ordered events and returns notifications for named
// endpoints and timers to arm. Engines that are given the same events in the same order stay the same and say the
// same. Not safe for concurrent use; the caller brings the order, and with it the exclusion.
//
// An event makes it do a bounded amount of work (Limits::slice; one step of one protocol in any case). What is
// left, such as the many failure leaves of one death, waits in its state until ContinueEvents are ordered; events
// may be applied between them.
//
// What the protocols promise is said in docs/group-services.md; the state machine and the differences between the
// protocols stand in protocols.h, what a subscriber hears in subscribers.h, the limits in types.h and limits.h.
#pragma once

#include <cstddef>
#include <limits>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "engine/hosts.h"
#include "engine/limits.h"
#include "engine/snapshot_bytes.h"
#include "engine/status.h"
#include "engine/types.h"

namespace gs {

class Engine {
 public:
  explicit Engine(const Limits& limits = {});
  ~Engine();
  Engine(const Engine&) = delete;
  Engine& operator=(const Engine&) = delete;

  /// Applies the next ordered event. `now` is kept beside what begins with it, for people; no part of the state.
  Outcome apply(const Event& event, Moment now = 0);

  /// Work is left: a ContinueEvent is to be ordered.
  bool busy() const;

  /// What `apply` would answer to this request now, changing nothing: lets a daemon refuse at once what it knows
  /// to be wrong before it gives the request to the ordering.
  wyx_rc_t precheck(SessionId session, const Request& request, std::uint32_t user = 0) const;

  /// Whether this timer's phase still runs. A timer that is not awaited need not be kept.
  bool awaits(const TimerId& timer) const;

  /// A timer for each phase that runs, as an engine that has been restored is asked to arm.
  std::vector<TimerRequest> running_phases() const;

  /// The hosts that have come and not gone.
  DomainView domain() const;
  const std::map<std::uint32_t, DomainHost>& hosts() const;

  /// Bytes of what is kept for sessions (see ledger.h).
  std::size_t kept_bytes() const;

  /// For people and tools: whom a group's protocol waits for, at most so many by name.
  MissingVotes missing_votes(const std::string& group, std::size_t at_most) const;

  // For people and tools.
  /// Told of all that happens from now on, until another one or null is given; it outlives that.
  void observe(Observer* observer);
  const Tally& tally() const;
  Totals totals() const;
  /// Groups by name, so many of those that come after `after`.
  std::vector<GroupStatus> status(const std::string& after = "",
                                  std::size_t at_most = std::numeric_limits<std::size_t>::max()) const;
  std::optional<GroupStatus> status_of(const std::string& group) const;
  /// Oldest first, then who joins: from this place on, so many.
  std::vector<MemberStatus> members_of(const std::string& group, std::size_t from, std::size_t at_most) const;
  /// Those with numbers above this one, so many.
  std::vector<SubscriberStatus> subscribers_of(const std::string& group, std::uint64_t above,
                                               std::size_t at_most) const;
  /// The first group after this one that has subscribers, whether it is there or not; empty: none has.
  std::string next_subscribed(const std::string& after) const;
  /// Providers and subscribers of a session.
  std::pair<std::size_t, std::size_t> clients_of(SessionId session) const;

  /// The whole state, equal for engines that have been given the same events. Nothing: it is more than a snapshot
  /// can hold, 1.5 GiB of values.
  SnapshotBytes snapshot() const;

  /// Becomes what the engine was that the snapshot is of, and from the next event on says what that one says; who
  /// restores arms the timers of running_phases. False: the snapshot is damaged, of another version or made
  /// under other limits, as `error` says, and nothing has changed.
  bool restore(const SnapshotBytes& snapshot, std::string* error);

  /// A digest of the whole state; equal for engines that have been given the same events.
  std::uint64_t digest() const;

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace gs
