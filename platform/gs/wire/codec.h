// Messages to packets and back. docs/wire.md describes the format.
//
// A message is one or more packets of a SOCK_SEQPACKET socket, each at most kMaxPacket bytes: a fixed header
// (magic, version, flags, token, whole length) and a slice of one FlatBuffer whose schema is gs.fbs. Everything
// that is read is checked before it is used: header, lengths, the FlatBuffer itself, every enumeration and every
// limit.
//
// The limits here only keep a hostile peer within bounds. What has a result code of its own (a group name over
// kMaxGroupName, a state value over kMaxStateValue) passes, for the engine to answer; whatever does not fit
// `problem_with` must be answered by the caller of `encode`, since the daemon closes a client that sends it.
//
// All of it is safe to use from several threads at once on different objects.
#pragma once

#include <array>
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
inline constexpr std::size_t kMaxWireName = 4096;  // characters of a group, local or program name
inline constexpr std::size_t kHeaderSize = 16;     // bytes
inline constexpr std::size_t kMaxSlice = kMaxPacket - kHeaderSize;

/// One message's packets, ready to be sent in order. Immutable; the same packets go to any number of receivers,
/// each with its own token in the header. Copies share the payload.
class Encoded {
 public:
  class Weak;

  Encoded() = default;
  /// False: there is no message, or it was over the limit of its direction and cannot be sent.
  explicit operator bool() const { return payload_ != nullptr; }
  /// Bytes of all packets together, headers included.
  std::size_t size() const { return length_ + packets() * kHeaderSize; }
  std::size_t packets() const { return (length_ + kMaxSlice - 1) / kMaxSlice; }
  /// Writes packet `index`'s header for `token` and returns its payload slice, which lives as long as this does.
  /// `token` is the receiver's for a Notify, -1 for every other message.
  std::span<const std::byte> packet_for(std::size_t index, Token token,
                                        std::span<std::byte, kHeaderSize> header) const;
  /// Whether they share their payload.
  bool operator==(const Encoded& other) const { return payload_ == other.payload_; }

 private:
  friend Encoded encode(const ClientMessage&);
  friend Encoded encode_for_now(const ClientMessage&);
  friend Encoded encode(const ServerMessage&);
  Encoded(const std::uint8_t* payload, std::size_t length, std::size_t limit);
  static Encoded view(const std::uint8_t* payload, std::size_t length, std::size_t limit);

  std::shared_ptr<const std::byte[]> payload_;
  std::size_t length_ = 0;  // bytes of the payload
};

/// Finds packets again as long as somebody else has them.
class Encoded::Weak {
 public:
  Weak() = default;
  explicit Weak(const Encoded& packets) : payload_(packets.payload_), length_(packets.length_) {}
  /// False: nobody has them.
  Encoded lock() const {
    Encoded packets;
    packets.payload_ = payload_.lock();
    packets.length_ = packets ? length_ : 0;
    return packets;
  }

 private:
  std::weak_ptr<const std::byte[]> payload_;
  std::size_t length_ = 0;
};

Encoded encode(const ClientMessage& message);
/// The same without a copy: lives until this thread encodes again.
Encoded encode_for_now(const ClientMessage& message);
/// A Notify is encoded without its token: give that to packet_for.
Encoded encode(const ServerMessage& message);

/// About the bytes that a notification's packets have, rather more than less, without encoding it.
std::size_t estimated_size(const Notification& notification);

/// Why the daemon would take this request for malformed: a name over kMaxWireName or with a NUL in it, an
/// enumeration value that does not exist, a payload that does not fit a message. Null: it would not. (An
/// enumeration of 0, "not set", passes: it is the engine's to answer.)
const char* problem_with(const Request& request);

/// Puts packets together again, one message at a time. The first thing wrong makes it fail for good.
class Assembler {
 public:
  explicit Assembler(std::size_t max_message) : max_message_(max_message) {}

  /// Takes one packet. False: the packet is malformed, oversized or out of order; `error` says how.
  bool add(std::span<const std::byte> packet, std::string* error);
  /// True when a whole message stands; take it before the next add.
  bool complete() const { return expected_ != 0 && buffer_.size() == expected_; }

  /// Bytes of the message that is under way.
  std::size_t held() const { return buffer_.size(); }

  /// The whole message, decoded. Nothing: it is malformed and `error` says how.
  std::optional<ClientMessage> take_client_message(std::string* error);
  std::optional<ServerMessage> take_server_message(std::string* error);

 private:
  bool fail(std::string* error, const char* why);
  void reset();

  std::size_t max_message_;
  std::vector<std::byte> buffer_;
  std::size_t expected_ = 0;  // bytes of the message under way; 0: none
  Token token_ = -1;
  bool failed_ = false;
};

}  // namespace gs::wire
