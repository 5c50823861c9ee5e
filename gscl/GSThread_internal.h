// Inside the library only: the private data of a thread object.
#ifndef GSCL_GSTHREAD_INTERNAL_H
#define GSCL_GSTHREAD_INTERNAL_H

#include <pthread.h>

#include <atomic>
#include <memory>
#include <mutex>

#include "gscl/GSQueue.h"
#include "gscl/GSThread.h"

struct GSxThreadData;

namespace gscl_internal {

/// What is known of the POSIX thread of an object. The thread shares it, since the object may be gone first.
struct ThreadControl {
  enum Phase {
    kNone,      // never started, or joined
    kJoinable,  // to be joined, once
    kJoining,   // a thread is inside join
    kDetached   // not to be joined
  };

  std::mutex mutex;               // guards all below; no cancellation point and no application code under it
  GSxThreadData* data = nullptr;  // null once the object is being destroyed
  Phase phase = kNone;
  pthread_t id{};        // valid unless phase is kNone
  bool stopped = false;  // cancelled by stop
  bool ended = false;    // the thread is past its last use of anything here; its id may soon be another thread's
};

}  // namespace gscl_internal

/// The fields that a thread object shows through its operations. Written by the owner and by the thread, read by
/// anybody: the shared ones are atomic.
struct GSxThreadData {
  explicit GSxThreadData(size_t stack)
      : stacksize(stack), control(std::make_shared<gscl_internal::ThreadControl>()) {}

  std::atomic<pthread_t> tid{~pthread_t{0}};  // all bits set: none
  size_t stacksize;                           // bytes; 0: the default
  void* start_args = nullptr;
  std::atomic<zelt_gscl::GSThreadState> state{zelt_gscl::GS_THREAD_IDLE};
  std::atomic<int> detachstate{PTHREAD_CREATE_JOINABLE};
  zelt_gscl_V1::GSIntegerEventQueue sync_events;

  std::shared_ptr<gscl_internal::ThreadControl> control;
};

#endif
