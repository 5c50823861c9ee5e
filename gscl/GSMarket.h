// GSMarket: where producers hand objects over to consumers.
#ifndef GSCL_GSMARKET_H
#define GSCL_GSMARKET_H

#include <time.h>

#include <atomic>

#include "gscl/GSLockPrim.h"
#include "gscl/GSObject.h"
#include "gscl/GSQueue.h"
#include "gscl/export.h"

namespace zelt_gscl_V1 {

/// A hand-over point for objects: producers never wait, consumers wait until an object is there, a deadline passes
/// or the market is stopped.
///
/// Any thread may call any operation, any number of producers and consumers at once; each object goes to exactly
/// one consumer, the oldest first. No wake-up is lost: a consumer's look and the start of its wait are one step,
/// so that neither an object nor a stop can fall between them.
///
/// The market holds pointers only. Who produced an object owns it until a consumer has it; objects still queued
/// when the market is destroyed are not deleted. Null counts as an object while it is queued, but no consumer gets
/// it: it is dropped. The market cannot be copied. It is destroyed when no thread uses it any more: stop it and
/// join its consumers first.
///
/// `consume` is a cancellation point (and so is, as in every queue, the wait for the queue's lock); a thread that
/// is cancelled there has taken nothing. Errors: a failed allocation while the queue grows is thrown from
/// `produce`, and the object is not in the market.
///
/// Example: examples/worker_pool.cpp.
class ZN_GSCL_EXPORT GSMarket {
 public:
  /// Empty and running; room for n - 1 objects before the first growth, none when n is not positive.
  explicit GSMarket(int n);
  virtual ~GSMarket();
  GSMarket(const GSMarket&) = delete;
  GSMarket& operator=(const GSMarket&) = delete;

  /// Stops the market and wakes all waiting consumers, which then return null. Objects in it stay, and consumers
  /// that come later take them without ever waiting.
  virtual void stopMarket();
  /// Opens the market again; consumers wait again. A consumer that was still on its way out of the stop waits on.
  virtual void resumeMarket();
  /// Queues the object, also in a stopped market, and wakes all waiting consumers. Returns the number of objects
  /// queued then, this one included.
  virtual int produce(GSObject* obj);
  /// Takes the oldest object, waiting for one until `abstime` (absolute wall-clock time; null: without limit)
  /// while the market is running. Returns null when the deadline has passed, when the market is stopped and empty
  /// on arrival, and when it is found stopped after a wait, even if objects have arrived meanwhile. An object that
  /// is there on arrival is taken whatever the deadline.
  virtual GSObject* consume(const timespec* abstime);

  /// 1 while the market is running, 0 while it is stopped.
  int IsRunning();
  /// The number of objects queued.
  int QueueCount();

 private:
  ZN_GSCL_HIDDEN GSObject* take();

  GSQueue<GSObject*> _queue;  // guards itself
  GSCondition* _cond;         // owned; consumers wait here; broadcast by stop, resume, and produce when one waits
  std::atomic<int> _running;  // 1 or 0
};

}  // namespace zelt_gscl_V1

#endif
