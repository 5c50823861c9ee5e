// A local datagram socket with an address that the kernel chose: how tests, the programs that they start and the
// requesters that they play talk to one another.
#pragma once

#include <poll.h>
#include <stddef.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <string>

class Datagram {
 public:
  static constexpr int kPatienceMs = 30000;  ///< a bound on a hang

  Datagram() : fd_(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    const int on = 1;
    setsockopt(fd_, SOL_SOCKET, SO_PASSCRED, &on, sizeof on);
    sockaddr_un own = {};
    own.sun_family = AF_UNIX;
    bind(fd_, reinterpret_cast<sockaddr*>(&own), sizeof own.sun_family);
  }
  ~Datagram() { close(fd_); }
  Datagram(const Datagram&) = delete;
  Datagram& operator=(const Datagram&) = delete;

  int fd() const { return fd_; }

  sockaddr_un address() const {
    sockaddr_un own = {};
    socklen_t length = sizeof own;
    getsockname(fd_, reinterpret_cast<sockaddr*>(&own), &length);
    return own;
  }

  /// The abstract name without its NUL, fit for a command line.
  std::string name() const { return address().sun_path + 1; }

  bool send(const std::string& to, const std::string& bytes) const {
    sockaddr_un peer = {};
    peer.sun_family = AF_UNIX;
    to.copy(peer.sun_path + 1, sizeof peer.sun_path - 1);
    const auto length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + to.size());
    return sendto(fd_, bytes.data(), bytes.size(), 0, reinterpret_cast<sockaddr*>(&peer), length) >= 0;
  }

  /// The next datagram, empty when none comes in time. *sender becomes its sender's process id, as seen from here.
  std::string receive(pid_t* sender = nullptr) const {
    pollfd entry = {fd_, POLLIN, 0};
    if (poll(&entry, 1, kPatienceMs) != 1) return "";
    std::string bytes(16384, '\0');
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))];
    iovec part = {bytes.data(), bytes.size()};
    msghdr message = {};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    const ssize_t got = recvmsg(fd_, &message, 0);
    bytes.resize(got > 0 ? static_cast<size_t>(got) : 0);
    const cmsghdr* credentials = CMSG_FIRSTHDR(&message);
    if (sender != nullptr && credentials != nullptr) {
      ucred who;
      memcpy(&who, CMSG_DATA(credentials), sizeof who);
      *sender = who.pid;
    }
    return bytes;
  }

 private:
  int fd_;
};
