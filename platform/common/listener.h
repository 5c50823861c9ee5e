// A daemon's socket in the file system: one daemon to a path, made for its owner and the access group.
#pragma once

#include <optional>
#include <stdexcept>
#include <string>

#include "common/descriptor.h"

namespace platform {

/// Says in one line why the daemon cannot listen.
class ListenError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

/// Holds a lock on `path`.lock for as long as it lives, so that what it finds at `path` is a dead daemon's and can
/// be taken away. The lock file stays behind: to remove it would let two daemons lock two files of that name.
class Listener {
 public:
  /// Listens, not blocking, for whole packets. `program` names the daemon to whom it finds the path in use. Throws
  /// ListenError: the path is in use, too long, no socket, or not permitted.
  Listener(const std::string& program, const std::string& path, std::optional<unsigned> access_group);
  /// Removes the socket.
  ~Listener();
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;

  int fd() const { return socket_.get(); }
  /// Nobody can connect any more.
  void close();

 private:
  void lock();
  void bind_and_listen(std::optional<unsigned> access_group);

  const std::string program_;
  const std::string path_;
  Descriptor lock_;
  Descriptor socket_;
};

/// Makes the directory that `path` lies in, for all to enter; /run is empty after every start of the host. Throws
/// ListenError.
void make_directory_of(const std::string& path);

}  // namespace platform
