// A fuzzer's input, as the targets read it.
#pragma once

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <span>

#include "support/wire_packets.h"

namespace fuzz {

/// Byte by byte; zeros once it is used up.
class Input {
 public:
  Input(const std::uint8_t* data, std::size_t size) : left_(data, size) {}
  bool empty() const { return left_.empty(); }
  std::uint8_t byte() {
    if (left_.empty()) return 0;
    const std::uint8_t value = left_.front();
    left_ = left_.subspan(1);
    return value;
  }
  std::uint16_t word() {
    const std::uint8_t low = byte();
    return static_cast<std::uint16_t>(low | byte() << 8);
  }
  gs::wire::Packet bytes(std::size_t count) {
    count = std::min(count, left_.size());
    const auto taken = std::as_bytes(left_.first(count));
    left_ = left_.subspan(count);
    return {taken.begin(), taken.end()};
  }

 private:
  std::span<const std::uint8_t> left_;
};

/// A header that is right, or nearly, around any payload.
inline gs::wire::Packet framed_payload(Input& in) {
  const auto payload = in.bytes(in.byte());
  auto packet = gs::wire::packets_of(gs::wire::ClientMessage(gs::wire::Quit{}))[0];
  packet.resize(gs::wire::kHeaderSize);
  const std::uint32_t length = static_cast<std::uint32_t>(payload.size()) + (in.byte() == 1 ? 1 : 0);
  std::memcpy(packet.data() + 12, &length, sizeof length);
  packet.insert(packet.end(), payload.begin(), payload.end());
  return packet;
}

/// The packets of a whole message: some of their bits changed, cut, the last not sent.
inline void damage(Input& in, std::vector<gs::wire::Packet>& packets) {
  gs::wire::Packet& packet = packets[packets.size() > 1 ? in.byte() % packets.size() : 0];
  for (int flips = in.byte() % 4; flips > 0; --flips) packet[in.word() % packet.size()] ^= std::byte{in.byte()};
  if (in.byte() % 8 == 1) packet.resize(in.word() % packet.size());
  if (packets.size() > 1 && in.byte() % 4 == 1) packets.pop_back();
}

}  // namespace fuzz
