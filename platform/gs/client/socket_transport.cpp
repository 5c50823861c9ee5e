#include "client/socket_transport.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>

#include "client/failure_log.h"

namespace gs::client {
namespace {

/// Why an answer that is awaited has not come.
struct NoAnswer {
  const char* how;
  int error;
  std::string why;
};

NoAnswer no_answer(Channel::Got got, int limit) {
  if (got == Channel::Got::kTimeout)
    return {"-timeout", ETIMEDOUT, "no answer within " + std::to_string(limit) + " seconds"};
  if (got == Channel::Got::kEnd) return {"-closed", ECONNRESET, "the daemon has closed the connection"};
  return {"-malformed", EPROTO, "the daemon says what makes no sense"};
}

/// One step of a handshake: asks, and receives an Answer or the T that is wanted. Nothing: `rc` says why, and the
/// failure is recorded.
template <typename T>
std::optional<T> handshake(const char* step, Channel& channel, const wire::ClientMessage& question, wyx_rc_t* rc) {
  wire::ServerMessage message;
  const Channel::Got got = channel.ask(question, &message);
  if (got == Channel::Got::kMessage) {
    const auto* answer = std::get_if<wire::Answer>(&message);
    if (answer != nullptr && answer->rc != WYX_OK) {
      record_failure(std::string(step) + "-refused", answer->rc,
                     "no session: the daemon refuses it with result " + std::to_string(answer->rc));
      *rc = answer->rc;
      return std::nullopt;
    }
    if (const auto* wanted = std::get_if<T>(&message)) return *wanted;
  }
  const NoAnswer reason = no_answer(got, channel.limit());
  record_failure(std::string(step) + reason.how, reason.error, std::string("no session: ") + reason.why);
  *rc = WYX_CONNECT_FAILED;
  return std::nullopt;
}

/// Asks without a session.
template <typename T>
wyx_rc_t query(const std::string& path, const wire::ClientMessage& question, T* found) {
  wyx_rc_t rc = WYX_OK;
  const auto channel = Channel::connect(path, &rc);
  if (!channel) return rc;
  auto answer = handshake<T>("query", *channel, question, &rc);
  if (answer) *found = std::move(*answer);
  return rc;
}

/// SIGIO for each arrival, to this process.
void raise_signals(int fd) {
  fcntl(fd, F_SETOWN, getpid());
  fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_ASYNC);
}

}  // namespace

std::unique_ptr<SocketTransport> SocketTransport::open(const std::string& path, const wire::Hello& hello,
                                                       int request_limit, wyx_rc_t* rc) {
  auto requests = Channel::connect(path, rc);
  if (!requests) return nullptr;
  const auto welcome = handshake<wire::Welcome>("hello", *requests, hello, rc);
  if (!welcome) return nullptr;
  auto events = Channel::connect(path, rc);
  if (!events) return nullptr;
  const wire::Attach attach{welcome->session_number, welcome->cookie};
  if (!handshake<wire::Answer>("attach", *events, attach, rc)) return nullptr;

  requests->limit_waits(request_limit);
  events->limit_waits(request_limit);
  if ((hello.socket_control & WYX_SOCKET_SIGNAL) != 0) raise_signals(events->fd());
  return std::make_unique<SocketTransport>(std::move(requests), std::move(events), welcome->node_number);
}

wyx_rc_t SocketTransport::query_node_of(const std::string& path, wire::NodeInfo* info) {
  return query(path, wire::QueryNode{}, info);
}

