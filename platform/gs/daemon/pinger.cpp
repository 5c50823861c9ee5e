#include "daemon/pinger.h"

namespace gs::daemon {
namespace {

constexpr std::uint32_t kSupported =
    WYX_PING_RESPONSIVENESS | WYX_KEEP_CHECK_RESPONSIVENESS | WYX_ANNOUNCEMENT_WHEN_SLOW | WYX_CLOSE_CLIENT_SOCKET;
constexpr std::uint32_t kKnown = kSupported | WYX_COUNTER_RESPONSIVENESS | WYX_CRITICAL_CLIENT |
                                 WYX_EXEC_SCRIPT_WHEN_SLOW | WYX_DAEMON_MUST_DIE_WHEN_SLOW |
                                 WYX_KILL_CLIENT_WHEN_SLOW;

}  // namespace

wyx_rc_t Pinger::set(const wire::SetResponsiveness& wanted) {
  const bool pings = (wanted.type & WYX_PING_RESPONSIVENESS) != 0;
  if ((wanted.type & ~kKnown) != 0 || (pings && wanted.interval == 0)) return WYX_BAD_PARAMETER;
  if ((wanted.type & ~kSupported) != 0) return WYX_NOT_SUPPORTED;
  stop();
  close_when_slow_ = (wanted.type & WYX_CLOSE_CLIENT_SOCKET) != 0;
  interval_ = std::chrono::seconds(wanted.interval);
  time_limit_ = std::chrono::seconds(wanted.time_limit);
  if (pings) {
    next_ping_ = timers_.arm(now_() + interval_, [this] { ping(); });
  } else if (!responding_) {
    responding_ = true;
    sink_.responding_changed(session_, true);
  }
  return WYX_OK;
}

void Pinger::stop() {
  waiting_ = false;
  timers_.cancel(next_ping_);
  timers_.cancel(overdue_);
}

void Pinger::ping() {
  next_ping_ = timers_.arm(now_() + interval_, [this] { ping(); });
  if (waiting_) return;
  waiting_ = true;
  if (time_limit_.count() != 0) overdue_ = timers_.arm(now_() + time_limit_, [this] { overdue(); });
  sink_.send_ping(session_, ++last_ping_);
}

void Pinger::overdue() {
  overdue_ = {};
  missed();
}

void Pinger::missed() {
  if (!responding_) return;
  responding_ = false;
  PingSink& sink = sink_;  // the announcement may end the session, and with it this pinger
  const std::uint64_t session = session_;
  const bool close = close_when_slow_;
  sink.responding_changed(session, false);
  if (close) sink.too_slow(session);
}

void Pinger::answered(const wire::PingAnswer& answer) {
  if (!waiting_ || answer.number != last_ping_) return;  // of settings that were replaced meanwhile
  waiting_ = false;
  timers_.cancel(overdue_);
  if (!answer.ok) {
    missed();
  } else if (!responding_) {
    responding_ = true;
    sink_.responding_changed(session_, true);
  }
}

}  // namespace gs::daemon
