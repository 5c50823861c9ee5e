// A daemon's socket in the file system: one daemon to a path, made for its owner and the access group.
#pragma once

#include <spdlog/logger.h>

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "common/named_socket.h"

namespace platform {

/// Holds a lock on `path`.lock for as long as it lives, so that what it finds at `path` is a dead daemon's and can
/// be taken away. The lock file stays behind: to remove it would let two daemons lock two files of that name.
class Listener {
 public:
  /// How often to look whether all is in place.
  static constexpr std::chrono::seconds kLookAgain{1};
  /// How long not to accept when descriptors have run out.
  static constexpr std::chrono::milliseconds kAcceptPause{100};

  /// Listens, not blocking, for whole packets. `program` names the daemon to whom it finds the path in use. Throws
  /// ListenError: the path is in use, too long, no socket, not permitted, or in a folder that others can write.
  Listener(const std::string& program, const std::string& path, std::optional<unsigned> access_group);
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;

  /// Not after `close`.
  int fd() const { return socket_->fd(); }
  /// Nobody can connect any more; the socket is removed, as at this object's end.
  void close() { socket_.reset(); }

  /// Locks and binds anew what somebody has removed or replaced, with a line in the log. True: fd() is another
  /// now; `before` was called while the old one was still open. What stands in the way is told once.
  bool keep_in_place(spdlog::logger& log, const std::function<void()>& before);
  /// As keep_in_place has found or left it. False: another daemon may serve the path by now.
  bool in_place() const { return obstacle_.empty(); }

 private:
  std::unique_ptr<NamedSocket> listen_at(Place place) const;
  Descriptor lock(const Place& place) const;
  bool lock_in_place(const Place& place) const;
  bool put_in_place(spdlog::logger& log, const std::function<void()>& before);

  const std::string program_;
  const std::string path_;
  const std::optional<unsigned> access_group_;
  Descriptor lock_;
  std::unique_ptr<NamedSocket> socket_;
  std::string obstacle_;  // that was told last
};

/// Makes the directory that `path` lies in, for all to enter; /run is empty after every start of the host. Throws
/// ListenError.
void make_directory_of(const std::string& path);

}  // namespace platform
