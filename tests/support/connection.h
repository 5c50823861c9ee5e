// One end of a connection between a client and a daemon, for tests that play one of them packet by packet.
#pragma once

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <stdexcept>
#include <string>
#include <utility>

#include "support/wire_packets.h"

namespace test_support {

/// Every wait is bounded; what does not come within the bound, or is malformed, throws.
template <typename Sent, typename Received>
class Connection {
 public:
  explicit Connection(int fd = -1) : fd_(fd) {}
  Connection(Connection&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  Connection& operator=(Connection&& other) noexcept {
    std::swap(fd_, other.fd_);
    return *this;
  }
  ~Connection() { close(); }

  void close() {
    if (fd_ >= 0) ::close(std::exchange(fd_, -1));
  }
  void send_bytes(const std::string& bytes) { ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL); }
  void send(const gs::wire::Packet& packet) { ::send(fd_, packet.data(), packet.size(), MSG_NOSIGNAL); }
  void send(const Sent& message) {
    for (const auto& packet : gs::wire::packets_of(message)) send(packet);
  }

  /// The peer's next message, which is a T.
  template <typename T>
  T receive() {
    gs::wire::Assembler assembler(gs::wire::kMaxServerMessage);
    std::string error;
    while (!assembler.complete()) {
      const gs::wire::Packet packet = next_packet();
      if (packet.empty()) throw std::runtime_error("closed by the peer");
      if (!assembler.add(packet, &error)) throw std::runtime_error(error);
    }
    std::optional<Received> message;
    if constexpr (std::is_same_v<Received, gs::wire::ServerMessage>)
      message = assembler.take_server_message(&error);
    else
      message = assembler.take_client_message(&error);
    if (!message) throw std::runtime_error(error);
    return std::get<T>(*message);
  }
  /// Reads what is still there, up to the peer's close.
  void wait_for_close() {
    while (!next_packet().empty()) {
    }
  }
  /// Empty: the peer has closed.
  gs::wire::Packet next_packet() {
    wait_readable();
    gs::wire::Packet packet(gs::wire::kMaxPacket);
    const ssize_t length = recv(fd_, packet.data(), packet.size(), 0);
    packet.resize(length > 0 ? static_cast<std::size_t>(length) : 0);
    return packet;
  }

 protected:
  int fd() const { return fd_; }
  void wait_readable() const {
    pollfd wanted{fd_, POLLIN, 0};
    if (poll(&wanted, 1, 60'000) != 1) throw std::runtime_error("nothing comes from the peer");
  }
  /// bind or connect.
  template <typename Call>
  void at_path(const std::string& path, Call call) const {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    if (call(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
      throw std::runtime_error("cannot use " + path);
  }

 private:
  int fd_;
};

inline int unix_socket() { return socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0); }

}  // namespace test_support
