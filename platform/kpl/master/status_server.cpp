#include "master/status_server.h"

#include <sys/socket.h>

#include <cerrno>
#include <cstring>

#include "common/listener.h"

namespace kpl::master {
namespace {

constexpr mode_t kForAll = 0666;
constexpr int kAcceptsAtOnce = 16;  // before others are served again

}  // namespace

StatusServer::StatusServer(const Loop& loop, const std::string& path, Lookup lookup)
    : loop_(loop),
      path_(path),
      connections_(loop, std::move(lookup)),
      accept_again_(loop, [this] { readable_->arm(); }) {
  listen_at_path();
}

void StatusServer::listen_at_path() {
  auto bound = std::make_unique<platform::NamedSocket>(platform::socket_place(path_), SOCK_SEQPACKET,
                                                       platform::NamedSocket::Access{kForAll});
  if (listen(bound->fd(), SOMAXCONN) != 0) {
    throw platform::ListenError("cannot listen on " + path_ + ": " + strerror(errno));
  }
  if (socket_) connections_.accept_from(socket_->fd(), SOMAXCONN);  // who has found the old one is still served
  readable_.reset();
  socket_ = std::move(bound);
  readable_.emplace(loop_, socket_->fd(), EV_READ | EV_PERSIST, [this] { on_readable(); });
}

/// A connection that could not be accepted stays in the queue and would wake the loop again and again.
void StatusServer::on_readable() {
  if (connections_.accept_from(socket_->fd(), kAcceptsAtOnce)) return;
  readable_->disarm();
  accept_again_.arm(platform::Listener::kAcceptPause);
}

/// What stands in the way is the control socket's to tell, which lies beside it.
void StatusServer::keep_in_place() {
  if (socket_->in_place()) return;
  try {
    listen_at_path();
  } catch (const platform::ListenError&) {
    return;
  }
}

}  // namespace kpl::master
