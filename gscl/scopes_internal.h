// Scopes that give back on every way out, a cancelled thread's and an exception's included, what they took.
#ifndef GSCL_SCOPES_H
#define GSCL_SCOPES_H

#include <pthread.h>

namespace gscl_internal {

/// Holds cancellation of the calling thread off: for destructors, through which no cancellation may unwind, and
/// for bookkeeping that must be done as a whole.
class CancellationHold {
 public:
  CancellationHold() { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &before_); }
  ~CancellationHold() { pthread_setcancelstate(before_, nullptr); }
  CancellationHold(const CancellationHold&) = delete;
  CancellationHold& operator=(const CancellationHold&) = delete;

  /// Within a hold: a wait in which the thread may be cancelled as it might before.
  class Lifted {
   public:
    explicit Lifted(const CancellationHold& hold) { pthread_setcancelstate(hold.before_, nullptr); }
    ~Lifted() { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr); }
    Lifted(const Lifted&) = delete;
    Lifted& operator=(const Lifted&) = delete;
  };

 private:
  int before_ = PTHREAD_CANCEL_ENABLE;
};

template <class Lockable>
class ReadScope {
 public:
  explicit ReadScope(Lockable& lockable) : lockable_(lockable) { lockable_.ReadLock(nullptr); }
  ~ReadScope() { lockable_.ReadUnlock(); }
  ReadScope(const ReadScope&) = delete;
  ReadScope& operator=(const ReadScope&) = delete;

 private:
  Lockable& lockable_;
};

template <class Lockable>
class WriteScope {
 public:
  explicit WriteScope(Lockable& lockable) : lockable_(lockable) { lockable_.WriteLock(nullptr); }
  ~WriteScope() { lockable_.WriteUnlock(); }
  WriteScope(const WriteScope&) = delete;
  WriteScope& operator=(const WriteScope&) = delete;

 private:
  Lockable& lockable_;
};

template <class Mutex>
class MutexScope {
 public:
  explicit MutexScope(Mutex& mutex) : mutex_(mutex) { mutex_.lock(); }
  ~MutexScope() { mutex_.unlock(); }
  MutexScope(const MutexScope&) = delete;
  MutexScope& operator=(const MutexScope&) = delete;

 private:
  Mutex& mutex_;
};

}  // namespace gscl_internal

#endif
