// What the session layer needs of the connections under it. The server gives it sockets, tests give it memory.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>

#include "common/peer.h"

namespace gs::daemon {

using ConnectionId = std::uint64_t;  // never used twice

using platform::Peer;

class Transport {
 public:
  enum class Sent {
    kDone,
    kFull,  // nothing was sent; `wait_writable` says when to try again
    kGone,  // the peer is gone
  };

  virtual ~Transport() = default;
  /// Sends one packet, header and slice as one, without waiting.
  virtual Sent send_packet(ConnectionId to, std::span<const std::byte> header,
                           std::span<const std::byte> slice) = 0;
  /// Asks for one call of SessionLayer::writable as soon as there is room.
  virtual void wait_writable(ConnectionId connection) = 0;
  /// Asks for a call of SessionLayer::lost when the process at the other end ends, after what it has sent was
  /// received: others may hold its socket. False: it has ended already.
  virtual bool watch_process(ConnectionId connection) = 0;
  /// What was sent before still arrives. The session layer never names `connection` again.
  virtual void close(ConnectionId connection) = 0;
};

}  // namespace gs::daemon
