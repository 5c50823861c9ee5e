// Trace and debug lines of the library itself; not installed.
//
// GS_TRACE(level, format, args...) and GS_DEBUG(level, format, args...) do what GStracef and GSdebugf do, but
// evaluate the arguments only when the line will be written: a line that is off costs one load and one test.
#ifndef GSCL_TRACE_H
#define GSCL_TRACE_H

#include <atomic>

#include "gscl/GSDebug.h"

namespace zelt_gscl_trace {

/// The level word; all bits set while the environment has not been consulted, so that the first line tested takes
/// the slow path, which consults it.
__attribute__((visibility("hidden"))) extern std::atomic<int> level_mask;

/// Whether the channel has a routine and the level is on. Consults the environment when nobody has yet.
__attribute__((visibility("hidden"))) bool trace_wanted_slow(int level);
__attribute__((visibility("hidden"))) bool debug_wanted_slow(int level);

inline bool may_be_on(int level) {
  return level == 0 || (level_mask.load(std::memory_order_relaxed) & level) != 0;
}

/// Whether a trace line of this level will be written; for callers whose line needs more than arguments.
inline bool trace_wanted(int level) { return may_be_on(level) && trace_wanted_slow(level); }
inline bool debug_wanted(int level) { return may_be_on(level) && debug_wanted_slow(level); }

}  // namespace zelt_gscl_trace

#define GS_TRACE(level, ...)                               \
  do {                                                     \
    if (zelt_gscl_trace::trace_wanted(level)) [[unlikely]] \
      GStracef(level, __VA_ARGS__);                        \
  } while (false)

#define GS_DEBUG(level, ...)                               \
  do {                                                     \
    if (zelt_gscl_trace::debug_wanted(level)) [[unlikely]] \
      GSdebugf(level, __VA_ARGS__);                        \
  } while (false)

#endif
