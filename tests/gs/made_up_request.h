// Requests that are made up from a source of bytes: a fuzzer's input or random numbers.
#pragma once

#include "wire/codec.h"

namespace gs::test {

/// Every request that can be encoded may come of it, those that are wrong among them. `Source` has byte().
template <typename Source>
class MadeUp {
 public:
  explicit MadeUp(Source& in) : in_(in) {}

  GroupAttributes attributes() {
    GroupAttributes a;
    a.group_name = group();
    const int bits = in_.byte();
    if (bits & 1) a.num_phases = WYX_N_PHASE;
    if (bits & 2) a.batch_control = WYX_BATCH_BOTH;
    if (bits & 4) a.time_limit = 5;
    if (bits & 8) a.default_vote = WYX_VOTE_REJECT;
    if (bits & 16) a.group_name.assign(in_.byte() * in_.byte() % (wire::kMaxWireName + 1), 'n');
    if (bits & 32) a.batch_control = static_cast<wyx_batch_ctrl_t>(a.batch_control | WYX_COLLECT_ALL_RESULT);
    if (bits & 64) a.batch_control = static_cast<wyx_batch_ctrl_t>(a.batch_control ^ WYX_BATCH_JOINS);
    if (bits & 128) a.client_version = 1;
    return a;
  }
  ProtocolTerms terms() {
    const int bits = in_.byte();
    return {(bits & 1) ? WYX_N_PHASE : WYX_1_PHASE, static_cast<std::uint16_t>(bits >> 4)};
  }

  Request request() {
    const int kind = in_.byte() % 10;
    const Token token = in_.byte() % 4 - 1;
    switch (kind) {
      case 0:
        return JoinRequest{token, attributes(), static_cast<std::int16_t>(in_.byte() % 4), "name"};
      case 1:
        return StateChangeRequest{token, terms(), content()};
      case 2:
        return MessageRequest{token, terms(), content()};
      case 3:
        return LeaveRequest{token, terms(), in_.byte()};
      case 4:
        return ExpelRequest{token, terms(), {provider(), provider()}, 0, "flag"};
      case 5:
        return AttributeChangeRequest{token, terms(), attributes()};
      case 6:
        return GoodbyeRequest{token};
      case 7:
        return VoteRequest{token, vote(), content(), std::nullopt, vote()};
      case 8:
        return SubscribeRequest{token, in_.byte() | std::uint32_t{in_.byte()} << 8, group()};
      default:
        return UnsubscribeRequest{token};
    }
  }

 private:
  std::string group() { return "g" + std::to_string(in_.byte() % 3); }
  Bytes content() { return Bytes(std::size_t{in_.byte()} * in_.byte(), 'c'); }
  wyx_vote_value_t vote() { return static_cast<wyx_vote_value_t>(in_.byte() % 4); }
  ProviderId provider() { return {static_cast<std::int16_t>(in_.byte() % 4), 1}; }

  Source& in_;
};

}  // namespace gs::test
