// Checks that one client still answers, as that client has asked for.
#pragma once

#include <functional>

#include "daemon/timers.h"
#include "wire/messages.h"

namespace gs::daemon {

/// What a pinger has done. A call may end the session and with it the pinger.
class PingSink {
 public:
  virtual void send_ping(std::uint64_t session, std::uint64_t ping) = 0;
  /// The client has stopped, or started again, to answer.
  virtual void responding_changed(std::uint64_t session, bool responding) = 0;
  /// The client was slow and has asked to be closed then.
  virtual void too_slow(std::uint64_t session) = 0;

 protected:
  ~PingSink() = default;
};

/// One ping is under way at most: a client that does not answer is not sent more of them, and is taken to respond
/// again when the answer comes. An answer that says "not ok" counts as none.
class Pinger {
 public:
  Pinger(std::uint64_t session, Timers& timers, std::function<Time()> now, PingSink& sink)
      : session_(session), timers_(timers), now_(std::move(now)), sink_(sink) {}
  ~Pinger() { stop(); }
  Pinger(const Pinger&) = delete;
  Pinger& operator=(const Pinger&) = delete;

  /// Replaces what was wanted before. WYX_BAD_PARAMETER: an interval of 0 or unknown flags; WYX_NOT_SUPPORTED: a
  /// check or an action other than ping, announcement and close. Both change nothing.
  wyx_rc_t set(const wire::SetResponsiveness& wanted);
  void answered(const wire::PingAnswer& answer);
  bool responding() const { return responding_; }

 private:
  void stop();
  void ping();
  void overdue();
  void missed();

  const std::uint64_t session_;
  Timers& timers_;
  const std::function<Time()> now_;
  PingSink& sink_;
  bool close_when_slow_ = false;
  Duration interval_{};
  Duration time_limit_{};  // 0: none
  std::uint64_t last_ping_ = 0;
  bool waiting_ = false;  // for the answer to last_ping_
  bool responding_ = true;
  Timers::Id next_ping_;
  Timers::Id overdue_;
};

}  // namespace gs::daemon
