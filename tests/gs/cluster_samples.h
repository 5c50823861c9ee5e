// One of every message between daemons with one of every event, every field set to a value of its own.
#pragma once

#include "cluster/messages.h"
#include "gs/wire_samples.h"

namespace gs {

inline auto fields(const RequestEvent& e) { return std::tie(e.session, e.request, e.answered, e.user); }
inline auto fields(const SessionGoneEvent& e) { return std::tie(e.session); }
inline auto fields(const HostGoneEvent& e) { return std::tie(e.node, e.leave_code); }
inline auto fields(const HostCameEvent& e) { return std::tie(e.node); }
inline auto fields(const TimerExpiredEvent& e) { return std::tie(e.timer); }
inline auto fields(const ResponsivenessEvent& e) { return std::tie(e.session, e.responding); }
inline auto fields(const ContinueEvent&) { return std::tie(); }
inline auto fields(const AdaptersEvent& e) { return std::tie(e.node, e.adapters); }
inline auto fields(const NumbersEvent& e) { return std::tie(e.above); }

namespace cluster {

inline auto fields(const Begin& m) { return std::tie(m.id, m.ring, m.asked, m.votes, m.needed, m.clock); }
inline auto fields(const Word& m) {
  return std::tie(m.begin, m.version, m.life, m.history, m.address, m.key, m.limits, m.left);
}
inline auto fields(const Ordered& m) { return std::tie(m.life, m.number, m.event); }
inline auto fields(const Piece& m) { return std::tie(m.index, m.count, m.bytes); }
inline auto fields(const Confirmed& m) { return std::tie(m.begin, m.position, m.ask); }
inline auto fields(const Evict& m) { return std::tie(m.ring, m.who); }

namespace samples {

inline constexpr Node kNode = 0x5ace;  // nothing else has these bytes
inline constexpr Life kLife = 0x8877665544332211;
inline constexpr BeginId kBegin{kLife, 77};

inline std::vector<Message> messages() {
  const RingId ring{0x1234, kNode};
  const SessionId session{kNode, 0x123456789abcdef0};
  const std::string key("\0\xff key", 6);
  std::vector<Message> all = {
      Begin{kBegin, ring, {{kNode, 5}, {1, 6}}, {{1, 2}, {kNode, 3}}, 4, 1ull << 40},
      Word{kBegin, kProtocolVersion, 9, History{1, 2, 3, kLife}, "192.0.2.1:5405", key, 7, {{kNode, 16}}},
      Word{kBegin, kProtocolVersion + 1, 9, {}, "", ""},
      Piece{2, 3, std::vector<std::byte>(1000, std::byte{0x80})},
      Confirmed{kBegin, 0x100000002, {1, kNode}},
      Evict{ring, {{kNode, 1}, {32767, 2}}}};
  std::vector<Event> events = {SessionGoneEvent{session}, TimerExpiredEvent{{"a group", 0xfedcba9876543210, 3}},
                               ResponsivenessEvent{session, true}, ContinueEvent{},
                               AdaptersEvent{kNode, wire::samples::adapters()}};
  for (Request& request : wire::samples::requests()) events.push_back(RequestEvent{session, request, true, 1000});
  for (Event& event : events)
    all.emplace_back(Ordered{kLife, 12, std::make_shared<const Event>(std::move(event))});
  return all;
}

}  // namespace samples
}  // namespace cluster
}  // namespace gs
