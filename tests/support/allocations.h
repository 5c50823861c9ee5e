// Counts and refuses allocations of the calling thread, by replacing operator new of the test program.
#pragma once

#include "platform/common/sanitizers.h"

namespace allocations {

/// False under ThreadSanitizer, which insists on its own operator new: nothing is counted or refused then.
constexpr bool kControlled = !ZN_THREAD_SANITIZER;

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
