#include "client/channel.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

#include "client/failure_log.h"

namespace gs::client {
namespace {

/// WYX_CONNECT_FAILED, with the reason recorded.
wyx_rc_t not_connected(const std::string& path, int error) {
  const char* what = "connect";
  if (error == ENOENT) what = "connect-absent";
  if (error == EACCES || error == EPERM) what = "connect-denied";
  if (error == ECONNREFUSED) what = "connect-refused";
  if (error == EAGAIN) error = ETIMEDOUT;  // its queue of connections stayed full
  if (error == ETIMEDOUT) what = "connect-timeout";
  record_failure(what, error, "cannot connect to " + path + ": " + strerrordesc_np(error));
  return WYX_CONNECT_FAILED;
}

}  // namespace

std::unique_ptr<Channel> Channel::connect(const std::string& path, wyx_rc_t* rc) {
  auto channel = std::make_unique<Channel>(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
  if (channel->fd() < 0) {
    const int error = errno;
    record_failure("socket", error, std::string("cannot make a socket: ") + strerrordesc_np(error));
    *rc = WYX_SOCK_CREATE_FAILED;
    return nullptr;
  }
  const timeval limit = {kPatience, 0};
  setsockopt(channel->fd(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof(limit));
  channel->limit_waits(kPatience);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  const auto until = channel->deadline();
  int connected;
  do {
    connected = ::connect(channel->fd(), reinterpret_cast<const sockaddr*>(&address), sizeof(address));
  } while (connected != 0 && errno == EINTR && Clock::now() < until);
  if (connected == 0) return channel;
  *rc = not_connected(path, errno == EINTR ? ETIMEDOUT : errno);
  return nullptr;
}

Channel::Channel(int fd) : fd_(fd), assembler_(wire::kMaxServerMessage), packet_(wire::kMaxPacket + 1) {}

void Channel::limit_waits(int seconds) {
  limit_ = seconds;
  const timeval limit = {seconds, 0};
  setsockopt(fd(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit));
}

/// False: nothing has happened until then.
bool Channel::await(short events, Clock::time_point until) const {
  for (;;) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(until - Clock::now()).count();
    pollfd watched = {fd(), events, 0};
    const int happened = poll(&watched, 1, static_cast<int>(std::max<decltype(left)>(left, 0)));
    if (happened > 0) return true;
    if (left <= 0 || (happened < 0 && errno != EINTR)) return false;
  }
}

Channel::Got Channel::send_packet(std::span<std::byte> header, std::span<const std::byte> slice,
                                  Clock::time_point until) {
  std::array<iovec, 2> parts = {iovec{header.data(), header.size()},
                                iovec{const_cast<std::byte*>(slice.data()), slice.size()}};
  msghdr packet{};
  packet.msg_iov = parts.data();
  packet.msg_iovlen = parts.size();
  for (;;) {
    if (sendmsg(fd(), &packet, MSG_NOSIGNAL | MSG_DONTWAIT) >= 0) return Got::kMessage;
    if (errno == EINTR) continue;
    if (errno != EAGAIN && errno != EWOULDBLOCK) return Got::kEnd;
    if (!await(POLLOUT, until)) return Got::kTimeout;
  }
}

Channel::Got Channel::send(const wire::ClientMessage& message) {
  const wire::Encoded encoded = wire::encode_for_now(message);
  return encoded ? send(encoded, deadline()) : Got::kEnd;
}

Channel::Got Channel::send(const wire::Encoded& message, Clock::time_point until) {
  for (std::size_t index = 0; index < message.packets(); ++index) {
    std::array<std::byte, wire::kHeaderSize> header;
    const auto slice = message.packet_for(index, -1, header);
    const Got sent = send_packet(header, slice, until);
    if (sent != Got::kMessage) return sent;
  }
  return Got::kMessage;
}

Channel::Got Channel::ask(const wire::ClientMessage& question, wire::ServerMessage* answer) {
  const wire::Encoded encoded = wire::encode_for_now(question);
  if (!encoded) return Got::kEnd;
  const auto until = deadline();
  const Got sent = send(encoded, until);
  if (sent == Got::kTimeout) return sent;
  if (sent == Got::kEnd) {  // then all that was said is here
    const Got got = receive(answer);
    return got == Got::kNothing ? Got::kEnd : got;
  }
  // Mostly the answer comes as one packet: waiting for it in recv saves a system call.
  Got got = receive(answer, 0);
  while (got == Got::kNothing) {
    if (!await(POLLIN, until)) return Got::kTimeout;
    got = receive(answer);
  }
  return got;
}

Channel::Got Channel::receive(wire::ServerMessage* message) { return receive(message, MSG_DONTWAIT); }

/// `flags`: of the first packet; nothing more is waited for.
Channel::Got Channel::receive(wire::ServerMessage* message, int flags) {
  std::string error;
  for (;; flags = MSG_DONTWAIT) {
    const ssize_t length = recv(fd(), packet_.data(), packet_.size(), flags);
    // ECONNRESET: the other side has left something unread; what it had said before, and then its end, follow.
    if (length < 0 && (errno == EINTR || errno == ECONNRESET)) continue;
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

void Channel::shut_down() { shutdown(fd(), SHUT_RDWR); }

}  // namespace gs::client
