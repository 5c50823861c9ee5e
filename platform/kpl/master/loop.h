// libevent's loop with owned events.
#pragma once

#include <event2/event.h>

#include <chrono>
#include <functional>
#include <memory>

namespace kpl::master {

class Loop {
 public:
  Loop();
  /// Comes back after `stop`.
  void run() { event_base_dispatch(base_.get()); }
  void stop() { event_base_loopbreak(base_.get()); }
  event_base* base() const { return base_.get(); }

 private:
  struct Free {
    void operator()(event_base* base) const { event_base_free(base); }
  };
  std::unique_ptr<event_base, Free> base_;
};

/// Calls an action when a descriptor is ready, a signal has come or a time is over. The action may destroy the
/// event that it belongs to.
class Event {
 public:
  using Action = std::function<void()>;

  /// `what`: EV_READ, EV_WRITE or EV_SIGNAL, with EV_PERSIST; armed at once.
  Event(const Loop& loop, int fd, short what, Action action);
  /// A timer, to be armed.
  Event(const Loop& loop, Action action);

  Event(const Event&) = delete;
  Event& operator=(const Event&) = delete;

  /// In place of any time that it was armed for before.
  void arm(std::chrono::milliseconds after);
  /// Without a time: for a descriptor.
  void arm();
  void disarm() { event_del(event_.get()); }

 private:
  struct Free {
    void operator()(event* e) const { event_free(e); }
  };
  static void call(int, short, void* action) noexcept;

  std::shared_ptr<Action> action_;
  std::unique_ptr<event, Free> event_;
};

}  // namespace kpl::master
