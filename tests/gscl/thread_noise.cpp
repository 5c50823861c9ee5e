#include "thread_noise.h"

#include <dlfcn.h>
#include <pthread.h>
#include <sched.h>

#include <atomic>
#include <random>

namespace {

std::atomic<bool> on{false};

}  // namespace

Noise::Noise() { on = true; }
Noise::~Noise() { on = false; }

#if !defined(__has_feature)
#define __has_feature(x) 0
#endif
#if !__has_feature(thread_sanitizer) && !__has_feature(address_sanitizer)

namespace {

// No cancellation point, like the lock itself.
void dawdle() {
  thread_local std::minstd_rand random(static_cast<unsigned>(pthread_self() >> 12));
  const unsigned dice = static_cast<unsigned>(random());
  if (dice % 4 == 0) sched_yield();
  if (dice % 3 != 0) return;
  for (volatile unsigned spin = dice / 16 % 4096; spin > 0;) spin = spin - 1;
}

}  // namespace

extern "C" __attribute__((visibility("default"))) int pthread_mutex_lock(pthread_mutex_t* mutex) noexcept {
  using Lock = int (*)(pthread_mutex_t*);
  static std::atomic<Lock> real{nullptr};
  Lock lock = real.load();
  if (lock == nullptr) real = lock = reinterpret_cast<Lock>(dlsym(RTLD_NEXT, "pthread_mutex_lock"));
  if (on) dawdle();
  return lock(mutex);
}

#endif
