// Random groups under random faults: three replicas of the engine are given the same events, the model of what all
// clients believe is checked after every step, and at the end everything that was promised must come.
//
// GS_SIM_SEED=n runs the one episode that a failure names, GS_SIM_STEPS=n changes the number of steps in all.
#include <gtest/gtest.h>

#include <cstdlib>
#include <deque>
#include <sstream>

#include "engine/engine.h"
#include "engine/protocols.h"
#include "gs/engine_equal.h"
#include "gs/engine_model.h"
#include "gs/engine_text.h"

namespace gs::test {
namespace {

#if defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define GS_SIM_SLOW 1
#endif
#endif
#if defined(GS_SIM_SLOW) || defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr std::uint64_t kSteps = 60'000;
#else
constexpr std::uint64_t kSteps = 1'000'000;
#endif
constexpr std::uint64_t kEpisode = 2'000;  // steps

/// The same numbers on every platform.
class Random {
 public:
  explicit Random(std::uint64_t seed) : state_(seed) {}
  std::uint64_t next() {  // splitmix64
    std::uint64_t z = state_ += 0x9E3779B97F4A7C15u;
    z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9u;
    z = (z ^ (z >> 27)) * 0x94D049BB133111EBu;
    return z ^ (z >> 31);
  }
  int below(int bound) { return static_cast<int>(next() % static_cast<std::uint64_t>(bound)); }
  bool chance(int percent) { return below(100) < percent; }

 private:
  std::uint64_t state_;
};

/// What has been told to anybody: type and protocol of a protocol notification.
using Coverage = std::set<std::pair<wyx_notification_type_t, wyx_request_t>>;

const char* kind_of(const Event& event) {
  static const char* const kRequests[] = {"join",       "state",   "message", "leave",     "expel",
                                          "attributes", "goodbye", "vote",    "subscribe", "unsubscribe"};
  static const char* const kEvents[] = {"request",   "session gone", "host gone",
                                        "host came", "timer",        "responsiveness"};
  const auto* request = std::get_if<RequestEvent>(&event);
  return request ? kRequests[request->request.index()] : kEvents[event.index()];
}

class Episode {
 public:
  Episode(std::uint64_t seed, Coverage& coverage) : random_(seed), coverage_(coverage) {}

  /// Empty, or what went wrong and how it came to it.
  std::string run(std::uint64_t steps) {
    for (std::uint64_t i = 0; i < steps && error_.empty(); ++i) step();
    if (error_.empty()) drain();
    return error_.empty() ? "" : error_ + history_.str();
  }

 private:
  static constexpr const char* kGroups[] = {"a", "b", "c"};
  static constexpr int kNodes = 3;

  void step() {
    const int dice = random_.below(1000);
    if (dice < 350) return cast_vote();
    if (dice < 530) return submit(some_session(), a_join());
    if (dice < 710) return propose();
    if (dice < 770) return leave();
    if (dice < 820) return submit(some_session(), a_subscription());
    if (dice < 840) return submit(some_session(), UnsubscribeRequest{a_subscriber_token()});
    if (dice < 910) return arrive();
    if (dice < 945) return lose_session();
    if (dice < 950) return lose_host();
    if (dice < 980) return expire();
    if (dice < 990) return apply(ResponsivenessEvent{some_session(), random_.chance(50)});
    return submit(some_session(), a_garbage());
  }

  // ----------------------------------------------------------------------------------------------- generation

  SessionId some_session() {
    while (sessions_.size() < 9) {
      const auto node = static_cast<std::uint32_t>(1 + random_.below(kNodes));
      if (std::erase(gone_hosts_, node)) {
        std::erase_if(under_way_, [&](const auto& u) { return u.first.node == node; });
        apply(HostCameEvent{node});
      }
      sessions_.push_back({node, ++last_session_});
    }
    return sessions_[static_cast<std::size_t>(random_.below(static_cast<int>(sessions_.size())))];
  }
  std::string a_group() { return kGroups[random_.below(std::size(kGroups))]; }
  Token a_token() { return random_.below(4); }
  Token a_subscriber_token() { return kSubscriberToken + random_.below(2); }
  std::uint16_t a_limit() { return static_cast<std::uint16_t>(random_.chance(50) ? 1 + random_.below(9) : 0); }
  ProtocolTerms a_terms() { return {random_.chance(60) ? WYX_N_PHASE : WYX_1_PHASE, a_limit()}; }
  Bytes a_value() {
    return Bytes(static_cast<std::size_t>(random_.below(20)), static_cast<char>('a' + random_.below(26)));
  }

