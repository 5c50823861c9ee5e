// A mutex and a condition that clang's thread-safety analysis understands, and whose waits let a cancellation
// unwind.
#pragma once

#include <pthread.h>

#include <ctime>

#include "common/sanitizers.h"

#if defined(__clang__)
#define ZN_ANNOTATION(x) __attribute__((x))
#else
#define ZN_ANNOTATION(x)
#endif
#define ZN_GUARDED_BY(x) ZN_ANNOTATION(guarded_by(x))
#define ZN_REQUIRES(x) ZN_ANNOTATION(requires_capability(x))

namespace platform {

class ZN_ANNOTATION(capability("mutex")) Mutex {
 public:
  Mutex() = default;
  ~Mutex() { pthread_mutex_destroy(&mutex_); }
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

  void lock() ZN_ANNOTATION(acquire_capability()) { pthread_mutex_lock(&mutex_); }
  /// False: others had it for so long.
  bool lock_within(int seconds) ZN_ANNOTATION(try_acquire_capability(true)) {
    timespec until{};
#if ZN_THREAD_SANITIZER  // which follows no other timed lock
    clock_gettime(CLOCK_REALTIME, &until);
    until.tv_sec += seconds;
    return pthread_mutex_timedlock(&mutex_, &until) == 0;
#else
    clock_gettime(CLOCK_MONOTONIC, &until);
    until.tv_sec += seconds;
    return pthread_mutex_clocklock(&mutex_, CLOCK_MONOTONIC, &until) == 0;
#endif
  }
  void unlock() ZN_ANNOTATION(release_capability()) { pthread_mutex_unlock(&mutex_); }

 private:
  friend class Condition;
  pthread_mutex_t mutex_ = PTHREAD_MUTEX_INITIALIZER;
};

class ZN_ANNOTATION(scoped_lockable) MutexLock {
 public:
  explicit MutexLock(Mutex& mutex) ZN_ANNOTATION(acquire_capability(mutex)) : mutex_(mutex) { mutex_.lock(); }
  ~MutexLock() ZN_ANNOTATION(release_capability()) { mutex_.unlock(); }
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

 private:
  Mutex& mutex_;
};

class Condition {
 public:
  Condition() = default;
  ~Condition() { pthread_cond_destroy(&condition_); }
  Condition(const Condition&) = delete;
  Condition& operator=(const Condition&) = delete;

  /// A cancellation point; a cancelled wait unwinds with `mutex` held.
  void wait(Mutex& mutex) ZN_REQUIRES(mutex) { pthread_cond_wait(&condition_, &mutex.mutex_); }
  /// `until`: of CLOCK_MONOTONIC. False: it has come.
  bool wait_until(Mutex& mutex, const timespec& until) ZN_REQUIRES(mutex) {
    return pthread_cond_clockwait(&condition_, &mutex.mutex_, CLOCK_MONOTONIC, &until) == 0;
  }
  void notify_all() { pthread_cond_broadcast(&condition_); }

 private:
  pthread_cond_t condition_ = PTHREAD_COND_INITIALIZER;
};

}  // namespace platform
