// One host alone: events are ordered as they arrive.
#pragma once

#include <deque>

#include "daemon/ordering.h"

namespace gs::daemon {

class LocalOrdering : public Ordering {
 public:
  /// Events are numbered above what `clock` says when it begins to serve: above all before, as long as it goes on
  /// and counts faster than there are events. Null: from 1.
  explicit LocalOrdering(Node node, std::uint64_t (*clock)() = nullptr) : domain_{node, {node}}, clock_(clock) {}

  void start(Replica& replica) override {
    replica_ = &replica;
    serve();
  }
  void fail(const std::string& why) override {
    waiting_.clear();  // of clients that are no more
    replica_->reset(why);
    serve();
  }
  bool will_serve() const override { return true; }

  /// The replica has had the event when this returns, unless it is called from inside it: then the event follows
  /// as soon as it is done.
  void submit(Event event) override {
    if (delivering_) return waiting_.push_back(std::move(event));
    const Turn turn{delivering_ = true};
    replica_->apply(event);
    while (!waiting_.empty()) {
      const Event next = std::move(waiting_.front());
      waiting_.pop_front();
      replica_->apply(next);
    }
  }

 private:
  void serve() {
    if (clock_ != nullptr) replica_->apply(NumbersEvent{clock_()});
    replica_->apply(HostCameEvent{domain_.self});
    replica_->serve(domain_);
  }

  /// Also over when the replica throws.
  struct Turn {
    bool& delivering;
    ~Turn() { delivering = false; }
  };

  const Domain domain_;
  std::uint64_t (*const clock_)();
  Replica* replica_ = nullptr;
  std::deque<Event> waiting_;
  bool delivering_ = false;
};

}  // namespace gs::daemon
