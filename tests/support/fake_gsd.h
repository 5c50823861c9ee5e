// A daemon that a test plays itself, message by message, to say and do what the real one would not on demand.
#pragma once

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <future>
#include <stdexcept>
#include <string>

#include "support/temp_dir.h"
#include "support/wire_packets.h"

namespace test_support {

/// The daemon's end of a connection. What does not come within a long time throws.
class FakePeer {
 public:
  FakePeer() = default;
  explicit FakePeer(int fd) : fd_(fd) {}
  FakePeer(FakePeer&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  FakePeer& operator=(FakePeer&& other) noexcept {
    std::swap(fd_, other.fd_);
    return *this;
  }
  ~FakePeer() { close(); }

  void close() {
    if (fd_ >= 0) ::close(std::exchange(fd_, -1));
  }
  void send_bytes(const std::string& bytes) { ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL); }
  void send(const gs::wire::ServerMessage& message) {
    for (const auto& packet : gs::wire::packets_of(message))
      ::send(fd_, packet.data(), packet.size(), MSG_NOSIGNAL);
  }
  template <typename T>
  T receive() {
    gs::wire::Assembler assembler(gs::wire::kMaxClientMessage);
    gs::wire::Packet packet(gs::wire::kMaxPacket);
    std::string error;
    while (!assembler.complete()) {
      pollfd watched{fd_, POLLIN, 0};
      if (poll(&watched, 1, 60'000) != 1) throw std::runtime_error("nothing comes from the client");
      const ssize_t length = recv(fd_, packet.data(), packet.size(), 0);
      if (length <= 0) throw std::runtime_error("the client has closed");
      if (!assembler.add({packet.data(), static_cast<std::size_t>(length)}, &error))
        throw std::runtime_error(error);
    }
    return std::get<T>(assembler.take_client_message(&error).value());
  }

 private:
  int fd_ = -1;
};

struct FakeSession {
  FakePeer request;
  FakePeer event;
  void close() {
    request.close();
    event.close();
  }
};

class FakeGsd {
 public:
  FakeGsd() : listener_(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path().copy(address.sun_path, sizeof address.sun_path - 1);
    if (bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 || listen(listener_, 8) != 0) {
      throw std::runtime_error("cannot listen on " + path());
    }
  }
  ~FakeGsd() { close(listener_); }
  FakeGsd(const FakeGsd&) = delete;
  FakeGsd& operator=(const FakeGsd&) = delete;

  std::string path() const { return dir_ / "gsd.sock"; }
  std::string endpoint() const { return "unix:" + path(); }

  FakePeer accept() {
    pollfd watched{listener_, POLLIN, 0};
    if (poll(&watched, 1, 60'000) != 1) throw std::runtime_error("nobody connects");
    return FakePeer(::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC));
  }
  /// Both channels of a session on node 5, greeted; to be called while the client sets up.
  FakeSession accept_session() {
    FakeSession session;
    session.request = accept();
    session.request.receive<gs::wire::Hello>();
    session.request.send(gs::wire::Welcome{5, 1, 99});
    session.event = accept();
    session.event.receive<gs::wire::Attach>();
    session.event.send(gs::wire::Answer{WYX_OK});
    return session;
  }

 private:
  TempDir dir_;
  int listener_;
};

}  // namespace test_support
