#include "client/socket_transport.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>

#include "client/failure_log.h"

namespace gs::client {
namespace {

wyx_rc_t refused_handshake(const char* what, wyx_rc_t rc) {
  record_failure(what, rc);
  return rc == WYX_OK ? WYX_CONNECT_FAILED : rc;
}

/// SIGIO for each arrival, to this process.
void raise_signals(int fd) {
  fcntl(fd, F_SETOWN, getpid());
  fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_ASYNC);
}

/// The greeting on the request channel. Nothing: `rc` says why.
std::optional<wire::Welcome> greet(Channel& requests, const wire::Hello& hello, wyx_rc_t* rc) {
  wire::ServerMessage reply;
  const bool answered = requests.send(hello) && requests.receive(0, &reply) == Channel::Got::kMessage;
  if (answered && std::holds_alternative<wire::Welcome>(reply)) return std::get<wire::Welcome>(reply);
  const auto* answer = answered ? std::get_if<wire::Answer>(&reply) : nullptr;
  *rc = refused_handshake("hello", answer == nullptr ? WYX_CONNECT_FAILED : answer->rc);
  return std::nullopt;
}

wyx_rc_t attach(Channel& events, const wire::Welcome& welcome) {
  std::optional<wire::Answer> answer;
  if (events.send(wire::Attach{welcome.session_number, welcome.cookie})) answer = events.receive_a<wire::Answer>();
  if (answer && answer->rc == WYX_OK) return WYX_OK;
  return refused_handshake("attach", answer ? answer->rc : WYX_CONNECT_FAILED);
}

}  // namespace

std::unique_ptr<SocketTransport> SocketTransport::open(const std::string& path, const wire::Hello& hello,
                                                       wyx_rc_t* rc) {
  auto requests = Channel::connect(path, rc);
  if (!requests) return nullptr;
  const auto welcome = greet(*requests, hello, rc);
  if (!welcome) return nullptr;
  auto events = Channel::connect(path, rc);
  if (!events) return nullptr;
  *rc = attach(*events, *welcome);
  if (*rc != WYX_OK) return nullptr;

  requests->limit_waits(0);
  events->limit_waits(0);
  if ((hello.socket_control & WYX_SOCKET_SIGNAL) != 0) raise_signals(events->fd());
  return std::make_unique<SocketTransport>(std::move(requests), std::move(events), welcome->node_number);
}

wyx_rc_t SocketTransport::query_node_of(const std::string& path, wire::NodeInfo* info) {
  wyx_rc_t rc = WYX_OK;
  const auto channel = Channel::connect(path, &rc);
  if (!channel) return rc;
  std::optional<wire::NodeInfo> answer;
  if (channel->send(wire::QueryNode{})) answer = channel->receive_a<wire::NodeInfo>();
  if (!answer) return refused_handshake("query", WYX_CONNECT_FAILED);
  *info = *answer;
  return WYX_OK;
}

SocketTransport::SocketTransport(std::unique_ptr<Channel> requests, std::unique_ptr<Channel> events,
                                 std::uint32_t node_number)
    : node_number_(node_number), requests_(std::move(requests)), events_(std::move(events)) {}

/// Sends a message and waits for its answer; WYX_NO_INIT when the daemon is gone.
template <typename T>
wyx_rc_t SocketTransport::exchange(const wire::ClientMessage& message, T* answer) {
  MutexLock lock(exchange_mutex_);
  return exchange_locked(message, answer);
}

template <typename T>
wyx_rc_t SocketTransport::exchange_locked(const wire::ClientMessage& message, T* answer) {
  if (gone_) return WYX_NO_INIT;
  std::optional<T> received;
  if (requests_->send(message)) received = requests_->receive_a<T>();
  if (!received) {
    lose("request");
    return WYX_NO_INIT;
  }
  *answer = *received;
  return WYX_OK;
}

wyx_rc_t SocketTransport::call(Request request) {
  wire::Answer answer;
  const wyx_rc_t rc = exchange(wire::Call{std::move(request)}, &answer);
  return rc == WYX_OK ? answer.rc : rc;
}

wyx_rc_t SocketTransport::set_responsiveness(const wire::SetResponsiveness& settings) {
  wire::Answer answer;
  const wyx_rc_t rc = exchange(settings, &answer);
  return rc == WYX_OK ? answer.rc : rc;
}

wyx_rc_t SocketTransport::query_node(wire::NodeInfo* info) { return exchange(wire::QueryNode{}, info); }

Incoming SocketTransport::take() {
  wire::ServerMessage message;
  const Channel::Got got = events_->receive(MSG_DONTWAIT, &message);
  if (got == Channel::Got::kNothing) return {};
  if (got == Channel::Got::kMessage) {
    if (auto* notify = std::get_if<wire::Notify>(&message)) {
      return {Incoming::Kind::kNotification, notify->token, std::move(notify->what), 0};
    }
    if (const auto* ping = std::get_if<wire::Ping>(&message))
      return {Incoming::Kind::kPing, -1, nullptr, ping->number};
  }
  lose(got == Channel::Got::kEnd ? "hang-up" : got == Channel::Got::kMessage ? "farewell" : "malformed");
  return {Incoming::Kind::kGone, -1, nullptr, 0};
}

void SocketTransport::answer_ping(std::uint64_t number, bool ok) {
  MutexLock lock(answer_mutex_);
  if (!events_->send(wire::PingAnswer{number, ok})) lose("ping");
}

void SocketTransport::wait() {
  // The request channel is watched for its end only. It stays ended, also when another thread has silenced the
  // event channel's descriptor in the meantime.
  std::array<pollfd, 2> watched = {pollfd{events_->fd(), POLLIN, 0}, pollfd{requests_->fd(), 0, 0}};
  while (poll(watched.data(), watched.size(), -1) < 0 && errno == EINTR) {
  }
  if (watched[1].revents != 0) lose("hang-up");
}

void SocketTransport::silence() {
  const int quiet = eventfd(0, EFD_CLOEXEC);
  if (quiet < 0) return;
  dup3(quiet, events_->fd(), O_CLOEXEC);
  close(quiet);
}

bool SocketTransport::gone() {
  if (gone_) return true;
  pollfd watched = {requests_->fd(), 0, 0};
  if (poll(&watched, 1, 0) > 0) lose("hang-up");
  return gone_;
}

void SocketTransport::quit() {
  // A daemon that hangs keeps a request waiting, but not the one who wants to leave: the request comes back too.
  if (exchange_mutex_.lock_within(Channel::kPatience)) {
    wire::Answer answer;
    requests_->limit_waits(Channel::kPatience);
    exchange_locked(wire::Quit{}, &answer);
    exchange_mutex_.unlock();
  }
  gone_ = true;
  requests_->shut_down();
  events_->shut_down();
}

/// The daemon is gone or no longer to be talked to: everyone who waits for it comes back.
void SocketTransport::lose(const char* what) {
  if (gone_.exchange(true)) return;
  record_failure(what, ECONNRESET);
  requests_->shut_down();
  events_->shut_down();
}

}  // namespace gs::client
