// A local socket with a name in the file system.
#pragma once

#include <sys/types.h>

#include <optional>
#include <stdexcept>
#include <string>

#include "common/place.h"

namespace platform {

/// Says in one line why the daemon cannot listen.
class ListenError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
  /// `error`: a number, behind `what` as its text.
  ListenError(const std::string& what, int error);
};

/// The place of a socket. Throws ListenError: no such folder, or one in which others could exchange the socket.
Place socket_place(const std::string& path);

/// The name goes with the object, if it is still this socket's.
class NamedSocket {
 public:
  static constexpr mode_t kOwnerOnly = 0600;
  struct Access {
    mode_t mode = kOwnerOnly;
    std::optional<gid_t> group = {};
  };

  /// Bound, not blocking. Takes the place of a socket that a dead process has left there: that nobody serves it
  /// any more, the caller knows. Throws ListenError.
  NamedSocket(Place place, int type, const Access& access);
  ~NamedSocket();
  NamedSocket(const NamedSocket&) = delete;
  NamedSocket& operator=(const NamedSocket&) = delete;

  int fd() const { return socket_.get(); }
  /// False: who connects to the path does not get here.
  bool in_place() const;

 private:
  NamedSocket(Place place, int type);
  void open_to(const Access& access) const;

  const Place place_;
  Descriptor socket_;
  Descriptor file_;  // what bears the name; while it is open no other file has its number
};

}  // namespace platform
