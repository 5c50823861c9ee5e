#include "common/listener.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

namespace platform {
namespace {

constexpr mode_t kOwnerAndGroup = 0660;
constexpr char kLock[] = ".lock";
constexpr int kMaxDigits = 10;

/// The file may be somebody else's work: only what is a number is believed, and printed.
std::string holder_of(int lock_fd) {
  char text[kMaxDigits + 2] = {};
  const ssize_t length = pread(lock_fd, text, sizeof text - 1, 0);
  const std::size_t digits = length > 0 ? strspn(text, "0123456789") : 0;
  if (digits == 0 || digits > kMaxDigits || text[digits] != '\n') return {};
  return " (pid " + std::string(text, digits) + ")";
}

}  // namespace

void make_directory_of(const std::string& path) {
  const std::string directory = path.substr(0, path.rfind('/'));
  if (mkdir(directory.c_str(), 0755) != 0 && errno != EEXIST) throw ListenError("cannot make " + directory, errno);
}

Listener::Listener(const std::string& program, const std::string& path, std::optional<unsigned> access_group)
    : program_(program), path_(path), access_group_(access_group) {
  Place place = socket_place(path);
  lock_ = lock(place);
  socket_ = listen_at(std::move(place));
}

Descriptor Listener::lock(const Place& place) const {
  const std::string name = place.name() + kLock;
  const std::string path = path_ + kLock;
  constexpr int kFlags = O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY;
  Descriptor file(openat(place.folder(), name.c_str(), kFlags, NamedSocket::kOwnerOnly));
  if (!file) throw ListenError("cannot open the lock file " + path, errno);
  const auto opened = file_of(file.get());
  if (!opened || !S_ISREG(opened->st_mode) || opened->st_uid != geteuid() || opened->st_nlink != 1) {
    throw ListenError(path + " is no lock file of this daemon's user: remove it, or choose another path");
  }
  if (flock(file.get(), LOCK_EX | LOCK_NB) != 0) {
    if (errno != EWOULDBLOCK) throw ListenError("cannot lock " + path, errno);
    throw ListenError("another " + program_ + holder_of(file.get()) + " already serves " + path_);
  }
  if (!same_file(opened, place.found(kLock))) throw ListenError(path + " was removed while it was locked");
  const std::string pid = std::to_string(getpid()) + "\n";
  if (ftruncate(file.get(), 0) != 0 || pwrite(file.get(), pid.data(), pid.size(), 0) < 0) {
    throw ListenError("cannot write " + path, errno);
  }
  return file;
}

std::unique_ptr<NamedSocket> Listener::listen_at(Place place) const {
  const NamedSocket::Access access{access_group_ ? kOwnerAndGroup : NamedSocket::kOwnerOnly, access_group_};
  auto bound = std::make_unique<NamedSocket>(std::move(place), SOCK_SEQPACKET, access);
  if (::listen(bound->fd(), SOMAXCONN) != 0) throw ListenError("cannot listen on " + path_, errno);
  return bound;
}

bool Listener::lock_in_place(const Place& place) const {
  return same_file(place.found(kLock), file_of(lock_.get()));
}

bool Listener::put_in_place(spdlog::logger& log, const std::function<void()>& before) {
  Place place = socket_place(path_);
  if (!lock_in_place(place)) {
    lock_ = lock(place);
    log.warn("{}{} was removed: locked anew", path_, kLock);
  }
  if (socket_->in_place()) return false;
  auto fresh = listen_at(std::move(place));
  before();
  socket_ = std::move(fresh);
  log.warn("{} was removed or replaced: bound anew", path_);
  return true;
}

bool Listener::keep_in_place(spdlog::logger& log, const std::function<void()>& before) {
  if (!socket_) return false;
  try {
    const bool bound_anew = put_in_place(log, before);
    obstacle_.clear();
    return bound_anew;
  } catch (const ListenError& error) {
    if (obstacle_ != error.what()) log.error("{}", error.what());
    obstacle_ = error.what();
    return false;
  }
}

}  // namespace platform
