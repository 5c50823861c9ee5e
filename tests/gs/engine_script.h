// Scripted members on an engine: each call is one ordered event; what it made everybody see is read with seen().
// Provider n is session n with token 1 and instance n, on node 1 unless it joins with another; subscriber n is
// session n with kSubscriberToken.
#pragma once

#include <gtest/gtest.h>

#include <string>

#include "engine/engine.h"
#include "gs/engine_model.h"
#include "gs/engine_text.h"

namespace gs::test {

inline constexpr ProtocolTerms kOnePhase{WYX_1_PHASE, 0};
inline constexpr ProtocolTerms kPhases{WYX_N_PHASE, 0};

/// The fixture of all engine tests; the model's promises are checked at the end of each.
class Script : public ::testing::Test {
 protected:
  Script() {
    attributes.group_name = "g";
    attributes.default_vote = WYX_VOTE_APPROVE;
  }
  void TearDown() override { EXPECT_EQ(model.errors(), ""); }

  GroupAttributes attributes;  // of the joins that follow

  wyx_rc_t join(int who, std::uint32_t node = 1);
  /// A group at rest with these members, joined in one phase each; then `attributes` are the group's.
  void group_of(std::initializer_list<int> members);
  wyx_rc_t change_state(int who, const Bytes& value, ProtocolTerms terms = kOnePhase);
  wyx_rc_t send(int who, const Bytes& message, ProtocolTerms terms = kOnePhase);
  wyx_rc_t leave(int who, std::uint32_t code = 0, ProtocolTerms terms = kOnePhase);
  wyx_rc_t expel(int who, Membership listed, ProtocolTerms terms = kOnePhase);
  wyx_rc_t change_attributes(int who, const GroupAttributes& to, ProtocolTerms terms = kOnePhase);
  wyx_rc_t vote(int who, wyx_vote_value_t value, wyx_vote_value_t default_vote = WYX_NULL_VOTE);
  wyx_rc_t vote_with(int who, wyx_vote_value_t value, std::optional<Bytes> state, std::optional<Bytes> message);
  void vote_all(std::initializer_list<int> voters, wyx_vote_value_t value);
  wyx_rc_t goodbye(int who);
  wyx_rc_t subscribe(int who, std::uint32_t control, const std::string& group = "g");
  wyx_rc_t unsubscribe(int who);
  void dies(int who);
  void expire(const TimerRequest& timer);
  wyx_rc_t request(int who, Request request, bool answered = false);
  void apply(const Event& event);

  /// What has been sent since the last call.
  std::string seen();
  /// The same, less the part after "members" of each line: who hears what outcome.
  std::string outcomes();

  SessionId session(int who) const;
  static ProviderId id(int who, std::int16_t node = 1) { return {static_cast<std::int16_t>(who), node}; }

  Engine engine;
  Model model;
  Outcome last;                      // of the last event
  std::vector<TimerRequest> timers;  // all that were asked for
  std::vector<Delivery> log;

 private:
  std::map<int, std::uint32_t> nodes_;
};

}  // namespace gs::test
