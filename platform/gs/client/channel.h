// One SOCK_SEQPACKET connection to the daemon, speaking whole messages.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "wire/codec.h"

namespace gs::client {

/// One thread may send while another receives; each of the two is one thread's at a time. `shut_down` any
/// thread's. No signal is ever raised. Descriptors are closed on exec.
class Channel {
 public:
  enum class Got { kMessage, kNothing, kEnd, kMalformed };

  /// Seconds: a daemon that takes no connection and answers no greeting or farewell for so long counts as not
  /// there.
  static constexpr int kPatience = 10;

  /// The connection's waits are limited to kPatience. Null: `rc` is WYX_SOCK_CREATE_FAILED or WYX_CONNECT_FAILED,
  /// and the failure is recorded.
  static std::unique_ptr<Channel> connect(const std::string& path, wyx_rc_t* rc);

  /// Takes over a connected socket.
  explicit Channel(int fd);
  ~Channel();
  Channel(const Channel&) = delete;
  Channel& operator=(const Channel&) = delete;

  int fd() const { return fd_; }

  /// Bounds every send and receive from now on; 0: no bound.
  void limit_waits(int seconds);

  /// False: the other side is gone.
  bool send(const wire::ClientMessage& message);
  /// `flags` as for recv: MSG_DONTWAIT answers kNothing instead of waiting. kEnd: the other side is gone.
  /// kMalformed: what it said makes no sense.
  Got receive(int flags, wire::ServerMessage* message);
  /// The next message, which must be a T. Nothing: it is not, or the other side is gone.
  template <typename T>
  std::optional<T> receive_a() {
    wire::ServerMessage message;
    if (receive(0, &message) != Got::kMessage || !std::holds_alternative<T>(message)) return std::nullopt;
    return std::get<T>(std::move(message));
  }

  /// Wakes every waiter. What the other side has sent already can still be received.
  void shut_down();

 private:
  const int fd_;
  wire::Assembler assembler_;
  std::vector<std::byte> packet_;  // one byte more than a packet may have, so that a longer one shows
};

}  // namespace gs::client
