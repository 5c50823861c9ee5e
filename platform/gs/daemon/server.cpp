#include "daemon/server.h"

#include <malloc.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <stdexcept>
#include <system_error>

#include "common/interfaces.h"
#include "common/random_number.h"
#include "daemon/corosync_ordering.h"
#include "daemon/local_ordering.h"
#include "daemon/memory_reserve.h"
#include "daemon/peer_process.h"
#include "wire/endpoint.h"

namespace gs::daemon {
namespace {

constexpr int kSendBuffer = 1024 * 1024;  // bytes; the system may give less
constexpr timeval kAtOnce = {0, 0};       // after the descriptors that are ready, before the next are looked at
constexpr timeval kFarewellLimit = {0, 500'000};  // for clients to take what waits for them
constexpr Duration kBetweenTrims{1'000};          // of the heap, while memory is short
constexpr int kAcceptsAtOnce = 64;                // before the connected are served again
constexpr int kLastPackets = 64;                  // that a process has left behind
constexpr std::size_t kOwnDescriptors = 32;       // socket, log, loop and the like

using platform::now;
using platform::random_number;

void add(event* what, const timeval* after = nullptr) {
  if (event_add(what, after) != 0) throw std::bad_alloc();
}

std::uint64_t microseconds_since_1970() {
  const auto since = std::chrono::system_clock::now().time_since_epoch();
  return static_cast<std::uint64_t>(std::chrono::duration_cast<std::chrono::microseconds>(since).count());
}

/// As much as the system allows: past its limit for everyone where we may, else up to it.
void enlarge_send_buffer(int fd) {
  if (setsockopt(fd, SOL_SOCKET, SO_SNDBUFFORCE, &kSendBuffer, sizeof kSendBuffer) == 0) return;
  setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &kSendBuffer, sizeof kSendBuffer);
}

/// Readable again and again, until it is reset. A loop that always has a time limit for its sleep would look at
/// the clock twice and set the system's timer in each turn.
Descriptor timer_descriptor(std::chrono::milliseconds every) {
  Descriptor timer(timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
  const timespec time = {every.count() / 1000, every.count() % 1000 * 1'000'000};
  const itimerspec setting = {time, time};
  if (!timer || timerfd_settime(timer.get(), 0, &setting, nullptr) != 0)
    throw std::system_error(errno, std::generic_category(), "a timer");
  return timer;
}

void reset(const Descriptor& timer) {
  std::uint64_t expirations = 0;
  while (read(timer.get(), &expirations, sizeof expirations) < 0 && errno == EINTR) {
  }
}

std::size_t descriptors_for_clients() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return ClientLimits{}.descriptors;
  return limit.rlim_cur > kOwnDescriptors ? limit.rlim_cur - kOwnDescriptors : 0;
}

ClientLimits limits_of(const Options& options) {
  return {options.max_sessions,      options.user_sessions,    options.root_sessions,
          descriptors_for_clients(), options.user_queue_bound, options.total_queue_bound};
}

/// Those that other hosts can reach this one by.
Adapters adapters_of_host() {
  Adapters found;
  for (auto& one : platform::interfaces()) {
    if (found.size() == kMaxAdapters) break;
    if (!one.loopback && is_adapter_name(one.name)) found.push_back({std::move(one.name), one.address});
  }
  return found;
}

/// The default path's directory is the daemon's own.
const std::string& prepared(const std::string& path) {
  if (path == wire::kDefaultSocketPath) platform::make_directory_of(path);
  return path;
}

}  // namespace

/// No error of one client's ends the daemon or reaches the loop. `id`: the client's connection, if it is about
/// one.
template <typename Action>
void Server::guarded(ConnectionId id, Action action) {
  try {
    action();
  } catch (const std::exception& error) {
    log_->error("something could not be done: {}", error.what());
    try {
      sessions_.failed(id, std::string("the daemon could not serve it: ") + error.what());
    } catch (const std::exception& again) {
      log_->error("connection {}: not closed yet: {}", id, again.what());
    }
  }
  tend_memory();
}

template <void (Server::*Member)()>
void Server::call(evutil_socket_t, short, void* server) {
  auto* self = static_cast<Server*>(server);
  self->guarded(0, [self] { (self->*Member)(); });
  self->arm_deadline();
}

template <void (Server::*Member)(ConnectionId)>
void Server::call_connection(evutil_socket_t, short, void* connection) {
  auto* at = static_cast<Connection*>(connection);
  Server* self = at->server;
  self->guarded(at->id, [self, id = at->id] { (self->*Member)(id); });  // may destroy the connection
  self->arm_deadline();
}

/// While the reserve is taken, some memory is given back every now and then, and each turn of the loop tries to
/// set the reserve aside again.
void Server::tend_memory() {
  if (!memory_reserve::taken()) return;
  const bool was_short = std::exchange(short_of_memory_, true);
  if (!was_short) log_->error("out of memory: clients may be closed, and nothing new is taken in");
  const bool trims = now() >= next_trim_;
  if (trims) {
    malloc_trim(0);
    next_trim_ = now() + kBetweenTrims;
  }
  short_of_memory_ = !memory_reserve::refill();
  if (short_of_memory_ && !trims) return;
  try {
    sessions_.set_short_of_memory(short_of_memory_);
  } catch (const std::exception& error) {
    log_->error("out of memory: {}", error.what());
  }
  if (!short_of_memory_) log_->warn("there is memory again");
}

EventPtr Server::make_event(evutil_socket_t fd, short what, event_callback_fn callback, void* argument) {
  EventPtr made(event_new(base_.get(), fd, what, callback, argument));
  if (!made) throw std::bad_alloc();
  return made;
}

Server::Server(const Options& options, std::shared_ptr<spdlog::logger> log)
    : log_(std::move(log)),
      access_{geteuid(), platform::group_id(options.access_group)},
      base_(event_base_new()),
      listener_("gsd", prepared(options.socket_path), access_.group),
      ordering_(make_ordering(options)),
      sessions_({.queue_bound = options.queue_bound,
                 .drain_time = options.drain_time,
                 .limits = limits_of(options),
                 .engine = options.engine,
                 .ordering = options.corosync ? "corosync" : "local",
                 .version = GSD_VERSION,
                 .node = options.corosync ? 0 : options.node_number},
                {*this, *ordering_, now, random_number, log_, [this] { add(continue_.get(), &kAtOnce); },
                 [] { malloc_trim(0); }, options.corosync ? adapters_of_host : nullptr}),
      packet_(wire::kMaxPacket + 1) {
  if (!base_) throw std::bad_alloc();
  memory_reserve::hold();
  const auto on_stop = [](evutil_socket_t signal, short, void* self) {
    auto* server = static_cast<Server*>(self);
    server->guarded(0, [=] { server->stop(strsignal(static_cast<int>(signal))); });
  };
  accept_again_ = make_event(-1, 0, call<&Server::accept_again>, this);
  deadline_ = make_event(-1, 0, call<&Server::on_deadline>, this);
  continue_ = make_event(-1, 0, call<&Server::on_continue>, this);
  farewell_over_ = make_event(
      -1, 0,
      [](evutil_socket_t, short, void* self) { event_base_loopbreak(static_cast<Server*>(self)->base_.get()); },
      this);
  terminated_ = make_event(SIGTERM, EV_SIGNAL | EV_PERSIST, on_stop, this);
  interrupted_ = make_event(SIGINT, EV_SIGNAL | EV_PERSIST, on_stop, this);
  add(terminated_.get());
  add(interrupted_.get());
  start_accepting();
  look_again_.emplace(*this, Listener::kLookAgain, [this] { look_at_path(); });
}

Server::~Server() = default;

void Server::set_bounds(const Options& options) {
  sessions_.set_bounds(options.queue_bound, options.drain_time, limits_of(options));
}

void Server::run() {
  event_base_dispatch(base_.get());
  if (!gave_up_.empty()) throw std::runtime_error(gave_up_);
}

std::unique_ptr<Ordering> Server::make_ordering(const Options& options) {
  if (!options.corosync) return std::make_unique<LocalOrdering>(options.node_number, microseconds_since_1970);
  if (!options.require_quorum)
    log_->warn("require-quorum is no: hosts that lose sight of one another each go on, and differ from then on");
  CorosyncOrdering::Settings settings;
  settings.link.require_quorum = options.require_quorum;
  settings.safe = options.safe;
  settings.member_timeout = options.member_timeout;
  settings.engine = options.engine;
  const auto around = [this](const std::function<void()>& action) {
    guarded(0, action);
    arm_deadline();
  };
  return std::make_unique<CorosyncOrdering>(settings, base_.get(), around, log_,
                                            [this](const std::string& why) { give_up(why); });
}

void Server::give_up(const std::string& why) {
  gave_up_ = why;
  stop(why);
}

Server::Repeated::Repeated(Server& server, evutil_socket_t fd, short what, std::function<void()> action)
    : server_(server),
      action_(std::move(action)),
      event_(server.make_event(fd, static_cast<short>(what | EV_PERSIST), call, this)) {
  add(event_.get());
}

Server::Repeated::Repeated(Server& server, Descriptor timer, std::function<void()> action)
    : Repeated(server, timer.get(), EV_READ, std::move(action)) {
  timer_ = std::move(timer);
}

Server::Repeated::Repeated(Server& server, std::chrono::milliseconds every, std::function<void()> action)
    : Repeated(server, timer_descriptor(every), std::move(action)) {}

void Server::Repeated::call(evutil_socket_t, short, void* self) {
  const auto* repeated = static_cast<Repeated*>(self);
  if (repeated->timer_) reset(repeated->timer_);
  repeated->server_.guarded(0, repeated->action_);
  repeated->server_.arm_deadline();
}

void Server::repeat(std::chrono::milliseconds every, std::function<void()> action) {
  repeated_.emplace(*this, every, std::move(action));
}

// ---------------------------------------------------------------------------------------------- new connections

void Server::start_accepting() {
  EventPtr acceptable = make_event(listener_.fd(), EV_READ | EV_PERSIST, call<&Server::on_acceptable>, this);
  add(acceptable.get());
  acceptable_ = std::move(acceptable);
}

void Server::accept_again() {
  if (acceptable_ && event_add(acceptable_.get(), nullptr) != 0) acceptable_.reset();  // for look_at_path to make
}

/// Somebody may have removed or replaced the socket; who is connected does not notice, new clients would. Where an
/// earlier look could not start to accept, this one does.
void Server::look_at_path() {
  if (stopping_) return;
  const auto leave_old = [this] {
    for (int i = 0; i < SOMAXCONN && accept_one(); ++i) {  // those that have found it are still served
    }
    acceptable_.reset();
  };
  if (listener_.keep_in_place(*log_, leave_old) || !acceptable_) start_accepting();
}

void Server::on_acceptable() {
  for (int i = 0; i < kAcceptsAtOnce && accept_one(); ++i) {
  }
}

bool Server::accept_one() {
  Descriptor socket(accept4(listener_.fd(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
  if (socket) {
    add_connection(std::move(socket));
    return true;
  }
  if (errno == ECONNABORTED || errno == EINTR) return true;
  if (errno != EAGAIN) pause_accepting(errno);
  return false;
}

/// The connection that could not be accepted stays in the queue and would wake the loop again and again.
void Server::pause_accepting(int error) {
  sessions_.log_about({}, spdlog::level::warn,
                      std::string("cannot accept more connections for now: ") + strerror(error));
  if (!acceptable_) return;
  event_del(acceptable_.get());
  constexpr timeval kPause = {0, std::chrono::microseconds(Listener::kAcceptPause).count()};
  if (event_add(accept_again_.get(), &kPause) != 0) acceptable_.reset();  // for look_at_path to make
}

void Server::add_connection(Descriptor socket) {
  const std::optional<Peer> peer = platform::peer_of(socket.get());
  if (!peer) return;  // gone already
  if (!access_.allows(*peer)) {
    const std::string whose = "pid " + std::to_string(peer->pid) + ", uid " + std::to_string(peer->uid);
    return sessions_.log_about(peer->uid, spdlog::level::warn,
                               "connection (" + whose + "): closed: not permitted");
  }
  enlarge_send_buffer(socket.get());
  const ConnectionId id = ++last_connection_;
  const int fd = socket.get();
  Connection& connection = connections_[id];
  connection.server = this;
  connection.id = id;
  connection.socket = std::move(socket);
  connection.connected = time_since_boot();
  try {
    connection.readable = make_event(fd, EV_READ | EV_PERSIST, call_connection<&Server::on_readable>, &connection);
    add(connection.readable.get());
    sessions_.opened(id, *peer);
  } catch (const std::exception& error) {
    log_->error("connection (pid {}, uid {}): closed: {}", peer->pid, peer->uid, error.what());
    sessions_.lost(id, error.what());
    connections_.erase(id);
  }
}

// ------------------------------------------------------------------------------------------------- connections

void Server::on_readable(ConnectionId id) { receive_one(id); }

/// False: nothing more is there.
bool Server::receive_one(ConnectionId id) {
  const int fd = connections_.at(id).socket.get();
  const ssize_t length = recv(fd, packet_.data(), packet_.size(), MSG_DONTWAIT);
  if (length > 0) {
    sessions_.received(id, {packet_.data(), static_cast<std::size_t>(length)});
    return true;
  }
  // The peer has left something unread. What it had sent before is there all the same, then the end.
  if (length < 0 && errno == ECONNRESET) return true;
  if (length == 0) sessions_.lost(id, "the peer is gone");
  if (length < 0 && errno != EAGAIN && errno != EINTR) {
    sessions_.lost(id, std::string("the peer is gone: ") + strerror(errno));
  }
  return false;
}

void Server::on_writable(ConnectionId id) { sessions_.writable(id); }

bool Server::watch_process(ConnectionId id) {
  Connection& connection = connections_.at(id);
  auto process = process_of_peer(connection.socket.get(), connection.connected);
  if (!process) return false;
  if (!*process) {  // the end of its socket has to do
    if (!std::exchange(told_unwatched_, true)) {
      log_->info(
          "connection {}: its process cannot be watched: while a child holds the socket, it counts as alive", id);
    }
    return true;
  }
  connection.process = std::move(*process);
  connection.process_ended =
      make_event(connection.process.get(), EV_READ, call_connection<&Server::on_process_ended>, &connection);
  add(connection.process_ended.get());
  return true;
}

void Server::on_process_ended(ConnectionId id) {
  for (int i = 0; i < kLastPackets && connections_.contains(id) && receive_one(id); ++i) {
  }
  sessions_.lost(id, "its process has ended");
}

Transport::Sent Server::send_packet(ConnectionId to, std::span<const std::byte> header,
                                    std::span<const std::byte> slice) {
  iovec parts[] = {{const_cast<std::byte*>(header.data()), header.size()},
                   {const_cast<std::byte*>(slice.data()), slice.size()}};
  msghdr message{};
  message.msg_iov = parts;
  message.msg_iovlen = 2;
  const int fd = connections_.at(to).socket.get();
  ssize_t sent = 0;
  do {
    sent = sendmsg(fd, &message, MSG_NOSIGNAL | MSG_DONTWAIT);
  } while (sent < 0 && errno == EINTR);
  if (sent >= 0) return Sent::kDone;
  if (errno == EAGAIN) return Sent::kFull;
  log_->debug("connection {}: cannot send: {}", to, strerror(errno));
  return Sent::kGone;
}

void Server::wait_writable(ConnectionId id) {
  Connection& connection = connections_.at(id);
  if (!connection.writable) {
    connection.writable =
        make_event(connection.socket.get(), EV_WRITE, call_connection<&Server::on_writable>, &connection);
  }
  add(connection.writable.get());
}

void Server::close(ConnectionId id) { connections_.erase(id); }

// ---------------------------------------------------------------------------------------------- time and the end

void Server::on_deadline() {
  armed_.reset();
  sessions_.run_timers();
}

void Server::arm_deadline() {
  if (stopping_) return finish_when_drained();
  const auto next = sessions_.next_deadline();
  if (next == armed_) return;
  armed_ = next;
  if (!next) {
    event_del(deadline_.get());
    return;
  }
  const auto wait = std::max(*next - now(), Duration::zero());
  const timeval time = {static_cast<time_t>(wait.count() / 1000),
                        static_cast<suseconds_t>(wait.count() % 1000 * 1000)};
  if (event_add(deadline_.get(), &time) != 0) armed_.reset();  // the next turn tries again
}

void Server::stop(const std::string& why) {
  if (stopping_) return;
  log_->info("stopping on {} with {} clients", why, sessions_.sessions());
  stopping_ = true;
  add(farewell_over_.get(), &kFarewellLimit);  // first: whatever fails from here on, it ends
  stopping_action_();
  if (acceptable_) event_del(acceptable_.get());
  event_del(accept_again_.get());
  event_del(deadline_.get());
  event_del(continue_.get());
  listener_.close();
  for (auto& [id, connection] : connections_) {
    event_del(connection.readable.get());
    if (connection.process_ended) event_del(connection.process_ended.get());
  }
  sessions_.say_farewell();
  finish_when_drained();
}

void Server::finish_when_drained() {
  if (sessions_.drained()) event_base_loopbreak(base_.get());
}

}  // namespace gs::daemon
