// Scripted members on an engine: each call is one ordered event; what it made everybody see is read with seen().
// Provider n is session n with token 1 and instance n, on node 1 unless it joins with another; subscriber n is
// session n with kSubscriberToken.
#pragma once

#include <gtest/gtest.h>

#include "gs/engine_model.h"

namespace gs::test {

inline constexpr ProtocolTerms kOnePhase{WYX_1_PHASE, 0};
inline constexpr ProtocolTerms kPhases{WYX_N_PHASE, 0};

/// The fixture of all engine tests; the model's promises are checked at the end of each.
class Script : public ::testing::Test {
 protected:
  explicit Script(const Limits& limits = {}) : engine(limits) { attributes.group_name = "g"; }
  void TearDown() override { EXPECT_EQ(model.errors(), ""); }

  GroupAttributes attributes;  // of the joins that follow

  wyx_rc_t join(int who, std::uint32_t node = 1) {
    nodes_[who] = node;
    return request(who, JoinRequest{1, attributes, static_cast<std::int16_t>(who), "p"});
  }
  /// A group at rest with these members, joined in one phase each; then `attributes` are the group's.
  void group_of(std::initializer_list<int> members) {
    const GroupAttributes wanted = attributes;
    attributes.num_phases = WYX_1_PHASE;
    for (int who : members) EXPECT_EQ(join(who), WYX_OK);
    request(*members.begin(), AttributeChangeRequest{1, kOnePhase, wanted});
    attributes = wanted;
    log_.clear();
  }
  wyx_rc_t change_state(int who, const Bytes& value, ProtocolTerms terms = kOnePhase) {
    return request(who, StateChangeRequest{1, terms, value});
  }
  wyx_rc_t leave(int who, std::uint32_t code = 0, ProtocolTerms terms = kOnePhase) {
    return request(who, LeaveRequest{1, terms, code});
  }
  wyx_rc_t goodbye(int who) { return request(who, GoodbyeRequest{1}); }
  wyx_rc_t vote(int who, wyx_vote_value_t value, std::optional<Bytes> state = {},
                std::optional<Bytes> message = {}, wyx_vote_value_t default_vote = WYX_NULL_VOTE) {
    return request(who, VoteRequest{1, value, std::move(state), std::move(message), default_vote});
  }
  void approve(std::initializer_list<int> voters) {
    for (int who : voters) EXPECT_EQ(vote(who, WYX_VOTE_APPROVE), WYX_OK) << "voter " << who;
  }
  wyx_rc_t subscribe(int who, std::uint32_t control) {
    return request(who, SubscribeRequest{kSubscriberToken, control, "g"});
  }
  void dies(int who) { apply(SessionGoneEvent{session(who)}); }

  wyx_rc_t request(int who, Request request, bool answered = false) {
    const wyx_rc_t expected = engine.precheck(session(who), request);
    apply(RequestEvent{session(who), std::move(request), answered});
    EXPECT_EQ(last.rc, expected) << "precheck and apply differ";
    return last.rc;
  }
  void apply(const Event& event) {
    last = engine.apply(event);
    model.follow(event, last, engine);
    log_.insert(log_.end(), last.deliveries.begin(), last.deliveries.end());
    timers.insert(timers.end(), last.timers.begin(), last.timers.end());
  }

  /// What has been sent since the last call.
  std::string seen() { return text(std::exchange(log_, {})); }

  SessionId session(int who) const {
    auto it = nodes_.find(who);
    return {it == nodes_.end() ? 1 : it->second, static_cast<std::uint64_t>(who)};
  }
  static ProviderId id(int who, std::int16_t node = 1) { return {static_cast<std::int16_t>(who), node}; }

  Engine engine;
  Model model;
  Outcome last;                      // of the last event
  std::vector<TimerRequest> timers;  // all that were asked for

 private:
  std::map<int, std::uint32_t> nodes_;
  std::vector<Delivery> log_;
};

}  // namespace gs::test
