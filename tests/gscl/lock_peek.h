// Looks at the counters of the lock classes, whose layouts are fixed, and helps tests to wait for them.
#ifndef TESTS_GSCL_LOCK_PEEK_H
#define TESTS_GSCL_LOCK_PEEK_H

#include <pthread.h>
#include <time.h>

#include <chrono>
#include <functional>
#include <thread>

#include "gscl/GSLockPrim.h"

namespace lock_peek {

using namespace zelt_gscl_V1;

struct ConditionFields {
  pthread_mutex_t mutex;
  pthread_cond_t cond;
  int nwaiters;
};

struct MutexFields {
  pthread_mutex_t mutex;
  pthread_cond_t cond;
  int nwaiters;
  int nholders;
  pthread_t holder;
};

struct RWFields {
  pthread_mutex_t mutex;
  pthread_cond_t readcond;
  pthread_cond_t writecond;
  int refcount;
  int nwriters_waiting;
  int nreaders_waiting;
  pthread_t holder;
};

static_assert(sizeof(ConditionFields) == sizeof(GSCondition) && sizeof(MutexFields) == sizeof(GSMutexLock) &&
              sizeof(RWFields) == sizeof(GSRWLockImpl));

// Reads one field under the object's own mutex; as a side effect it proves that nobody was left holding that
// mutex.
template <class Fields, class Lock, class Field>
Field peek(Lock& lock, Field Fields::*field) {
  Fields& fields = reinterpret_cast<Fields&>(lock);
  pthread_mutex_lock(&fields.mutex);
  const Field value = fields.*field;
  pthread_mutex_unlock(&fields.mutex);
  return value;
}

inline int waiters(GSCondition& c) { return peek(c, &ConditionFields::nwaiters); }
inline int waiters(GSMutexLock& m) { return peek(m, &MutexFields::nwaiters); }
inline int readersWaiting(GSRWLockImpl& l) { return peek(l, &RWFields::nreaders_waiting); }
inline int writersWaiting(GSRWLockImpl& l) { return peek(l, &RWFields::nwriters_waiting); }
inline int refcount(GSRWLockImpl& l) { return peek(l, &RWFields::refcount); }

/// Waits until `condition` holds; false after a minute, which only a hang takes.
inline bool eventually(const std::function<bool()>& condition) {
  const auto limit = std::chrono::steady_clock::now() + std::chrono::minutes(1);
  while (!condition()) {
    if (std::chrono::steady_clock::now() > limit) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

/// A wall-clock time that many milliseconds from now; negative ones have passed.
inline timespec inMillis(long millis) {
  timespec t;
  clock_gettime(CLOCK_REALTIME, &t);
  long nanos = t.tv_nsec + millis % 1000 * 1000000;
  t.tv_sec += millis / 1000 + (nanos >= 1000000000 ? 1 : 0) - (nanos < 0 ? 1 : 0);
  t.tv_nsec = (nanos + 1000000000) % 1000000000;
  return t;
}

/// A POSIX thread that can be cancelled; the destructor joins it.
class CancellableThread {
 public:
  explicit CancellableThread(std::function<void()> body) : _body(std::move(body)) {
    pthread_create(&_thread, nullptr, run, this);
  }
  ~CancellableThread() { join(); }
  CancellableThread(const CancellableThread&) = delete;
  CancellableThread& operator=(const CancellableThread&) = delete;

  void cancel() {
    if (!_joined) pthread_cancel(_thread);
  }
  /// True when the thread ended by cancellation.
  bool join() {
    if (!_joined) pthread_join(_thread, &_result);
    _joined = true;
    return _result == PTHREAD_CANCELED;
  }

 private:
  static void* run(void* self) {
    static_cast<CancellableThread*>(self)->_body();
    return nullptr;
  }
  std::function<void()> _body;
  pthread_t _thread;
  void* _result = nullptr;
  bool _joined = false;
};

}  // namespace lock_peek

#endif
