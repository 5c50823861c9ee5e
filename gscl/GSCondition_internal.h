// Inside the library only: a look at some state and the start of the wait for its change, as one step.
#ifndef GSCL_GSCONDITION_INTERNAL_H
#define GSCL_GSCONDITION_INTERNAL_H

#include "gscl/GSLockPrim.h"

namespace zelt_gscl_V1 {

/// Holds the mutex of a condition while it lives, also through the unwinding of a cancelled thread. Whoever
/// changes the state first and then signals or broadcasts the condition cannot do so between the holder's look
/// and its wait: the wake-up is either before the look, which then sees the change, or during the wait.
class GSConditionGuard {
 public:
  explicit GSConditionGuard(GSCondition& condition);
  ~GSConditionGuard();
  GSConditionGuard(const GSConditionGuard&) = delete;
  GSConditionGuard& operator=(const GSConditionGuard&) = delete;

  /// One wait of the condition, with its mutex released meanwhile. A cancellation point.
  int wait(const timespec* abstime);

 private:
  static void cancelled(void* condition);
  GSCondition& _condition;
};

}  // namespace zelt_gscl_V1

#endif
