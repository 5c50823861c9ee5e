// Trace and debug lines of the library itself; not installed.
//
// GS_TRACE(level, format, args...) and GS_DEBUG(level, format, args...) do what GStracef and GSdebugf do, but
// evaluate the arguments only when the line will be written: a line that is off costs one load and one test. They
// throw nothing: a line stands in the middle of an operation, and that must not be left half done.
#ifndef GSCL_TRACE_H
#define GSCL_TRACE_H

#include <cxxabi.h>

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

/// Writes a line. What that throws, from an application's routine or for want of memory, is dropped with it; only
/// the end of the thread goes on.
template <class Write>
void dropThrown(Write write) {
  try {
    write();
  } catch (const abi::__forced_unwind&) {
    throw;
  } catch (...) {
  }
}

}  // namespace zelt_gscl_trace

#define GS_TRACE(level, ...)                                              \
  do {                                                                    \
    if (zelt_gscl_trace::trace_wanted(level)) [[unlikely]]                \
      zelt_gscl_trace::dropThrown([&] { GStracef(level, __VA_ARGS__); }); \
  } while (false)

#define GS_DEBUG(level, ...)                                              \
  do {                                                                    \
    if (zelt_gscl_trace::debug_wanted(level)) [[unlikely]]                \
      zelt_gscl_trace::dropThrown([&] { GSdebugf(level, __VA_ARGS__); }); \
  } while (false)

#endif
