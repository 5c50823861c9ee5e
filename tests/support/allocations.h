// Counts and refuses allocations of the calling thread, by replacing operator new of the test program.
#pragma once

#if defined(__SANITIZE_THREAD__)
#define ALLOCATIONS_ARE_THE_SANITIZERS
#elif defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define ALLOCATIONS_ARE_THE_SANITIZERS
#endif
#endif

namespace allocations {

/// False under ThreadSanitizer, which insists on its own operator new: nothing is counted or refused then.
#ifdef ALLOCATIONS_ARE_THE_SANITIZERS
constexpr bool kControlled = false;
#else
constexpr bool kControlled = true;
#endif

/// Allocations of this thread so far.
long count();

/// While it lives, this thread's allocations fail once `after` of them have succeeded.
class Refuse {
 public:
  explicit Refuse(int after = 0);
  ~Refuse();
  Refuse(const Refuse&) = delete;
  Refuse& operator=(const Refuse&) = delete;
};

}  // namespace allocations
