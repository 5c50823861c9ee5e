// Queues: GSQueue, a growing circular queue under a lock, and on it the blocking queue of integer events.
//
// Example: examples/worker_pool.cpp.
#ifndef GSCL_GSQUEUE_H
#define GSCL_GSQUEUE_H

#include <limits.h>

#include <algorithm>
#include <memory>
#include <new>

#include "gscl/GSLockPrim.h"
#include "gscl/GSObject.h"
#include "gscl/export.h"

/// A first-in-first-out queue without an upper bound.
///
/// Any thread may call any operation; each takes the queue's own lock and may wait for it, which is a cancellation
/// point: a thread cancelled there has changed nothing. An application that takes the lock of the queue itself (it
/// is a lockable object) keeps others out of several operations; enqueue and dequeue then work for the holder of
/// the write lock. The queue owns its storage and copies items in and out; what pointers in it point at is not its
/// own. Storage grows by 16 slots at a time, in which one slot always stays free, and never shrinks. When growing
/// fails for want of memory, that is thrown, and queue, items and lock are as they were. The queue cannot be
/// copied. It is destroyed when no thread uses it any more.
template <class T>
class ZN_GSCL_EXPORT GSQueue : public zelt_gscl_V1::GSLockableObject {
 public:
  /// Empty, with n slots (so n - 1 items come before the first growth); without storage when n is not positive.
  explicit GSQueue(int n);
  /// Frees the storage; the items are not deleted one by one.
  ~GSQueue() override;
  GSQueue(const GSQueue&) = delete;
  GSQueue& operator=(const GSQueue&) = delete;

  /// Appends a copy of x. Returns the number of items then.
  int enqueue(const T& x);
  /// Takes out the oldest item and stores it through `out`, or drops it when `out` is null. Returns 1; 0 when the
  /// queue is empty.
  int dequeue(T* out);
  /// The number of items.
  int count();

 private:
  // Holds the write lock for a scope, also when it is left by an exception.
  class ZN_GSCL_HIDDEN Writing {
   public:
    explicit Writing(GSQueue& queue) : _queue(queue) { _queue.WriteLock(nullptr); }
    ~Writing() { _queue.WriteUnlock(); }
    Writing(const Writing&) = delete;
    Writing& operator=(const Writing&) = delete;

   private:
    GSQueue& _queue;
  };

  ZN_GSCL_HIDDEN void grow();
  ZN_GSCL_HIDDEN int advance(int i, int n) { return i + 1 == n ? 0 : i + 1; }  // (i + 1) mod n

  // All guarded by the lock of the lockable object.
  T* _data;     // circular; array new, or null
  int _head;    // index of the oldest item
  int _tail;    // index of the next free slot
  int _nitems;  // less than _nalloc when there is storage
  int _nalloc;  // slots allocated
};

template <class T>
GSQueue<T>::GSQueue(int n) : _data(nullptr), _head(0), _tail(0), _nitems(0), _nalloc(0) {
  if (n <= 0) return;
  _data = new T[static_cast<unsigned>(n)];
  _nalloc = n;
}

template <class T>
GSQueue<T>::~GSQueue() {
  Writing lock(*this);
  delete[] _data;
}

template <class T>
int GSQueue<T>::enqueue(const T& x) {
  Writing lock(*this);
  if (_nitems + 1 >= _nalloc) grow();
  _data[_tail] = x;
  _tail = advance(_tail, _nalloc);
  return ++_nitems;
}

template <class T>
int GSQueue<T>::dequeue(T* out) {
  Writing lock(*this);
  if (_nitems == 0) return 0;
  if (out != nullptr) *out = _data[_head];
  _head = advance(_head, _nalloc);
  --_nitems;
  return 1;
}

template <class T>
int GSQueue<T>::count() {
  ReadLock(nullptr);
  const int n = _nitems;
  ReadUnlock();
  return n;
}

// Nothing is changed before the new storage is complete.
template <class T>
void GSQueue<T>::grow() {
  const int kStep = 16;
  if (_nalloc > INT_MAX - kStep) throw std::bad_alloc();
  std::unique_ptr<T[]> bigger(new T[static_cast<unsigned>(_nalloc + kStep)]);
  const int toEnd = std::min(_nitems, _nalloc - _head);
  std::copy(_data + _head, _data + _head + toEnd, bigger.get());
  std::copy(_data, _data + (_nitems - toEnd), bigger.get() + toEnd);
  delete[] _data;
  _data = bigger.release();
  _head = 0;
  _tail = _nitems;
  _nalloc += kStep;
}

extern template class GSQueue<int>;
extern template class GSQueue<zelt_gscl_V1::GSObject*>;

namespace zelt_gscl_V1 {

/// A queue of events that threads can wait for; the library has it for int.
///
/// Any thread may call any operation, many may post and wait at once; each event goes to exactly one of them. No
/// wake-up is lost: a waiter's look into the queue and the start of its wait are one step, so a post falls either
/// before the look or into the wait. `wait_event` is a cancellation point, and so is, as in every queue, the wait
/// for the queue's lock; a cancelled thread has taken no event and leaves the queue as it was.
/// A failed allocation while the queue grows is thrown, and the event is not in the queue. The queue cannot
/// be copied and is destroyed when no thread uses it any more.
template <class T>
class ZN_GSCL_EXPORT GSEventQueue {
 public:
  GSEventQueue();
  virtual ~GSEventQueue();
  GSEventQueue(const GSEventQueue&) = delete;
  GSEventQueue& operator=(const GSEventQueue&) = delete;

  /// Appends e without waking anybody: for threads that will look by themselves. Returns the number of events
  /// then.
  int push_event(const T& e);
  /// Takes the oldest event, if there is one, without waiting. Returns 1, or 0 when there is none. With e null the
  /// event is dropped.
  int pop_event(T* e);
  /// Appends e and wakes all waiting threads. Returns 0.
  virtual int post_event(const T& e);
  /// Takes the oldest event, waiting for one at most `secs` seconds and `usecs` microseconds (secs -1: without
  /// limit), counted from the call. Returns 0 with the event in *e (dropped when e is null), else ETIMEDOUT. An
  /// event that is already there is taken whatever the time-out.
  virtual int wait_event(T* e, int secs, int usecs);
  /// The number of events.
  int count();

 private:
  GSQueue<T> _queue;
  GSCondition _cond;  // where threads wait for an event; broadcast by every post
};

extern template class GSEventQueue<int>;

/// The event queue of thread objects.
class ZN_GSCL_EXPORT GSIntegerEventQueue : public GSEventQueue<int> {
 public:
  GSIntegerEventQueue();
  ~GSIntegerEventQueue() override;
  int post_event(const int& e) override;
  int wait_event(int* e, int secs, int usecs) override;
};

}  // namespace zelt_gscl_V1

#endif
