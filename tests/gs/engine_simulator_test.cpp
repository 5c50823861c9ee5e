// Random groups under random faults: three replicas of the engine are given the same events, and two of them are
// now and then replaced by a snapshot of one. The model of what all clients believe is checked after every step,
// and at the end everything that was promised must come.
//
// GS_SIM_SEED=n runs the one episode that a failure names and tells each step, GS_SIM_STEPS=n changes the number
// of steps in all.
#include <gtest/gtest.h>

#include <deque>
#include <iostream>

#include "common/sanitizers.h"
#include "gs/engine_model.h"
#include "gs/made_up_request.h"
#include "gs/random.h"

namespace gs::test {
namespace {

constexpr std::uint64_t kSteps = ZN_ADDRESS_SANITIZER || ZN_THREAD_SANITIZER ? 60'000 : 1'000'000;
constexpr std::uint64_t kEpisode = 2'000;  // steps

/// What has been told to anybody: type and protocol of a protocol notification.
using Coverage = std::set<std::pair<wyx_notification_type_t, wyx_request_t>>;

class Episode {
 public:
  /// Every other episode leaves as much work as can be for later events.
  Episode(std::uint64_t seed, Coverage& coverage, bool tell = false)
      : random_(seed), coverage_(coverage), tell_(tell), limits_{.slice = seed % 2 == 0 ? 1u : Limits().slice} {}

  /// Empty, or what went wrong.
  std::string run(std::uint64_t steps) {
    for (std::uint64_t i = 0; i < steps && error_.empty(); ++i) step();
    if (error_.empty()) drain();
    return error_;
  }

 private:
  static constexpr int kNodes = 3;
  static constexpr std::size_t kSessions = 9;

  void change_adapters() {
    Adapters adapters(static_cast<std::size_t>(random_.below(3)));
    for (Adapter& adapter : adapters) adapter = {"eth" + std::to_string(random_.below(9)), {9, 1}};
    apply(AdaptersEvent{static_cast<std::uint32_t>(1 + random_.below(kNodes)), adapters});
  }

  void step() {
    if (replicas_[0].busy() && random_.chance(50)) return apply(ContinueEvent{});
    const int dice = random_.below(1000);
    if (dice < 350) return request(VoteRequest{});
    if (dice < 480) return request(JoinRequest{0, {}, static_cast<std::int16_t>(random_.below(6)), "p"});
    if (dice < 840) return request(made_up_.request());
    if (dice < 910) return arrive();
    if (dice < 945) return lose_session();
    if (dice < 950) return lose_host();
    if (dice < 975) return expire();
    if (dice < 980) return change_adapters();
    apply(ResponsivenessEvent{some_session(), random_.chance(50)});
  }

  // ----------------------------------------------------------------------------------------------- generation

  SessionId some_session() {
    while (sessions_.size() < kSessions) {
      const auto node = static_cast<std::uint32_t>(1 + random_.below(kNodes));
      if (gone_hosts_.erase(node)) {
        std::erase_if(under_way_, [&](const auto& u) { return u.first.node == node; });
        apply(HostCameEvent{node});
      }
      sessions_.push_back({node, ++last_session_});
    }
    return random_.one_of(sessions_);
  }
  Bytes a_value() {
    return Bytes(static_cast<std::size_t>(random_.below(20)), static_cast<char>('a' + random_.below(26)));
  }
  GroupAttributes attributes_of(const std::string& name) {
    GroupAttributes a = made_up_.attributes();
    a.group_name = name;
    return a;
  }

