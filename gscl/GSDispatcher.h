// Runs the daemon's dispatch loop without a controller object at hand.
//
// The loop itself: examples/watcher.cpp.
#ifndef GSCL_GSDISPATCHER_H
#define GSCL_GSDISPATCHER_H

#include "gscl/export.h"
#include "gscl/wyx_api.h"

namespace zelt_gscl_V1 {

/// Has no state: any number may exist, any thread may use any of them.
class ZN_GSCL_EXPORT GSDispatcher {
 public:
  GSDispatcher();
  virtual ~GSDispatcher();

  /// As GSController::dispatch (wyx_dispatch): the callbacks run on this thread, inside the call.
  virtual wyx_rc_t dispatch(wyx_dispatch_flag_t flag);
};

}  // namespace zelt_gscl_V1

#endif
