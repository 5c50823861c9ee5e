#include "client/embedded_transport.h"

#include <poll.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string>

#include "client/failure_log.h"

namespace gs::client {
namespace {

constexpr SessionId kSession = {EmbeddedTransport::kNodeNumber, 1};

bool watch(int epoll_fd, int fd) {
  epoll_event event{};
  event.events = EPOLLIN;
  event.data.fd = fd;
  return epoll_ctl(epoll_fd, EPOLL_CTL_ADD, fd, &event) == 0;
}

timespec to_timespec(std::chrono::steady_clock::time_point when) {
  const auto since_boot = when.time_since_epoch();
  const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(since_boot);
  const std::chrono::nanoseconds rest = since_boot - seconds;
  return {static_cast<time_t>(seconds.count()), static_cast<long>(rest.count())};
}

}  // namespace

std::unique_ptr<EmbeddedTransport> EmbeddedTransport::open(std::uint32_t socket_control, wyx_rc_t* rc) {
  std::unique_ptr<EmbeddedTransport> transport(new EmbeddedTransport);
  if (transport->ready()) {
    transport->greet(socket_control);
    return transport;
  }
  const int error = errno;
  record_failure("embedded", error, std::string("no descriptors for the session: ") + strerrordesc_np(error));
  *rc = WYX_SOCK_CREATE_FAILED;
  return nullptr;
}

EmbeddedTransport::EmbeddedTransport()
    : epoll_fd_(epoll_create1(EPOLL_CLOEXEC)),
      event_fd_(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
      timer_fd_(timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK)) {}

bool EmbeddedTransport::ready() const {
  return epoll_fd_.get() >= 0 && event_fd_.get() >= 0 && timer_fd_.get() >= 0 &&
         watch(epoll_fd_.get(), event_fd_.get()) && watch(epoll_fd_.get(), timer_fd_.get());
}

void EmbeddedTransport::greet(std::uint32_t socket_control) {
  MutexLock lock(mutex_);
  engine_.apply(HostCameEvent{kNodeNumber});
  domain_ = DomainListener(socket_control);
  for (DomainNotification& news : domain_.greeting(engine_.domain())) tell_of_domain(std::move(news));
  show_queue();
}

void EmbeddedTransport::tell_of_domain(DomainNotification news) {
  auto what = std::make_shared<const DomainNotification>(std::move(news));
  queue_.push_back({Incoming::Kind::kDomain, -1, nullptr, 0, std::move(what)});
}

wyx_rc_t EmbeddedTransport::call(Request request) {
  MutexLock lock(mutex_);
  if (gone_) return WYX_NO_INIT;
  run_due_timers();  // what is over by now is over before this request
  const wyx_rc_t rc = apply(RequestEvent{kSession, std::move(request), false});
  arm_timer();
  show_queue();
  return rc;
}

wyx_rc_t EmbeddedTransport::set_responsiveness(const wire::SetResponsiveness& settings) {
  MutexLock lock(mutex_);
  if (gone_) return WYX_NO_INIT;
  if ((settings.type & WYX_CLOSE_CLIENT_SOCKET) != 0) return WYX_NOT_SUPPORTED;  // there is none
  settings_ = settings;
  next_ping_.reset();
  answer_due_.reset();
  if ((settings.type & WYX_PING_RESPONSIVENESS) != 0) {
    next_ping_ = Clock::now() + std::chrono::seconds(settings.interval);
  } else {
    set_responding(true);
  }
  arm_timer();
  show_queue();
  return WYX_OK;
}

wyx_rc_t EmbeddedTransport::query_node(wire::NodeInfo* info) {
  *info = {kNodeNumber, kNodeNumber};
  return WYX_OK;
}

/// Of other nodes, which there are none of.
wyx_rc_t EmbeddedTransport::query_adapters(const wire::QueryAdapters& query, wire::NodeAdapters* found) {
  *found = {query.node, {}};
  return WYX_OK;
}

wyx_rc_t EmbeddedTransport::answer_quorum(std::uint64_t sequence) {
  MutexLock lock(mutex_);
  if (gone_) return WYX_NO_INIT;
  const wyx_rc_t rc = domain_.answered(sequence);
  const DomainNotification refusal = QuorumErrorNotification{sequence, rc};
  if (rc != WYX_OK && domain_.hears(refusal)) tell_of_domain(refusal);
  show_queue();
  return rc;
}

Incoming EmbeddedTransport::take() {
  MutexLock lock(mutex_);
  if (gone_) return {Incoming::Kind::kGone, -1, nullptr, 0};
  run_due_timers();
  Incoming next;
  if (!queue_.empty()) {
    next = std::move(queue_.front());
    queue_.pop_front();
  }
  arm_timer();
  show_queue();
  return next;
}

void EmbeddedTransport::answer_ping(std::uint64_t number, bool ok) {
  MutexLock lock(mutex_);
  if (gone_ || number != last_ping_ || next_ping_) return;
  run_due_timers();  // an answer that is late is announced as missing first
  answer_due_.reset();
  if ((settings_.type & WYX_PING_RESPONSIVENESS) != 0) {
    next_ping_ = Clock::now() + std::chrono::seconds(settings_.interval);
  }
  set_responding(ok);
  arm_timer();
  show_queue();
}

void EmbeddedTransport::wait() {
  pollfd watched = {epoll_fd_.get(), POLLIN, 0};
  poll(&watched, 1, -1);
}

bool EmbeddedTransport::gone() {
  MutexLock lock(mutex_);
  return gone_;
}

void EmbeddedTransport::quit() {
  MutexLock lock(mutex_);
  gone_ = true;
  queue_.clear();
  timers_.clear();
  next_ping_.reset();
  answer_due_.reset();
  arm_timer();
  show_queue();
}

/// Nobody else waits for this engine: what an event leaves to do is done at once.
wyx_rc_t EmbeddedTransport::apply(const Event& event) {
  const wyx_rc_t rc = apply_one(event);
  while (engine_.busy()) apply_one(ContinueEvent{});
  return rc;
}

wyx_rc_t EmbeddedTransport::apply_one(const Event& event) {
  Outcome outcome = engine_.apply(event);
  for (Delivery& delivery : outcome.deliveries) {
    queue_.push_back({Incoming::Kind::kNotification, delivery.to.token, std::move(delivery.what), 0});
  }
  const auto now = Clock::now();
  for (TimerRequest& timer : outcome.timers) {
    if (timer.seconds == 0) continue;
    timers_.push_back({now + std::chrono::seconds(timer.seconds), std::move(timer.id)});
  }
  // A phase that has ended early must not make the descriptor readable when its time comes.
  std::erase_if(timers_, [this](const Timer& timer) GS_REQUIRES(mutex_) { return !engine_.awaits(timer.id); });
  return outcome.rc;
}

void EmbeddedTransport::run_due_timers() {
  for (;;) {
    const auto now = Clock::now();
    run_due_ping(now);
    const auto earliest = std::min_element(timers_.begin(), timers_.end(),
                                           [](const Timer& a, const Timer& b) { return a.due < b.due; });
    if (earliest == timers_.end() || earliest->due > now) return;
    TimerExpiredEvent expired{std::move(earliest->id)};
    timers_.erase(earliest);
    apply(expired);
  }
}

void EmbeddedTransport::run_due_ping(Clock::time_point now) {
  if (next_ping_ && *next_ping_ <= now) {
    next_ping_.reset();
    queue_.push_back({Incoming::Kind::kPing, -1, nullptr, ++last_ping_});
    if (settings_.time_limit > 0) answer_due_ = now + std::chrono::seconds(settings_.time_limit);
  }
  if (answer_due_ && *answer_due_ <= now) {
    answer_due_.reset();
    set_responding(false);
  }
}

void EmbeddedTransport::set_responding(bool responding) {
  if (responding_ == responding) return;
  responding_ = responding;
  apply(ResponsivenessEvent{kSession, responding});
}

void EmbeddedTransport::arm_timer() {
  auto due = Clock::time_point::max();
  for (const Timer& timer : timers_) due = std::min(due, timer.due);
  if (next_ping_) due = std::min(due, *next_ping_);
  if (answer_due_) due = std::min(due, *answer_due_);
  if (due == armed_) return;
  armed_ = due;
  itimerspec setting{};
  if (due != Clock::time_point::max()) setting.it_value = to_timespec(due);
  timerfd_settime(timer_fd_.get(), TFD_TIMER_ABSTIME, &setting, nullptr);
}

void EmbeddedTransport::show_queue() {
  const bool show = gone_ || !queue_.empty();
  if (show == shown_) return;
  shown_ = show;
  if (show) {
    eventfd_write(event_fd_.get(), 1);
  } else {
    eventfd_t count;
    eventfd_read(event_fd_.get(), &count);
  }
}

}  // namespace gs::client
