// Locks and conditions over POSIX threads.
//
// Common to all classes here:
// - Any thread may call any operation on a live object. No operation holds two internal mutexes, so the classes
//   impose no lock order of their own.
// - Results: 0, otherwise the error number of the threads library (ETIMEDOUT when a deadline passed). Nothing
//   throws.
// - A deadline is an absolute wall-clock time, as GSGetAbsTime makes it; null waits without limit. It matters only
//   when there is something to wait for: a free lock is taken also past it.
// - Every wait is a cancellation point. A thread that is cancelled in one leaves the object as if it had never
//   called: counters restored, internal mutex released, waiters that it held up woken. The cancellation unwinds
//   through the caller's frames.
// - A failure of an internal mutex is fatal: "asserted: rc=%d in %s (line=%d)\n" on standard error, then abort.
// - An object may be destroyed when no thread is inside it and, for a lock, nobody holds it.
// - A private writemsg receives the name of each state change of a lock and does nothing with it: a place for a
//   breakpoint or a probe.
//
// Example: examples/worker_pool.cpp.
#ifndef GSCL_GSLOCKPRIM_H
#define GSCL_GSLOCKPRIM_H

#include <pthread.h>
#include <time.h>

#include "gscl/export.h"

namespace zelt_gscl_V1 {

/// A plain mutex: not recursive, no error checking. Locking is no cancellation point.
class ZN_GSCL_EXPORT GSBaseMutex {
 public:
  GSBaseMutex();
  ~GSBaseMutex();
  GSBaseMutex(const GSBaseMutex&) = delete;
  GSBaseMutex& operator=(const GSBaseMutex&) = delete;

  /// Waits until the mutex is free and takes it.
  int lock();
  /// Releases the mutex; the caller holds it.
  int unlock();

 private:
  friend class GSBaseCondition;
  pthread_mutex_t _mutex;
};

/// A plain condition variable; deadlines are measured on the wall clock.
class ZN_GSCL_EXPORT GSBaseCondition {
 public:
  GSBaseCondition();
  ~GSBaseCondition();
  GSBaseCondition(const GSBaseCondition&) = delete;
  GSBaseCondition& operator=(const GSBaseCondition&) = delete;

  /// Releases `m`, which the caller holds, waits, and takes `m` again, also when the wait ends with an error or
  /// the thread is cancelled. May return 0 without a signal.
  int wait(GSBaseMutex* m, const timespec* abstime);
  /// Wakes one waiter, if there is one.
  int signal();
  /// Wakes all waiters.
  int broadcast();

 private:
  pthread_cond_t _cond;
};

/// A condition with its own mutex, which counts its waiters so that waking nobody is cheap.
///
/// There is no predicate: a signal with no thread waiting is lost, and a wait may end without one. Users keep
/// their own state and look at it again. (The library's queues join their look and the start of the wait
/// into one step under `_mutex`; a caller of `wait` cannot, and sets a deadline or signals until it is heard.)
class ZN_GSCL_EXPORT GSCondition {
 public:
  GSCondition();
  ~GSCondition();
  GSCondition(const GSCondition&) = delete;
  GSCondition& operator=(const GSCondition&) = delete;

  /// Waits for a signal, a broadcast or the deadline. Returns 0, or ETIMEDOUT.
  int wait(const timespec* abstime);
  /// Wakes one of the threads inside `wait`; without one, does nothing.
  int signal();
  /// Wakes all threads inside `wait`; without one, does nothing.
  int broadcast();

 private:
  friend class GSConditionGuard;
  GSBaseMutex _mutex;  // guards _nwaiters; the mutex of the waits
  GSBaseCondition _cond;
  int _nwaiters;  // threads inside a wait
};

/// A recursive mutex with an optional deadline. The holder may lock it again; each lock needs one unlock.
class ZN_GSCL_EXPORT GSMutexLock {
 public:
  GSMutexLock();
  ~GSMutexLock();
  GSMutexLock(const GSMutexLock&) = delete;
  GSMutexLock& operator=(const GSMutexLock&) = delete;

  /// Takes the lock, or one level more of it. An error means that the caller has not got it.
  int lock(const timespec* abstime);

