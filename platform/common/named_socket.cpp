#include "common/named_socket.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>
#include <system_error>

namespace platform {
namespace {

/// What a dead daemon has left; anything else stays.
void remove_old(const Place& place) {
  const auto old = place.found();
  if (!old) return;
  if (!S_ISSOCK(old->st_mode)) throw ListenError(place.path() + " exists and is not a socket");
  if (old->st_uid != 0 && old->st_uid != geteuid()) {
    throw ListenError(place.path() + " is a socket of user " + std::to_string(old->st_uid) +
                      ": remove it, or choose another path");
  }
  if (unlinkat(place.folder(), place.name().c_str(), 0) != 0)
    throw ListenError("cannot remove the old socket " + place.path(), errno);
}

void bind_to(int socket, const Place& place) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const std::string path = place.path_by_descriptor();
  const bool fits = path.size() < sizeof address.sun_path && place.path().size() < sizeof address.sun_path;
  if (!fits) throw ListenError("the socket path " + place.path() + " is too long");
  memcpy(address.sun_path, path.c_str(), path.size() + 1);

  // Made for the owner alone and opened to others afterwards: there is no moment at which just anybody could
  // connect.
  const mode_t old_mask = umask(0777 & ~NamedSocket::kOwnerOnly);
  const int result = bind(socket, reinterpret_cast<sockaddr*>(&address), sizeof address);
  const int error = errno;
  umask(old_mask);
  if (result != 0) throw ListenError("cannot bind " + place.path(), error);
}

}  // namespace

ListenError::ListenError(const std::string& what, int error) : std::runtime_error(what + ": " + strerror(error)) {}

Place socket_place(const std::string& path) try {
  Place place(path);
  const std::string danger = place.danger(S_IWGRP | S_IWOTH);
  if (!danger.empty()) throw ListenError(danger);
  return place;
} catch (const std::system_error& error) {
  throw ListenError(error.what());
}

NamedSocket::NamedSocket(Place place, int type)
    : place_(std::move(place)), socket_(socket(AF_UNIX, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)) {
  if (!socket_) throw ListenError("cannot make a socket", errno);
  remove_old(place_);
  bind_to(socket_.get(), place_);
  file_ = Descriptor(openat(place_.folder(), place_.name().c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  const auto made = file_of(file_.get());
  if (!made || !S_ISSOCK(made->st_mode) || made->st_uid != geteuid()) {
    throw ListenError(place_.path() + " was exchanged by somebody while it was bound");
  }
}

NamedSocket::NamedSocket(Place place, int type, const Access& access) : NamedSocket(std::move(place), type) {
  open_to(access);
}

/// Through the descriptor: no name is looked up, so no link is followed.
void NamedSocket::open_to(const Access& access) const {
  if (access.group && fchownat(file_.get(), "", static_cast<uid_t>(-1), *access.group, AT_EMPTY_PATH) != 0)
    throw ListenError("cannot give " + place_.path() + " to the access group", errno);
  const std::string file = "/proc/self/fd/" + std::to_string(file_.get());
  if (access.mode != kOwnerOnly && chmod(file.c_str(), access.mode) != 0)
    throw ListenError("cannot open " + place_.path() + " to others", errno);
}

NamedSocket::~NamedSocket() {
  if (same_file(place_.found(), file_of(file_.get()))) unlinkat(place_.folder(), place_.name().c_str(), 0);
}

bool NamedSocket::in_place() const {
  return place_.leads_here() && same_file(place_.found(), file_of(file_.get()));
}

}  // namespace platform
