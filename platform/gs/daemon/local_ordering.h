// One host alone: events are ordered as they arrive.
#pragma once

#include <deque>

#include "daemon/ordering.h"

namespace gs::daemon {

class LocalOrdering : public Ordering {
 public:
  void start(Sink sink) override { sink_ = std::move(sink); }

  /// The sink has had the event when this returns, unless it is called from inside the sink: then the event
  /// follows as soon as the sink is done.
  void submit(Event event) override {
    waiting_.push_back(std::move(event));
    if (delivering_) return;
    const Turn turn{delivering_ = true};
    while (!waiting_.empty()) {
      const Event next = std::move(waiting_.front());
      waiting_.pop_front();
      sink_(next);
    }
  }

 private:
  /// Also over when the sink throws.
  struct Turn {
    bool& delivering;
    ~Turn() { delivering = false; }
  };

  Sink sink_;
  std::deque<Event> waiting_;
  bool delivering_ = false;
};

}  // namespace gs::daemon