  GroupAttributes some_attributes(const std::string& name) {
    GroupAttributes a;
    a.group_name = name;
    a.client_version = static_cast<std::int16_t>(random_.below(3));
    a.batch_control = static_cast<wyx_batch_ctrl_t>(random_.below(64));
    a.num_phases = random_.chance(50) ? WYX_N_PHASE : WYX_1_PHASE;
    a.default_vote = random_.chance(70) ? WYX_VOTE_APPROVE : WYX_VOTE_REJECT;
    a.time_limit = a_limit();
    return a;
  }

  Request a_join() {
    const std::string name = a_group();
    const bool exists = std::any_of(model_.providers().begin(), model_.providers().end(),
                                    [&](const auto& p) { return p.second.group == name; });
    if (!exists) attributes_[name] = some_attributes(name);
    const GroupAttributes wanted = random_.chance(5) ? some_attributes(name) : attributes_[name];
    return JoinRequest{a_token(), wanted, static_cast<std::int16_t>(random_.below(6)), "p"};
  }

  /// Mostly of a provider, at times of nobody.
  Endpoint someone() {
    const auto& all = model_.providers();
    if (all.empty() || random_.chance(10)) return {some_session(), a_token()};
    return std::next(all.begin(), random_.below(static_cast<int>(all.size())))->first;
  }

  void propose() {
    const Endpoint who = someone();
    const Token token = who.token;
    const int dice = random_.below(100);
    if (dice < 35) return submit(who.session, StateChangeRequest{token, a_terms(), a_value()});
    if (dice < 60) return submit(who.session, MessageRequest{token, a_terms(), a_value()});
    if (dice < 72) {
      auto view = model_.providers().find(who);
      const std::string name = view == model_.providers().end() ? a_group() : view->second.group;
      return submit(who.session, AttributeChangeRequest{token, a_terms(), some_attributes(name)});
    }
    ExpelRequest expel{token, a_terms(), {}, random_.below(2), ""};
    auto view = model_.providers().find(who);
    for (const auto& [endpoint, other] : model_.providers())
      if (random_.chance(view != model_.providers().end() && other.group == view->second.group ? 25 : 1))
        expel.expelled.push_back(other.id);
    submit(who.session, std::move(expel));
  }

  void leave() {
    const Endpoint who = someone();
    if (random_.chance(30)) return submit(who.session, GoodbyeRequest{who.token});
    submit(who.session, LeaveRequest{who.token, a_terms(), 7});
  }

  Request a_subscription() {
    const auto wanted = static_cast<std::uint32_t>(random_.below(16));
    return SubscribeRequest{a_subscriber_token(), wanted | (random_.chance(40) ? 0x200u : 0u), a_group()};
  }

  Request a_garbage() {
    const Bytes big(random_.chance(5) ? kMaxStateValue + 1 : 3, 'x');
    const ProtocolTerms terms{static_cast<wyx_num_phases_t>(random_.below(4)), 0};
    const auto vote = static_cast<wyx_vote_value_t>(random_.below(132));
    switch (random_.below(6)) {
      case 0:
        return StateChangeRequest{a_token(), terms, big};
      case 1:
        return MessageRequest{random_.below(200) - 1, terms, big};
      case 2:
        return ExpelRequest{a_token(), terms, {{1, 1}, {1, 1}}, random_.below(9) - 4, big.substr(0, 999)};
      case 3:
        return VoteRequest{a_token(), vote, big, big, static_cast<wyx_vote_value_t>(random_.below(5))};
      case 4:
        return SubscribeRequest{a_token(), static_cast<std::uint32_t>(random_.next()), Bytes(40, 'n')};
      default:
        break;
    }
    JoinRequest join{a_token(), attributes_[a_group()], -1, ""};
    join.attributes.merge_control = static_cast<wyx_merge_ctrl_t>(random_.below(8));
    return join;
  }

  void cast_vote() {
    std::vector<Endpoint> asked;
    for (const auto& [endpoint, view] : model_.providers())
      if (view.asked) asked.push_back(endpoint);
    VoteRequest vote;
    const int dice = random_.below(100);
    vote.vote = dice < 70 ? WYX_VOTE_APPROVE : dice < 88 ? WYX_VOTE_CONTINUE : WYX_VOTE_REJECT;
    if (random_.chance(15)) vote.proposed_state = a_value();
    if (random_.chance(15)) vote.message = a_value();
    if (random_.chance(20)) vote.default_vote = random_.chance(50) ? WYX_VOTE_APPROVE : WYX_VOTE_REJECT;
    SessionId from = some_session();
    vote.token = a_token();
    if (!asked.empty() && !random_.chance(5)) {
      const Endpoint& voter = asked[static_cast<std::size_t>(random_.below(static_cast<int>(asked.size())))];
      from = voter.session;
      vote.token = voter.token;
    }
    submit(from, vote);
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
    if (outcome_.rc != rc) fail("precheck said " + std::to_string(rc) + ", apply " + std::to_string(outcome_.rc));
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
    gone_hosts_.push_back(node);
    apply(
        HostGoneEvent{node, WYX_HOST_FAILURE});  // what its sessions had under way may still come, and is refused
  }

