// Looks at fields of the lock, queue and thread classes, whose layouts are fixed, and helps tests to wait for
// them.
#ifndef TESTS_GSCL_PEEK_H
#define TESTS_GSCL_PEEK_H

#include <pthread.h>
#include <time.h>

#include <chrono>
#include <functional>
#include <memory>
#include <thread>
#include <vector>

#include "gscl/GSMarket.h"
#include "gscl/GSQueue.h"
#include "gscl/GSThread.h"

namespace peek {

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
  pthread_cond_t readcond, writecond;
  int refcount, nwriters_waiting, nreaders_waiting;
  pthread_t holder;
};

struct QueueFields {
  void* vtable;
  GSRWLockImpl* lock;
  void* data;
  int head, tail, nitems, nalloc;
};

struct EventQueueFields {
  void* vtable;
  QueueFields queue;
  GSCondition cond;
};

struct MarketFields {
  void* vtable;
  QueueFields queue;
  GSCondition* cond;
  int running;
};

struct ThreadFields {
  pthread_t tid;
  size_t stacksize;
  void* start_args;
  int state;
  int detachstate;
  EventQueueFields sync_events;
};

static_assert(sizeof(ConditionFields) == sizeof(GSCondition) && sizeof(MutexFields) == sizeof(GSMutexLock) &&
              sizeof(RWFields) == sizeof(GSRWLockImpl) && sizeof(QueueFields) == sizeof(GSQueue<int>) &&
              sizeof(EventQueueFields) == sizeof(GSEventQueue<int>) && sizeof(MarketFields) == sizeof(GSMarket));

inline ConditionFields& fields(GSCondition& c) { return reinterpret_cast<ConditionFields&>(c); }
inline MutexFields& fields(GSMutexLock& m) { return reinterpret_cast<MutexFields&>(m); }
inline RWFields& fields(GSRWLockImpl& l) { return reinterpret_cast<RWFields&>(l); }
inline QueueFields& fields(GSQueue<int>& queue) { return reinterpret_cast<QueueFields&>(queue); }
inline EventQueueFields& fields(GSEventQueue<int>& queue) { return reinterpret_cast<EventQueueFields&>(queue); }
inline MarketFields& fields(GSMarket& market) { return reinterpret_cast<MarketFields&>(market); }
inline ThreadFields& fields(GSThread& thread) { return *static_cast<ThreadFields*>(thread.getInnerData()); }

// Reads one field under the object's own mutex; as a side effect it proves that nobody was left holding that
// mutex.
template <class Lock, class Fields>
int locked(Lock& lock, int Fields::*field) {
  pthread_mutex_lock(&fields(lock).mutex);
  const int value = fields(lock).*field;
  pthread_mutex_unlock(&fields(lock).mutex);
  return value;
}

inline int waiters(GSCondition& c) { return locked(c, &ConditionFields::nwaiters); }
inline int waiters(GSMutexLock& m) { return locked(m, &MutexFields::nwaiters); }
inline int waiters(GSEventQueue<int>& queue) { return waiters(fields(queue).cond); }
inline int waiters(GSMarket& market) { return waiters(*fields(market).cond); }
inline int waiters(GSThread& thread) { return waiters(fields(thread).sync_events.cond); }
inline int readersWaiting(GSRWLockImpl& l) { return locked(l, &RWFields::nreaders_waiting); }
inline int writersWaiting(GSRWLockImpl& l) { return locked(l, &RWFields::nwriters_waiting); }
inline int refcount(GSRWLockImpl& l) { return locked(l, &RWFields::refcount); }

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
  const long nanos = t.tv_nsec + 1000000000 + millis % 1000 * 1000000;  // one second ahead, so never negative
  return {t.tv_sec - 1 + millis / 1000 + nanos / 1000000000, nanos % 1000000000};
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

using Threads = std::vector<std::unique_ptr<CancellableThread>>;

template <class Body>
Threads startThreads(int n, Body body) {
  Threads threads;
  for (int i = 0; i < n; ++i) threads.push_back(std::make_unique<CancellableThread>([body, i] { body(i); }));
  return threads;
}

}  // namespace peek

#endif
