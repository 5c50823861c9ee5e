// A client made of sockets and packets, to say to a daemon what no library would.
#pragma once

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>
#include <string>
#include <utility>

#include "support/wire_packets.h"
#include "wire/codec.h"

namespace test_support {

/// One connection. Every wait is bounded; what does not come within the bound throws.
class RawConnection {
 public:
  explicit RawConnection(const std::string& path) : fd_(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    if (connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) return;
    const std::string error = strerror(errno);
    ::close(fd_);
    throw std::runtime_error("connect " + path + ": " + error);
  }
  RawConnection(RawConnection&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  RawConnection(const RawConnection&) = delete;
  RawConnection& operator=(const RawConnection&) = delete;
  ~RawConnection() { close(); }

  void close() {
    if (fd_ >= 0) ::close(std::exchange(fd_, -1));
  }

  /// False: the daemon has closed.
  bool send_bytes(const void* data, std::size_t size) { return ::send(fd_, data, size, MSG_NOSIGNAL) >= 0; }
  bool send(const gs::wire::Packet& packet) { return send_bytes(packet.data(), packet.size()); }
  bool send(const gs::wire::ClientMessage& message) {
    for (const auto& packet : gs::wire::packets_of(message)) {
      if (!send(packet)) return false;
    }
    return true;
  }

  /// The daemon's next message.
  gs::wire::ServerMessage receive() {
    gs::wire::Assembler assembler(gs::wire::kMaxServerMessage);
    std::string error;
    while (!assembler.complete()) {
      gs::wire::Packet packet = next_packet();
      if (packet.empty()) throw std::runtime_error("closed by the daemon");
      if (!assembler.add(packet, &error)) throw std::runtime_error(error);
    }
    auto message = assembler.take_server_message(&error);
    if (!message) throw std::runtime_error(error);
    return *message;
  }
  template <typename T>
  T receive() {
    return std::get<T>(receive());
  }
  wyx_rc_t call(const gs::Request& request) {
    send(gs::wire::ClientMessage(gs::wire::Call{request}));
    return receive<gs::wire::Answer>().rc;
  }
  /// Reads what is still there, up to the daemon's close.
  void wait_for_close() {
    while (!next_packet().empty()) {
    }
  }

 private:
  gs::wire::Packet next_packet() {
    pollfd wanted{fd_, POLLIN, 0};
    if (poll(&wanted, 1, 60'000) != 1) throw std::runtime_error("nothing comes from the daemon");
    gs::wire::Packet packet(gs::wire::kMaxPacket);
    const ssize_t length = recv(fd_, packet.data(), packet.size(), 0);
    packet.resize(length > 0 ? static_cast<std::size_t>(length) : 0);
    return packet;
  }

  int fd_;
};

/// A session with both its channels.
struct RawSession {
  explicit RawSession(const std::string& path) : request(path), event(path) {
    request.send(gs::wire::ClientMessage(gs::wire::Hello{gs::wire::kProtocolVersion, 0, 0, "raw"}));
    welcome = request.receive<gs::wire::Welcome>();
    event.send(gs::wire::ClientMessage(gs::wire::Attach{welcome.session_number, welcome.cookie}));
    if (event.receive<gs::wire::Answer>().rc != WYX_OK) throw std::runtime_error("attach refused");
  }

  RawConnection request;
  RawConnection event;
  gs::wire::Welcome welcome;
};

}  // namespace test_support