  void expire() {
    if (timers_.empty()) return;
    const TimerId timer = timers_[static_cast<std::size_t>(random_.below(static_cast<int>(timers_.size())))].id;
    apply(TimerExpiredEvent{timer});  // stays: it may expire again, when its phase is over
    if (timers_.size() > 20) timers_.pop_front();
  }

  /// Lets everything end: all that is under way arrives, everybody asked approves.
  void drain() {
    for (int i = 0; i < 10'000 && error_.empty(); ++i) {
      const auto busy =
          std::find_if(under_way_.begin(), under_way_.end(), [](auto& u) { return !u.second.empty(); });
      if (busy != under_way_.end()) {
        Request request = std::move(busy->second.front());
        busy->second.pop_front();
        apply(RequestEvent{busy->first, std::move(request), true});
        continue;
      }
      const auto asked = std::find_if(model_.providers().begin(), model_.providers().end(),
                                      [](const auto& p) { return p.second.asked; });
      if (asked == model_.providers().end()) return check_drained();
      const Endpoint voter = asked->first;
      apply(RequestEvent{voter.session, VoteRequest{voter.token, WYX_VOTE_APPROVE, {}, {}, WYX_NULL_VOTE}, false});
    }
    fail("the votes do not come to an end");
  }

  void check_drained() {
    for (const Engine::GroupStatus& status : replicas_[0].status())
      if (!status.running_protocol.empty())
        fail("group " + status.name + " is stuck in a " + status.running_protocol);
  }

  void apply(const Event& event) {
    if (!error_.empty()) return;
    outcome_ = replicas_[0].apply(event);
    const std::uint64_t state = replicas_[0].digest();
    for (std::size_t i = 1; i < std::size(replicas_); ++i) {
      if (!same(replicas_[i].apply(event), outcome_)) fail("replicas say different things");
      if (replicas_[i].digest() != state) fail("replicas are in different states");
    }
    model_.follow(event, outcome_, replicas_[0]);
    timers_.insert(timers_.end(), outcome_.timers.begin(), outcome_.timers.end());
    remember(event);
    if (!model_.errors().empty()) fail(model_.errors());
    for (const Delivery& d : outcome_.deliveries) {
      const auto* n = std::get_if<ProtocolNotification>(d.what.get());
      if (n) coverage_.insert({n->type, n->protocol});
      if (n && n->type == WYX_APPROVED_NOTIFICATION && n->proposal.new_attributes)
        attributes_[n->proposal.new_attributes->group_name] = *n->proposal.new_attributes;
    }
  }

  void remember(const Event& event) {
    if (recent_.size() == 30) recent_.pop_front();
    recent_.push_back({event, outcome_});
  }

  void fail(const std::string& what) {
    if (!error_.empty()) return;
    error_ = what + "\nlast events:\n";
    for (const auto& [event, outcome] : recent_) {
      history_ << kind_of(event);
      if (const auto* r = std::get_if<RequestEvent>(&event)) {
        const Token token = std::visit([](const auto& request) { return request.token; }, r->request);
        history_ << " from " << r->session.number << " token " << token << (r->answered ? " answered" : "");
      }
      if (const auto* g = std::get_if<SessionGoneEvent>(&event)) history_ << " " << g->session.number;
      history_ << " -> " << outcome.rc << "\n" << text(outcome.deliveries);
    }
  }

  Random random_;
  Coverage& coverage_;
  Engine replicas_[3];  // only the first is asked prechecks and status
  Model model_;
  Outcome outcome_;  // of the last event
  std::map<std::string, GroupAttributes> attributes_;
  std::vector<SessionId> sessions_;
  std::vector<std::uint32_t> gone_hosts_;
  std::uint64_t last_session_ = 0;
  std::map<SessionId, std::deque<Request>> under_way_;
  std::deque<TimerRequest> timers_;
  std::deque<std::pair<Event, Outcome>> recent_;
  std::string error_;
  std::ostringstream history_;
};

std::optional<std::uint64_t> number_from(const char* variable) {
  const char* value = std::getenv(variable);
  if (!value) return std::nullopt;
  return std::strtoull(value, nullptr, 10);
}

TEST(EngineSimulator, Random_faults_break_no_promise) {
  Coverage coverage;
  if (const auto seed = number_from("GS_SIM_SEED")) {
    ASSERT_EQ(Episode(*seed, coverage).run(number_from("GS_SIM_STEPS").value_or(kEpisode)), "");
    return;
  }
  const std::uint64_t episodes = number_from("GS_SIM_STEPS").value_or(kSteps) / kEpisode;
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
