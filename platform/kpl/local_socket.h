// Local datagram sockets as the KPL library uses them: an owned descriptor, and addresses without a length.
#ifndef KPL_LOCAL_SOCKET_H
#define KPL_LOCAL_SOCKET_H

#include <sys/socket.h>
#include <sys/un.h>

namespace kpl {

/// Owns one descriptor.
class Descriptor {
 public:
  Descriptor() = default;
  ~Descriptor() { reset(); }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  bool is_open() const { return fd_ >= 0; }
  int get() const { return fd_; }
  /// Closes what is held and takes `fd` (-1: nothing). Leaves errno alone.
  void reset(int fd = -1);

 private:
  int fd_ = -1;
};

/// A new local datagram socket, closed on exec; -1 with errno.
int open_datagram_socket();

/// The length that the kernel wants for a return address, 0 when it names nobody. See kpl.h for what it may hold.
socklen_t address_length(const sockaddr_un& address);

/// The address that `text` stands for: a path, or an abstract name with '@' for its NUL. False when it is empty or
/// does not fit.
bool address_from_text(const char* text, sockaddr_un* address);

}  // namespace kpl

#endif
