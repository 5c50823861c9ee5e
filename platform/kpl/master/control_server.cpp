#include "master/control_server.h"

#include <sys/socket.h>

#include <cerrno>
#include <cstring>

namespace kpl::master {
namespace {

using platform::Descriptor;

constexpr int kAcceptsAtOnce = 16;                      // before the connected are served again
constexpr std::size_t kMaxConnections = 256;            // one more is closed at once
constexpr std::size_t kKeptForRoot = 16;                // of them: the access group cannot lock root out
constexpr std::size_t kMaxWaiting = 4 * 1024 * 1024;    // bytes; a requester that does not read is closed
constexpr int kSendBuffer = 512 * 1024;                 // bytes; the system may give less
constexpr std::chrono::milliseconds kAcceptPause{100};  // when descriptors have run out

}  // namespace

ControlServer::ControlServer(const Loop& loop, spdlog::logger& log, const std::string& path,
                             platform::AccessRule access, Handler handler)
    : loop_(loop),
      log_(log),
      access_(access),
      handler_(std::move(handler)),
      listener_("kplmstr", path, access.group),
      acceptable_(loop, listener_.fd(), EV_READ | EV_PERSIST, [this] { on_acceptable(); }),
      accept_again_(loop, [this] { acceptable_.arm(); }) {}

ControlServer::~ControlServer() = default;

void ControlServer::on_acceptable() {
  for (int i = 0; i < kAcceptsAtOnce; ++i) {
    Descriptor socket(accept4(listener_.fd(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
    if (socket) {
      add_connection(std::move(socket));
      continue;
    }
    if (errno == ECONNABORTED || errno == EINTR) continue;
    if (errno == EAGAIN) return;
    // The connection that could not be accepted stays in the queue and would wake the loop again and again.
    log_.warn("cannot accept more connections for now: {}", strerror(errno));
    acceptable_.disarm();
    return accept_again_.arm(kAcceptPause);
  }
}

void ControlServer::add_connection(Descriptor socket) {
  const std::optional<platform::Peer> peer = platform::peer_of(socket.get());
  if (!peer) return;  // gone already
  if (!access_.allows(*peer)) {
    log_.warn("connection (pid {}, uid {}): closed: not permitted", peer->pid, peer->uid);
    return;
  }
  if (connections_.size() >= kMaxConnections - (peer->uid == 0 ? 0 : kKeptForRoot)) {
    log_.warn("connection (pid {}, uid {}): closed: too many connections", peer->pid, peer->uid);
    return;
  }
  setsockopt(socket.get(), SOL_SOCKET, SO_SNDBUF, &kSendBuffer, sizeof kSendBuffer);
  const ConnectionId id = ++last_connection_;
  Connection& connection = connections_[id];
  connection.socket = std::move(socket);
  connection.readable.emplace(loop_, connection.socket.get(), EV_READ | EV_PERSIST,
                              [this, id] { on_readable(id); });
}

void ControlServer::on_readable(ConnectionId id) {
  std::string packet(control::kMaxPacket + 1, '\0');
  const ssize_t length = recv(connections_.at(id).socket.get(), packet.data(), packet.size(), MSG_DONTWAIT);
  if (length < 0 && (errno == EAGAIN || errno == EINTR)) return;
  if (length <= 0) {
    connections_.erase(id);
    return;
  }
  packet.resize(static_cast<std::size_t>(length));
  on_packet(id, packet);
}

void ControlServer::on_packet(ConnectionId id, const std::string& packet) {
  const Reply reply = [this, id](const control::Answer& given) { answer(id, given); };
  connections_.at(id).readable->disarm();
  control::Request request;
  try {
    request = control::decode_request(packet);
  } catch (const control::Malformed& error) {
    return reply(control::End{control::Result::kFailed, 0, std::string("malformed request: ") + error.what()});
  }
  handler_(request, reply);
}

void ControlServer::answer(ConnectionId id, const control::Answer& answer) {
  const auto found = connections_.find(id);
  if (found == connections_.end()) return;
  Connection& connection = found->second;
  connection.out.push_back(control::encode(answer));
  connection.out_bytes += connection.out.back().size();
  if (std::holds_alternative<control::End>(answer)) connection.readable->arm();
  if (connection.out_bytes > kMaxWaiting) {
    log_.warn("a requester does not read its answer: closed");
    connections_.erase(found);
    return;
  }
  if (connection.out.size() == 1) send_waiting(id);
}

void ControlServer::send_waiting(ConnectionId id) {
  Connection& connection = connections_.at(id);
  while (!connection.out.empty()) {
    const std::string& packet = connection.out.front();
    const ssize_t sent = send(connection.socket.get(), packet.data(), packet.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    if (sent < 0 && errno == EINTR) continue;
    if (sent < 0 && errno != EAGAIN) {
      connections_.erase(id);
      return;
    }
    if (sent < 0) {
      if (connection.writable) return;
      connection.writable.emplace(loop_, connection.socket.get(), EV_WRITE | EV_PERSIST,
                                  [this, id] { send_waiting(id); });
      return;
    }
    connection.out_bytes -= packet.size();
    connection.out.pop_front();
  }
  connection.writable.reset();
}

}  // namespace kpl::master
