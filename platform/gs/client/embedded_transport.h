// A session with an engine in this process: no daemon, no thread. Time limits and pings are kept by a timer that
// makes the session's descriptor readable, and are acted on inside whatever call comes next.
#pragma once

#include <chrono>
#include <deque>
#include <optional>
#include <vector>

#include "client/fork.h"
#include "client/transport.h"
#include "engine/domain_listener.h"
#include "engine/engine.h"

namespace gs::client {

class EmbeddedTransport : public Transport {
 public:
  static constexpr std::uint32_t kNodeNumber = 1;

  /// `socket_control`: what the session is told of its domain, which is this process. Null: `rc` says why.
  static std::unique_ptr<EmbeddedTransport> open(std::uint32_t socket_control, wyx_rc_t* rc);

  std::uint32_t node_number() const override { return kNodeNumber; }
  wyx_rc_t call(Request request) override;
  wyx_rc_t set_responsiveness(const wire::SetResponsiveness& settings) override;
  wyx_rc_t query_node(wire::NodeInfo* info) override;
  wyx_rc_t query_adapters(const wire::QueryAdapters& query, wire::NodeAdapters* found) override;
  wyx_rc_t answer_quorum(std::uint64_t sequence) override;
  Incoming take() override;
  void answer_ping(std::uint64_t number, bool ok) override;
  void wait() override;
  int descriptor() const override { return epoll_fd_.get(); }
  void silence() override {}
  bool gone() override;
  void quit() override;

 private:
  using Clock = std::chrono::steady_clock;
  struct Timer {
    Clock::time_point due;
    TimerId id;
  };

  EmbeddedTransport();
  bool ready() const;
  void greet(std::uint32_t socket_control);
  void tell_of_domain(DomainNotification news) GS_REQUIRES(mutex_);
  wyx_rc_t apply(const Event& event) GS_REQUIRES(mutex_);
  wyx_rc_t apply_one(const Event& event) GS_REQUIRES(mutex_);
  void run_due_timers() GS_REQUIRES(mutex_);
  void run_due_ping(Clock::time_point now) GS_REQUIRES(mutex_);
  void set_responding(bool responding) GS_REQUIRES(mutex_);
  void arm_timer() GS_REQUIRES(mutex_);
  void show_queue() GS_REQUIRES(mutex_);

  Descriptor epoll_fd_;  // holds the two others
  Descriptor event_fd_;  // readable while queue_ has something or the session is over
  Descriptor timer_fd_;  // the earliest of all deadlines

  Mutex mutex_;
  Engine engine_ GS_GUARDED_BY(mutex_);
  DomainListener domain_ GS_GUARDED_BY(mutex_);
  std::deque<Incoming> queue_ GS_GUARDED_BY(mutex_);
  std::vector<Timer> timers_ GS_GUARDED_BY(mutex_);
  Clock::time_point armed_ GS_GUARDED_BY(mutex_) = Clock::time_point::max();  // what timer_fd_ is set to; max: off
  bool shown_ GS_GUARDED_BY(mutex_) = false;                                  // event_fd_ is readable
  bool gone_ GS_GUARDED_BY(mutex_) = false;

  wire::SetResponsiveness settings_ GS_GUARDED_BY(mutex_);
  std::optional<Clock::time_point> next_ping_ GS_GUARDED_BY(mutex_);
  std::optional<Clock::time_point> answer_due_ GS_GUARDED_BY(mutex_);
  std::uint64_t last_ping_ GS_GUARDED_BY(mutex_) = 0;
  bool responding_ GS_GUARDED_BY(mutex_) = true;
};

}  // namespace gs::client