  /// Gives back one level; the last one wakes one waiter. The last level may be given back by another thread
  /// than the holder. Returns 0, or EPERM when the lock is free (nothing changes).
  /// A nested level given back by another thread is fatal: " GSMutexLock::unlock holder(%x) <> self(%x)\n" and the
  /// message of a failed check go to standard error, and the process aborts.
  int unlock();

 private:
  ZN_GSCL_HIDDEN void writemsg(const char*) {}
  ZN_GSCL_HIDDEN int waitForRelease(const timespec* abstime);
  ZN_GSCL_HIDDEN void passOn();
  ZN_GSCL_HIDDEN void signalRelease();
  ZN_GSCL_HIDDEN static void cancelledInWait(void* self);
  ZN_GSCL_HIDDEN static void cancelledInSignal(void* self);

  GSBaseMutex _mutex;  // guards all other fields; held inside the operations only, never by a holder of the lock
  GSBaseCondition _cond;  // where contenders wait; signalled by the last unlock
  int _nwaiters;          // threads waiting in lock
  int _nholders;          // levels that the holder has; 0: free
  pthread_t _holder;      // 0: free
};

/// A reader/writer lock that prefers writers: once a writer waits, new readers wait too. The writer may re-enter.
///
/// It cannot be upgraded: a reader that asks for the write lock waits for itself, and so does a writer that asks
/// for a read lock. A thread that has a read lock must not ask for another one while a writer may be waiting. A
/// release does not check that the caller has the lock. A writer that gives up (deadline, cancellation) lets the
/// readers proceed that wait behind it alone.
class ZN_GSCL_EXPORT GSRWLockImpl {
 public:
  GSRWLockImpl();
  ~GSRWLockImpl();
  /// A new, free lock: a lock's state is not copied.
  GSRWLockImpl(const GSRWLockImpl&);
  GSRWLockImpl& operator=(const GSRWLockImpl&) = delete;

  /// Takes a read lock when no writer holds the lock or waits. An error means that the caller has not got it.
  int ReadLock(const timespec* abstime);
  /// Takes the write lock when nobody else has the lock, or one level more of it.
  int WriteLock(const timespec* abstime);
  /// Both the same as Unlock.
  int ReadUnlock();
  int WriteUnlock();
  /// Gives back one read lock, or one level of the write lock; wakes a waiting writer, or without one all
  /// waiting readers. On a free lock it does nothing and returns 0.
  int Unlock();

 private:
  ZN_GSCL_HIDDEN void writemsg(const char*) {}
  ZN_GSCL_HIDDEN int waitToRead(const timespec* abstime);
  ZN_GSCL_HIDDEN int waitToWrite(const timespec* abstime);
  ZN_GSCL_HIDDEN void writerGivesUp();
  ZN_GSCL_HIDDEN static void cancelledReader(void* self);
  ZN_GSCL_HIDDEN static void cancelledWriter(void* self);

  GSBaseMutex _mutex;          // guards all counters and _holder; held inside the operations only
  GSBaseCondition _readcond;   // where readers wait; broadcast when the last waiting writer is out of the way
  GSBaseCondition _writecond;  // where writers wait; signalled by every release
  int _refcount;               // 0: free; n > 0: n read locks; -d: a writer has d levels
  int _nwriters_waiting;
  int _nreaders_waiting;
  pthread_t _holder;  // the last writer; means nothing unless _refcount is negative
};

/// Owns a GSRWLockImpl. A copy gets its own, free lock; an assignment leaves both locks as they are.
class ZN_GSCL_EXPORT GSRWLock {
 public:
  GSRWLock();
  GSRWLock(const GSRWLock&);
  GSRWLock& operator=(const GSRWLock&) { return *this; }
  ~GSRWLock();

  /// As the operations of GSRWLockImpl, but always without limit: the deadline is not passed on.
  int ReadLock(const timespec* abstime);
  int WriteLock(const timespec* abstime);
  int ReadUnlock();
  int WriteUnlock();

 private:
  GSRWLockImpl* pLockImpl;  // owned
};

}  // namespace zelt_gscl_V1

#endif