  /// Mostly as one would make it who may; at times as it is.
  void request(Request made) {
    Endpoint from{some_session(), std::visit([](const auto& r) { return r.token; }, made)};
    if (random_.chance(95)) {
      std::visit([&](auto& r) { make_sensible(from, r); }, made);
      std::visit([&](auto& r) { r.token = from.token; }, made);
    }
    submit(from.session, std::move(made));
  }
  void make_sensible(Endpoint& from, JoinRequest& join) {
    from.token = random_.below(4);
    const std::string name = "g" + std::to_string(random_.below(3));
    const auto group = model_.groups().find(name);
    const bool new_ones = group == model_.groups().end() || group->second.members.empty() || random_.chance(5);
    join.attributes = new_ones ? attributes_of(name) : group->second.attributes;
  }
  void make_sensible(Endpoint& from, SubscribeRequest& subscribe) {
    from.token = kSubscriberToken + random_.below(2);
    subscribe.control = static_cast<std::uint32_t>(random_.below(16)) | (random_.chance(40) ? 0x200u : 0u);
  }
  void make_sensible(Endpoint& from, UnsubscribeRequest&) { from.token = kSubscriberToken + random_.below(2); }
  void make_sensible(Endpoint& from, VoteRequest& vote) {
    std::vector<Endpoint> asked;
    for (const auto& [endpoint, view] : model_.providers())
      if (view.asked) asked.push_back(endpoint);
    if (!asked.empty()) from = random_.one_of(asked);
    const int dice = random_.below(100);
    vote.vote = dice < 70 ? WYX_VOTE_APPROVE : dice < 88 ? WYX_VOTE_CONTINUE : WYX_VOTE_REJECT;
    vote.proposed_state = random_.chance(15) ? std::optional(a_value()) : std::nullopt;
    vote.message = random_.chance(15) ? std::optional(a_value()) : std::nullopt;
    vote.default_vote = random_.chance(20)
                            ? wyx_vote_value_t(random_.chance(50) ? WYX_VOTE_APPROVE : WYX_VOTE_REJECT)
                            : WYX_NULL_VOTE;
  }
  template <typename R>
  void make_sensible(Endpoint& from, R& r) {
    if (model_.providers().empty()) return;
    const auto& [who, view] = random_.one_of(model_.providers());
    from = who;
    if constexpr (requires { r.new_state; }) r.new_state = a_value();
    if constexpr (requires { r.message; }) r.message = a_value();
    if constexpr (requires { r.attributes; }) r.attributes = attributes_of(view.group);
    if constexpr (requires { r.expelled; }) {
      r.expelled.clear();
      for (const auto& [endpoint, other] : model_.providers())
        if (random_.chance(other.group == view.group ? 25 : 1)) r.expelled.push_back(other.id);
    }
  }

  // -------------------------------------------------------------------------------------------------- delivery

  /// As a daemon would: what is wrong is refused at once; what seems right is either applied now, or answered
  /// WYX_OK and ordered later, behind what its session has under way.
  void submit(SessionId session, Request request) {
    auto& queue = under_way_[session];
    const wyx_rc_t rc = replicas_[0].precheck(session, request);
    if (rc == WYX_OK && (!queue.empty() || random_.chance(30))) {
      queue.push_back(std::move(request));
      return;
    }
    apply(RequestEvent{session, std::move(request), random_.chance(30)});
    if (outcome_.rc != rc) error_ += "precheck said " + std::to_string(rc) + "\n";
  }

  void arrive() {
    for (auto& [session, queue] : under_way_) {
      if (queue.empty() || random_.chance(30)) continue;
      Request request = std::move(queue.front());
      queue.pop_front();
      return apply(RequestEvent{session, std::move(request), true});
    }
  }

  void lose_session() {
    const SessionId session = some_session();
    std::erase(sessions_, session);
    under_way_.erase(session);
    apply(SessionGoneEvent{session});
  }

  void lose_host() {
    const std::uint32_t node = some_session().node;
    std::erase_if(sessions_, [&](const SessionId& s) { return s.node == node; });
    gone_hosts_.insert(node);
    apply(HostGoneEvent{node});  // what its sessions had under way may still come, and is refused
  }

  void expire() {
    if (timers_.empty()) return;
    apply(TimerExpiredEvent{random_.one_of(timers_).id});  // it may expire again, when its phase is over
    if (timers_.size() > 20) timers_.pop_front();
  }

  /// Lets everything end: all that is under way arrives, everybody asked approves.
  void drain() {
    for (int i = 0; i < 10'000 && error_.empty(); ++i) {
      if (replicas_[0].busy()) {
        apply(ContinueEvent{});
        continue;
      }
      if (std::ranges::any_of(under_way_, [](const auto& u) { return !u.second.empty(); })) {
        arrive();
        continue;
      }
      const auto asked = std::ranges::find_if(model_.providers(), [](const auto& p) { return p.second.asked; });
      if (asked == model_.providers().end()) return;  // the model has seen to it that nothing is owed
      const Endpoint voter = asked->first;
      apply(RequestEvent{voter.session, VoteRequest{voter.token, WYX_VOTE_APPROVE, {}, {}, WYX_NULL_VOTE}, false});
    }
    error_ += "the votes do not come to an end\n";
  }

