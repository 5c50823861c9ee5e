#include "gscl/GSQueue.h"

#include "gscl/GSCondition_internal.h"
#include "gscl/GSUtils.h"

template class GSQueue<int>;
template class GSQueue<zelt_gscl_V1::GSObject*>;

namespace zelt_gscl_V1 {

static_assert(sizeof(GSQueue<int>) == 40, "fixed layout");
static_assert(sizeof(GSEventQueue<int>) == 144 && sizeof(GSIntegerEventQueue) == 144, "fixed layout");

template <class T>
GSEventQueue<T>::GSEventQueue() : _queue(0) {}

template <class T>
GSEventQueue<T>::~GSEventQueue() = default;

template <class T>
int GSEventQueue<T>::push_event(const T& e) {
  return _queue.enqueue(e);
}

template <class T>
int GSEventQueue<T>::pop_event(T* e) {
  return _queue.dequeue(e);
}

template <class T>
int GSEventQueue<T>::post_event(const T& e) {
  _queue.enqueue(e);
  _cond.broadcast();
  return 0;
}

template <class T>
int GSEventQueue<T>::wait_event(T* e, int secs, int usecs) {
  timespec until;
  const timespec* abstime = zelt_gscl::GSGetAbsTime(&until, secs, usecs);
  GSConditionGuard guard(_cond);
  while (_queue.dequeue(e) == 0) {
    if (const int rc = guard.wait(abstime)) return rc;
  }
  return 0;
}

template <class T>
int GSEventQueue<T>::count() {
  return _queue.count();
}

template class GSEventQueue<int>;

GSIntegerEventQueue::GSIntegerEventQueue() = default;
GSIntegerEventQueue::~GSIntegerEventQueue() = default;

int GSIntegerEventQueue::post_event(const int& e) { return GSEventQueue<int>::post_event(e); }
int GSIntegerEventQueue::wait_event(int* e, int secs, int usecs) {
  return GSEventQueue<int>::wait_event(e, secs, usecs);
}

}  // namespace zelt_gscl_V1
