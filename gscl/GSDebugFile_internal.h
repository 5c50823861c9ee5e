// Where the lines of the standard routines go, without a lock: the debug file, or standard error.
#ifndef GSCL_GSDEBUGFILE_INTERNAL_H
#define GSCL_GSDEBUGFILE_INTERNAL_H

#include <stddef.h>
#include <sys/types.h>
#include <unistd.h>

#include <atomic>

#include "gscl/scopes_internal.h"

namespace gscl_internal {

/// Lets one thread at a time in, which is not cancelled inside. A process that is forked meanwhile has no such
/// thread, and lets the next one in.
class ForkableGate {
 public:
  explicit ForkableGate(std::atomic<pid_t>& inside) : inside_(inside) {
    const pid_t self = getpid();
    for (pid_t other = 0; !inside_.compare_exchange_strong(other, self);) {
      if (other != self) continue;  // of the process that this one was forked from: replaced now
      usleep(100);
      other = 0;
    }
  }
  ~ForkableGate() { inside_.store(0); }
  ForkableGate(const ForkableGate&) = delete;
  ForkableGate& operator=(const ForkableGate&) = delete;

 private:
  const CancellationHold hold_;
  std::atomic<pid_t>& inside_;
};

/// Hands the line to the system in one piece. What cannot be written is dropped.
void writeDebugLine(const char* line, size_t length);

/// For one who is about to close all descriptors below `end`: gives the debug file a number from there up. Returns
/// the number that must stay open, where the limit on descriptors allows no other; else -1.
int moveDebugFileUp(int end);

}  // namespace gscl_internal

#endif
