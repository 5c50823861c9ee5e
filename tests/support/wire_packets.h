// Messages as the packets that go over a socket.
#pragma once

#include <string>
#include <vector>

#include "wire/codec.h"

namespace gs::wire {

using Packet = std::vector<std::byte>;

inline std::vector<Packet> packets_of(const Encoded& encoded, Token token = -1) {
  std::vector<Packet> packets;
  for (std::size_t i = 0; i < encoded.packets(); ++i) {
    Packet packet(kHeaderSize);
    const auto slice = encoded.packet_for(i, token, std::span<std::byte, kHeaderSize>(packet));
    packet.insert(packet.end(), slice.begin(), slice.end());
    packets.push_back(std::move(packet));
  }
  return packets;
}
inline std::vector<Packet> packets_of(const ClientMessage& message) { return packets_of(encode(message)); }
inline std::vector<Packet> packets_of(const ServerMessage& message) {
  const auto* notify = std::get_if<Notify>(&message);
  return packets_of(encode(message), notify != nullptr ? notify->token : -1);
}

}  // namespace gs::wire