wyx_rc_t SocketTransport::query_adapters_of(const std::string& path, const wire::QueryAdapters& wanted,
                                            wire::NodeAdapters* found) {
  return query(path, wanted, found);
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
  wire::ServerMessage received;
  const Channel::Got got = requests_->ask(message, &received);
  if (got == Channel::Got::kMessage && std::holds_alternative<T>(received)) {
    *answer = std::get<T>(std::move(received));
    return WYX_OK;
  }
  lose_without_answer("request", got, requests_->limit());
  return WYX_NO_INIT;
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

wyx_rc_t SocketTransport::query_adapters(const wire::QueryAdapters& wanted, wire::NodeAdapters* found) {
  return exchange(wanted, found);
}

wyx_rc_t SocketTransport::answer_quorum(std::uint64_t sequence) {
  wire::Answer answer;
  const wyx_rc_t rc = exchange(wire::QuorumAnswer{sequence}, &answer);
  return rc == WYX_OK ? answer.rc : rc;
}

Incoming SocketTransport::take() {
  for (;;) {
    if (shared_ && handed_out_ < fanout_.size()) {
      return {Incoming::Kind::kNotification, fanout_[handed_out_++], shared_, 0};
    }
    wire::ServerMessage message;
    const Channel::Got got = events_->receive(&message);
    if (got == Channel::Got::kNothing) return {};
    if (got == Channel::Got::kMalformed) return malformed();
    if (got != Channel::Got::kMessage) {
      hang_up();
      return {Incoming::Kind::kGone, -1, nullptr, 0};
    }
    Incoming next = accept(std::move(message));
    if (next.kind != Incoming::Kind::kNothing) return next;
  }
}

/// kNothing: the message was part of a fan-out.
Incoming SocketTransport::accept(wire::ServerMessage&& message) {
  const bool in_fanout = !fanout_.empty();
  if (auto* notify = std::get_if<wire::Notify>(&message)) {
    const bool for_fanout = notify->token == -1;
    if (for_fanout != in_fanout || shared_) return malformed();
    if (!for_fanout) return {Incoming::Kind::kNotification, notify->token, std::move(notify->what), 0};
    shared_ = std::move(notify->what);
    return {};
  }
  if (std::holds_alternative<wire::FanoutEnd>(message)) {
    if (!shared_) return malformed();
    fanout_.clear();
    shared_.reset();
    return {};
  }
  if (in_fanout) return malformed();
  if (auto* fanout = std::get_if<wire::Fanout>(&message)) {
    fanout_ = std::move(fanout->tokens);
    handed_out_ = 0;
    return {};
  }
  if (const auto* ping = std::get_if<wire::Ping>(&message)) {
    return {Incoming::Kind::kPing, -1, nullptr, ping->number};
  }
  if (auto* news = std::get_if<wire::DomainControl>(&message)) {
    return Incoming{Incoming::Kind::kDomain, -1, nullptr, 0, std::move(news->what)};
  }
  if (!std::holds_alternative<wire::Farewell>(message)) return malformed();
  lose("farewell", ECONNRESET, "the daemon stops");
  return {Incoming::Kind::kGone, -1, nullptr, 0};
}

Incoming SocketTransport::malformed() {
  lose_without_answer("event", Channel::Got::kMalformed, 0);
  return {Incoming::Kind::kGone, -1, nullptr, 0};
}

void SocketTransport::answer_ping(std::uint64_t number, bool ok) {
  MutexLock lock(answer_mutex_);
  const Channel::Got sent = events_->send(wire::PingAnswer{number, ok});
  if (sent != Channel::Got::kMessage) lose_without_answer("ping", sent, events_->limit());
}

void SocketTransport::wait() {
  // The request channel is watched for its end only. It stays ended, also when another thread has silenced the
  // event channel's descriptor in the meantime.
  std::array<pollfd, 2> watched = {pollfd{events_->fd(), POLLIN, 0}, pollfd{requests_->fd(), 0, 0}};
  if (poll(watched.data(), watched.size(), -1) > 0 && watched[1].revents != 0) hang_up();
}

void SocketTransport::silence() { events_->silence(); }

bool SocketTransport::gone() {
  if (gone_) return true;
  pollfd watched = {requests_->fd(), 0, 0};
  if (poll(&watched, 1, 0) > 0) hang_up();
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
void SocketTransport::lose(const std::string& what, int error, const std::string& why) {
  if (gone_.exchange(true)) return;
  record_failure(what, error, "group services are gone: " + why);
  requests_->shut_down();
  events_->shut_down();
}

void SocketTransport::hang_up() { lose("hang-up", ECONNRESET, "the daemon has closed the connection"); }

void SocketTransport::lose_without_answer(const char* step, Channel::Got got, int limit) {
  const NoAnswer reason = no_answer(got, limit);
  lose(std::string(step) + reason.how, reason.error, reason.why);
}

}  // namespace gs::client
