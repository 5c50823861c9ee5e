// One SOCK_SEQPACKET connection to the daemon, speaking whole messages.
#pragma once

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "client/fork.h"
#include "wire/codec.h"

namespace gs::client {

/// One thread may send while another receives; each of the two is one thread's at a time. `shut_down` any
/// thread's. No signal is ever raised. Descriptors are closed on exec, and let go of in the child of a fork.
class Channel {
 public:
  enum class Got {
    kMessage,
    kNothing,   // not now
    kTimeout,   // not within the limit
    kEnd,       // the other side is gone
    kMalformed  // what it said makes no sense
  };

  /// Seconds: a daemon that takes no connection and answers no greeting or farewell for so long counts as not
  /// there.
  static constexpr int kPatience = 10;

  /// The connection's waits are limited to kPatience. Null: `rc` is WYX_SOCK_CREATE_FAILED or WYX_CONNECT_FAILED,
  /// and the failure is recorded.
  static std::unique_ptr<Channel> connect(const std::string& path, wyx_rc_t* rc);

  /// Takes over a connected socket.
  explicit Channel(int fd);

  int fd() const { return fd_.get(); }
  /// Keeps the descriptor valid, lets go of the connection.
  void silence() { fd_.silence(); }

  /// Bounds the waiting of every send, and of every ask, from now on.
  void limit_waits(int seconds);
  int limit() const { return limit_; }

  /// kMessage: it is sent. Else kTimeout or kEnd.
  Got send(const wire::ClientMessage& message);
  /// Sends, then receives, each within the limit. What the other side said before it closed is an answer too.
  Got ask(const wire::ClientMessage& question, wire::ServerMessage* answer);
  /// What is there, without waiting; kNothing: no whole message.
  Got receive(wire::ServerMessage* message);

  /// Wakes every waiter. What the other side has sent already can still be received.
  void shut_down();

 private:
  using Clock = std::chrono::steady_clock;

  Clock::time_point deadline() const { return Clock::now() + std::chrono::seconds(limit_); }
  Got receive(wire::ServerMessage* message, int flags);
  bool await(short events, Clock::time_point until) const;
  Got send(const wire::Encoded& message, Clock::time_point until);
  Got send_packet(std::span<std::byte> header, std::span<const std::byte> slice, Clock::time_point until);

  Descriptor fd_;
  int limit_ = kPatience;  // seconds
  wire::Assembler assembler_;
  std::vector<std::byte> packet_;  // one byte more than a packet may have, so that a longer one shows
};

}  // namespace gs::client