  SnapshotBytes in_pieces(const SnapshotBytes& snapshot) {
    const std::uint64_t length = 1 + random_.below(100);
    SnapshotReceiver receiver;
    for (std::uint64_t from = 0; from < snapshot.size(); from += length)
      if (!receiver.add(snapshot.part(from, length))) error_ += "a piece of a snapshot is refused\n";
    if (!receiver.complete()) error_ += "a snapshot is not complete\n";
    return receiver.take();
  }

  /// One of the others becomes what the first or another one is.
  void replace_a_replica() {
    const auto state = replicas_[0].snapshot().all();
    Engine& replaced = replicas_[1 + random_.below(2)];
    std::string why;
    if (!replaced.restore(in_pieces(replicas_[random_.below(3)].snapshot()), &why)) error_ += why + "\n";
    for (const Engine& replica : replicas_)
      if (replica.snapshot().all() != state) error_ += "replicas have different snapshots\n";
  }

  void apply(const Event& event) {
    outcome_ = replicas_[0].apply(event);
    const std::uint64_t state = replicas_[0].digest();
    for (std::size_t i = 1; i < std::size(replicas_); ++i) {
      if (!same(replicas_[i].apply(event), outcome_)) error_ += "replicas say different things\n";
      if (replicas_[i].digest() != state) error_ += "replicas are in different states\n";
    }
    if (random_.chance(3)) replace_a_replica();
    model_.follow(event, outcome_, replicas_[0]);
    error_ += model_.errors();
    timers_.insert(timers_.end(), outcome_.timers.begin(), outcome_.timers.end());
    if (tell_)
      std::cerr << "event " << event.index() << " -> " << outcome_.rc << "\n" << text(outcome_.deliveries);
    for (const Delivery& d : outcome_.deliveries)
      if (const auto* n = std::get_if<ProtocolNotification>(d.what.get()))
        coverage_.insert({n->type, n->protocol});
  }

  Random random_;
  MadeUp<Random> made_up_{random_};
  Coverage& coverage_;
  const bool tell_;
  const Limits limits_;
  Engine replicas_[3] = {Engine(limits_), Engine(limits_),
                         Engine(limits_)};  // only the first is asked prechecks and status
  Model model_;
  Outcome outcome_;  // of the last event
  std::vector<SessionId> sessions_;
  std::set<std::uint32_t> gone_hosts_;
  std::uint64_t last_session_ = 0;
  std::map<SessionId, std::deque<Request>> under_way_;
  std::deque<TimerRequest> timers_;
  std::string error_;
};

TEST(EngineSimulator, Random_faults_break_no_promise) {
  Coverage coverage;
  if (const auto seed = number_from("GS_SIM_SEED", 0)) {
    ASSERT_EQ(Episode(seed, coverage, true).run(number_from("GS_SIM_STEPS", kEpisode)), "");
    return;
  }
  const std::uint64_t episodes = number_from("GS_SIM_STEPS", kSteps) / kEpisode;
  for (std::uint64_t seed = 1; seed <= episodes; ++seed)
    ASSERT_EQ(Episode(seed, coverage).run(kEpisode), "") << "once more with GS_SIM_SEED=" << seed;

  // The run is worth something only if it came everywhere: each protocol asked and ended in every way it can.
  for (const ProtocolTraits& protocol : kProtocols) {
    EXPECT_TRUE(coverage.contains({WYX_N_PHASE_NOTIFICATION, protocol.type})) << protocol.name;
    EXPECT_TRUE(coverage.contains({WYX_APPROVED_NOTIFICATION, protocol.type})) << protocol.name;
    EXPECT_EQ(coverage.contains({WYX_REJECTED_NOTIFICATION, protocol.type}), protocol.preventable)
        << protocol.name;
  }
}

}  // namespace
}  // namespace gs::test
