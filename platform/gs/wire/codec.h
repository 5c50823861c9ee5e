// Messages to packets and back. docs/wire.md describes the format.
//
// A message is one or more packets of a SOCK_SEQPACKET socket, each at most kMaxPacket bytes: a fixed header
// (magic, version, flags, token, whole length) and a slice of one FlatBuffer whose schema is gs.fbs. Everything that
// is read is checked before it is used: header, lengths, the FlatBuffer itself, every enumeration and every limit.
#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "wire/messages.h"

namespace gs::wire {

inline constexpr std::size_t kMaxPacket = 64 * 1024;          // bytes, header included
inline constexpr std::size_t kMaxClientMessage = 256 * 1024;  // bytes, the FlatBuffer
inline constexpr std::size_t kMaxServerMessage = 64 * 1024 * 1024;

/// One message's packets, ready to be sent in order. Immutable; the same packets go to any number of receivers, with
/// the token patched in by the sender's header (see packet_for).
class Encoded {
 public:
  /// Bytes of all packets together, headers included.
  std::size_t size() const { return size_; }
  std::size_t packets() const;
  /// Writes packet `index`'s header for `token` into `header` and returns its payload slice.
  std::span<const std::byte> packet_for(std::size_t index, Token token, std::span<std::byte> header) const;

 private:
  friend Encoded encode(const ClientMessage&);
  friend Encoded encode(const ServerMessage&);
  std::shared_ptr<const std::vector<std::byte>> payload_;
  std::size_t size_ = 0;
};

inline constexpr std::size_t kHeaderSize = 16;  // bytes

Encoded encode(const ClientMessage& message);
/// For Notify the token is not part of the payload: it travels in the packet header.
Encoded encode(const ServerMessage& message);

/// Puts packets together again, one message at a time. The first thing wrong makes it fail for good.
class Assembler {
 public:
  explicit Assembler(std::size_t max_message) : max_message_(max_message) {}

  /// Takes one packet. False: the packet is malformed, oversized or out of order; `error` says how.
  bool add(std::span<const std::byte> packet, std::string* error);
  /// True when a whole message stands; take it before the next add.
  bool complete() const;

  std::optional<ClientMessage> take_client_message(std::string* error);
  std::optional<ServerMessage> take_server_message(std::string* error);

 private:
  std::size_t max_message_;
  std::vector<std::byte> buffer_;
  std::size_t expected_ = 0;  // bytes of the message under way; 0: none
  Token token_ = -1;
};

}  // namespace gs::wire
