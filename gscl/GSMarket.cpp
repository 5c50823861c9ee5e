#include "gscl/GSMarket.h"

#include "gscl/GSCondition_internal.h"
#include "gscl/trace.h"

namespace zelt_gscl_V1 {

static_assert(sizeof(GSMarket) == 64, "fixed layout");

namespace {

// Consumers set `awaited` before the look that precedes a wait, so a producer whose object they missed finds it
// set (the queue's lock orders look and enqueue). While it is clear, every consumer that waits has been woken and
// will look again, and a producer need not touch the condition: what a woken consumer costs is paid once.
struct MarketCondition : GSCondition {
  std::atomic<bool> awaited{false};
};

std::atomic<bool>& awaited(GSCondition* condition) { return static_cast<MarketCondition*>(condition)->awaited; }

}  // namespace

GSMarket::GSMarket(int n) : _queue(n), _cond(new MarketCondition), _running(1) {}

GSMarket::~GSMarket() { delete static_cast<MarketCondition*>(_cond); }

void GSMarket::stopMarket() {
  GS_DEBUG(GSCL_TRC_API, "GSMarket::stopMarket \n");
  _running = 0;
  _cond->broadcast();
}

void GSMarket::resumeMarket() {
  GS_DEBUG(GSCL_TRC_API, "GSMarket::resumeMarket \n");
  _running = 1;
  _cond->broadcast();
}

int GSMarket::produce(GSObject* obj) {
  const int count = _queue.enqueue(obj);
  if (awaited(_cond) && awaited(_cond).exchange(false)) _cond->broadcast();
  return count;
}

// Drops nulls on the way: null says that the queue is empty, so that a consumer may wait.
GSObject* GSMarket::take() {
  GSObject* obj = nullptr;
  while (_queue.dequeue(&obj) != 0 && obj == nullptr) {
  }
  return obj;
}

GSObject* GSMarket::consume(const timespec* abstime) {
  // On arrival an object is taken whether the market is running or not, without the condition's mutex.
  if (GSObject* obj = take()) return obj;
  GSConditionGuard guard(*_cond);
  for (bool waited = false;; waited = true) {
    awaited(_cond) = true;
    if (_running == 0) return waited ? nullptr : take();
    if (GSObject* obj = take()) return obj;
    if (guard.wait(abstime) != 0) return nullptr;
  }
}

int GSMarket::IsRunning() { return _running; }
int GSMarket::QueueCount() { return _queue.count(); }

}  // namespace zelt_gscl_V1
