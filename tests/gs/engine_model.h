// What the clients of an engine believe, kept as a client library would keep it, and the promises that must hold
// between them. Fed with every event and its outcome; every broken promise is an error text.
#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "engine/engine.h"

namespace gs::test {

/// A provider as its own process sees it.
struct ProviderView {
  enum class State { kJoining, kJoined };
  std::string group;
  ProviderId id;
  State state = State::kJoining;
  Membership members;
  Bytes value;
  std::uint64_t seqnum = 0;  // 0: none seen
  bool asked = false;        // a phase waits for its vote
  wyx_request_t asked_protocol = WYX_JOIN;
  std::uint32_t asked_phase = 0;
  std::map<wyx_request_t, int> pending;  // answered WYX_OK and not ended
};

struct SubscriberView {
  std::string group;
  std::uint32_t control = 0;
  bool subscribed = false;
  std::set<ProviderId> members;
  Bytes value;
};

class Model {
 public:
  /// `engine` is the one that gave the outcome, after it.
  void follow(const Event& event, const Outcome& outcome, const Engine& engine);

  /// Empty: no promise has been broken so far.
  const std::string& errors() const { return errors_; }

  const std::map<Endpoint, ProviderView>& providers() const { return providers_; }
  const std::map<Endpoint, SubscriberView>& subscribers() const { return subscribers_; }

 private:
  /// The phase of a group that is being voted on, as its votes tell it.
  struct Phase {
    bool open = false;
    bool reject = false;
    bool go_on = false;
  };

  void before(const RequestEvent& event, const Outcome& outcome);
  void before(const SessionGoneEvent& event, const Outcome& outcome);
  void before(const HostGoneEvent& event, const Outcome& outcome);
  void before(const HostCameEvent& event, const Outcome&) { gone_hosts_.erase(event.node); }
  void before(const TimerExpiredEvent& event, const Outcome& outcome);
  void before(const ResponsivenessEvent&, const Outcome&) {}
  void accept(const SessionId& session, const Request& request);
  void accept_vote(const Endpoint& voter, const VoteRequest& request);
  void lose(const SessionId& session);

  void receive(const Delivery& delivery);
  void receive(const Endpoint& to, const ProtocolNotification& n);
  void receive(const Endpoint& to, const AnnouncementNotification& n);
  void receive(const Endpoint& to, const SubscriptionNotification& n);
  void receive(const Endpoint& to, const DelayedErrorNotification& n);
  void number(const Endpoint& to, ProviderView& view, const ProtocolNotification& n);
  void same_for_all(const std::string& group, const ProtocolNotification& n);
  void follow_timers(const Outcome& outcome);
  void phase_over(const std::string& group, const ProtocolNotification& n);
  bool anybody_to_ask(const std::string& group, const ProtocolNotification& n) const;
  void close(const Endpoint& to, ProviderView& view, const ProtocolNotification& n);
  void new_members(const Endpoint& to, ProviderView& view, const Proposal& p);
  void parts_match_bits(const Endpoint& to, const ProtocolNotification& n);

  void check_groups(const Engine& engine);
  void check_group(const Engine::GroupStatus& status);
  void check_subscribers(const std::map<std::string, Membership>& groups);
  void error(const Endpoint& to, const std::string& what);

  std::string errors_;
  std::map<Endpoint, ProviderView> providers_;
  std::map<Endpoint, SubscriberView> subscribers_;
  std::set<SessionId> gone_;
  std::set<std::uint32_t> gone_hosts_;
  std::map<std::string, std::uint64_t> seqnum_;  // of each group's last event
  std::map<std::string, Phase> phases_;
  std::map<std::string, const ProtocolNotification*> event_;  // this step's last event of each group
  std::optional<DelayedErrorNotification> refused_;           // must come in this step, to refused_to_
  Endpoint refused_to_;
  std::map<std::string, TimerId> timers_;  // of each group's open phase, when it has a limit
  bool timer_ = false;                     // this step is the expiry of one of them
};

}  // namespace gs::test
