#include "common/listener.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

namespace platform {
namespace {

constexpr mode_t kOwnerOnly = 0600;
constexpr mode_t kOwnerAndGroup = 0660;

[[noreturn]] void fail(const std::string& what, int error) { throw ListenError(what + ": " + strerror(error)); }

std::string holder_of(int lock_fd) {
  char text[32] = {};
  const ssize_t length = pread(lock_fd, text, sizeof text - 1, 0);
  const std::string pid(text, length > 0 ? strcspn(text, "\n") : 0);
  return pid.empty() ? "" : " (pid " + pid + ")";
}

}  // namespace

void make_directory_of(const std::string& path) {
  const std::string directory = path.substr(0, path.rfind('/'));
  if (mkdir(directory.c_str(), 0755) != 0 && errno != EEXIST) fail("cannot make " + directory, errno);
}

Listener::Listener(const std::string& program, const std::string& path, std::optional<unsigned> access_group)
    : program_(program), path_(path) {
  lock();
  bind_and_listen(access_group);
}

Listener::~Listener() { close(); }

void Listener::close() {
  if (!socket_) return;
  unlink(path_.c_str());
  socket_ = Descriptor();
}

void Listener::lock() {
  const std::string lock_path = path_ + ".lock";
  lock_ = Descriptor(open(lock_path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, kOwnerOnly));
  if (!lock_) fail("cannot open the lock file " + lock_path, errno);
  if (flock(lock_.get(), LOCK_EX | LOCK_NB) != 0) {
    if (errno != EWOULDBLOCK) fail("cannot lock " + lock_path, errno);
    throw ListenError("another " + program_ + holder_of(lock_.get()) + " already serves " + path_);
  }
  const std::string pid = std::to_string(getpid()) + "\n";
  if (ftruncate(lock_.get(), 0) != 0 || pwrite(lock_.get(), pid.data(), pid.size(), 0) < 0) {
    fail("cannot write " + lock_path, errno);
  }
}

void Listener::bind_and_listen(std::optional<unsigned> access_group) {
  struct stat found {};
  if (lstat(path_.c_str(), &found) == 0) {
    if (!S_ISSOCK(found.st_mode)) throw ListenError(path_ + " exists and is not a socket");
    if (unlink(path_.c_str()) != 0) fail("cannot remove the old socket " + path_, errno);
  }
  Descriptor bound(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!bound) fail("cannot make a socket", errno);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path_.size() >= sizeof address.sun_path) throw ListenError("the socket path " + path_ + " is too long");
  memcpy(address.sun_path, path_.c_str(), path_.size() + 1);

  // Made for the owner alone and opened to the group afterwards: there is no moment at which others could connect.
  const mode_t old_mask = umask(0777 & ~kOwnerOnly);
  const int result = bind(bound.get(), reinterpret_cast<sockaddr*>(&address), sizeof address);
  const int error = errno;
  umask(old_mask);
  if (result != 0) fail("cannot bind " + path_, error);
  socket_ = std::move(bound);
  if (access_group) {
    if (chown(path_.c_str(), static_cast<uid_t>(-1), *access_group) != 0)
      fail("cannot give " + path_ + " to the access group", errno);
    if (chmod(path_.c_str(), kOwnerAndGroup) != 0) fail("cannot open " + path_ + " to the access group", errno);
  }
  if (listen(socket_.get(), SOMAXCONN) != 0) fail("cannot listen on " + path_, errno);
}

}  // namespace platform
