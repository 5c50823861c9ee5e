#include "client/channel.h"

#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>

#include "client/failure_log.h"

namespace gs::client {
namespace {

bool send_packet(int fd, std::span<std::byte> header, std::span<const std::byte> slice) {
  std::array<iovec, 2> parts = {iovec{header.data(), header.size()},
                                iovec{const_cast<std::byte*>(slice.data()), slice.size()}};
  msghdr packet{};
  packet.msg_iov = parts.data();
  packet.msg_iovlen = parts.size();
  ssize_t sent;
  do {
    sent = sendmsg(fd, &packet, MSG_NOSIGNAL);
  } while (sent < 0 && errno == EINTR);
  return sent >= 0;
}

}  // namespace

std::unique_ptr<Channel> Channel::connect(const std::string& path, wyx_rc_t* rc) {
  const int fd = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    record_failure("socket", errno);
    *rc = WYX_SOCK_CREATE_FAILED;
    return nullptr;
  }
  auto channel = std::make_unique<Channel>(fd);
  channel->limit_waits(kPatience);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  int connected;
  do {
    connected = ::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address));
  } while (connected != 0 && errno == EINTR);
  if (connected != 0) {
    record_failure("connect", errno);
    *rc = WYX_CONNECT_FAILED;
    return nullptr;
  }
  return channel;
}

Channel::Channel(int fd) : fd_(fd), assembler_(wire::kMaxServerMessage), packet_(wire::kMaxPacket + 1) {}

Channel::~Channel() { close(fd_); }

void Channel::limit_waits(int seconds) {
  const timeval limit = {seconds, 0};
  setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit));
  setsockopt(fd_, SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof(limit));
}

bool Channel::send(const wire::ClientMessage& message) {
  const wire::Encoded encoded = wire::encode(message);
  if (!encoded) return false;
  for (std::size_t index = 0; index < encoded.packets(); ++index) {
    std::array<std::byte, wire::kHeaderSize> header;
    const auto slice = encoded.packet_for(index, -1, header);
    if (!send_packet(fd_, header, slice)) return false;
  }
  return true;
}

Channel::Got Channel::receive(int flags, wire::ServerMessage* message) {
  std::string error;
  for (;;) {
    const ssize_t length = recv(fd_, packet_.data(), packet_.size(), flags);
    if (length < 0 && errno == EINTR) continue;
    if (length < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return Got::kNothing;
    if (length <= 0) return Got::kEnd;
    if (!assembler_.add({packet_.data(), static_cast<std::size_t>(length)}, &error)) break;
    if (!assembler_.complete()) continue;
    auto taken = assembler_.take_server_message(&error);
    if (!taken) break;
    *message = std::move(*taken);
    return Got::kMessage;
  }
  return Got::kMalformed;
}

void Channel::shut_down() { shutdown(fd_, SHUT_RDWR); }

}  // namespace gs::client
