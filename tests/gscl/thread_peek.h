// The fixed layouts of queue, event queue and market, for tests that hold a lock or read a counter from outside.
#ifndef TESTS_GSCL_THREAD_PEEK_H
#define TESTS_GSCL_THREAD_PEEK_H

#include "gscl/GSMarket.h"
#include "gscl/GSQueue.h"
#include "gscl/GSThread.h"
#include "lock_peek.h"

namespace thread_peek {

using namespace zelt_gscl_V1;

template <class T>
struct QueueFields {
  void* vtable;
  GSRWLockImpl* lock;
  T* data;
  int head;
  int tail;
  int nitems;
  int nalloc;
};

struct EventQueueFields {
  void* vtable;
  QueueFields<int> queue;
  GSCondition cond;
};

struct MarketFields {
  void* vtable;
  QueueFields<GSObject*> queue;
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

static_assert(sizeof(QueueFields<int>) == sizeof(GSQueue<int>) &&
              sizeof(EventQueueFields) == sizeof(GSEventQueue<int>) && sizeof(MarketFields) == sizeof(GSMarket));

template <class T>
QueueFields<T>& fields(GSQueue<T>& queue) {
  return reinterpret_cast<QueueFields<T>&>(queue);
}
inline EventQueueFields& fields(GSEventQueue<int>& queue) { return reinterpret_cast<EventQueueFields&>(queue); }
inline MarketFields& fields(GSMarket& market) { return reinterpret_cast<MarketFields&>(market); }
inline ThreadFields& fields(GSThread& thread) { return *static_cast<ThreadFields*>(thread.getInnerData()); }

inline int waiters(GSEventQueue<int>& queue) { return lock_peek::waiters(fields(queue).cond); }
inline int waiters(GSMarket& market) { return lock_peek::waiters(*fields(market).cond); }
inline int waiters(GSThread& thread) { return lock_peek::waiters(fields(thread).sync_events.cond); }

}  // namespace thread_peek

#endif
