#include "master/status_server.h"

#include <sys/socket.h>

#include <cerrno>
#include <cstring>

#include "common/listener.h"

namespace kpl::master {
namespace {

constexpr mode_t kForAll = 0666;

}  // namespace

StatusServer::StatusServer(const Loop& loop, const std::string& path, Lookup lookup)
    : loop_(loop),
      path_(path),
      connections_(loop, std::move(lookup)),
      look_again_(loop, [this] { look_at_path(); }) {
  listen_at_path();
  look_again_.arm(platform::Listener::kLookAgain);
}

void StatusServer::listen_at_path() {
  auto bound = std::make_unique<platform::NamedSocket>(platform::socket_place(path_), SOCK_SEQPACKET,
                                                       platform::NamedSocket::Access{kForAll});
  if (listen(bound->fd(), SOMAXCONN) != 0) {
    throw platform::ListenError("cannot listen on " + path_ + ": " + strerror(errno));
  }
  if (socket_) connections_.accept_from(socket_->fd());  // those that have found the old one are still served
  readable_.reset();
  socket_ = std::move(bound);
  readable_.emplace(loop_, socket_->fd(), EV_READ | EV_PERSIST,
                    [this] { connections_.accept_from(socket_->fd()); });
}

/// What stands in the way is the control socket's to tell, which lies beside it.
void StatusServer::look_at_path() {
  look_again_.arm(platform::Listener::kLookAgain);
  if (socket_->in_place()) return;
  try {
    listen_at_path();
  } catch (const platform::ListenError&) {
    return;
  }
}

}  // namespace kpl::master
