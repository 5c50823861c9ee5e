#include "master/control_server.h"

#include <sys/socket.h>

#include <cerrno>
#include <cstring>

namespace kpl::master {
namespace {

using platform::Descriptor;

constexpr int kAcceptsAtOnce = 16;                    // before the connected are served again
constexpr std::size_t kMaxConnections = 256;          // one more is closed at once
constexpr std::size_t kKeptForRoot = 16;              // of them: the access group cannot lock root out
constexpr std::size_t kMaxWaiting = 4 * 1024 * 1024;  // bytes; a requester that does not read is closed
constexpr int kSendBuffer = 512 * 1024;               // bytes; the system may give less

}  // namespace

ControlServer::ControlServer(const Loop& loop, spdlog::logger& log, const std::string& path,
                             platform::AccessRule access, Handler handler)
    : loop_(loop),
      log_(log),
      access_(access),
      handler_(std::move(handler)),
      listener_("kplmstr", path, access.group),
      accept_again_(loop, [this] { acceptable_->arm(); }),
      client_log_(log),
      tell_left_out_(loop, [this] { client_log_.tell_left_out(); }) {
  start_accepting();
}

ControlServer::~ControlServer() { client_log_.tell_left_out(); }

void ControlServer::start_accepting() {
  acceptable_.emplace(loop_, listener_.fd(), EV_READ | EV_PERSIST, [this] { on_acceptable(); });
}

bool ControlServer::keep_in_place() {
  const auto leave_old = [this] {
    for (int i = 0; i < SOMAXCONN && accept_one(); ++i) {  // those that have found it are still served
    }
    acceptable_.reset();
  };
  if (listener_.keep_in_place(log_, leave_old)) start_accepting();
  return listener_.in_place();
}

void ControlServer::warn_about(std::optional<std::uint32_t> user, const std::string& line) {
  using platform::ClientLog;
  if (client_log_.write(user, spdlog::level::warn, line, platform::now()))
    tell_left_out_.arm(ClientLog::kTellAfter);
}

void ControlServer::on_acceptable() {
  for (int i = 0; i < kAcceptsAtOnce && accept_one(); ++i) {
  }
}

bool ControlServer::accept_one() {
  Descriptor socket(accept4(listener_.fd(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
  if (socket) {
    add_connection(std::move(socket));
    return true;
  }
  if (errno == ECONNABORTED || errno == EINTR) return true;
  if (errno == EAGAIN) return false;
  // The connection that could not be accepted stays in the queue and would wake the loop again and again.
  warn_about({}, std::string("cannot accept more connections for now: ") + strerror(errno));
  acceptable_->disarm();
  accept_again_.arm(platform::Listener::kAcceptPause);
  return false;
}

void ControlServer::add_connection(Descriptor socket) {
  const std::optional<platform::Peer> peer = platform::peer_of(socket.get());
  if (!peer) return;  // gone already
  const auto refuse = [&](const char* why) {
    const std::string whose = "pid " + std::to_string(peer->pid) + ", uid " + std::to_string(peer->uid);
    warn_about(peer->uid, "connection (" + whose + "): closed: " + why);
  };
  if (!access_.allows(*peer)) return refuse("not permitted");
  if (connections_.size() >= kMaxConnections - (peer->uid == 0 ? 0 : kKeptForRoot)) {
    return refuse("too many connections");
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
    warn_about({}, "a requester does not read its answer: closed");
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
