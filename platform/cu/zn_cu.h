// Common utilities of the platform: installed product version, current time, thread stack sizes, stack dumps.
//
// Plain functions with C linkage; any thread may call any of them, none takes a lock of the caller's. An int
// result is 0 for success, otherwise a POSIX error number.
#ifndef ZN_CU_H
#define ZN_CU_H

#include <pthread.h>
#include <stddef.h>
#include <stdint.h>
#include <time.h>

#ifdef __cplusplus
extern "C" {
#endif

#ifndef CU_VRMF_T_DEFINED
#define CU_VRMF_T_DEFINED
/// A product version. Also in gscl/wyx_api.h, so that either header stands alone.
struct cu_vrmf_t {
  uint16_t version;
  uint16_t release;
  uint16_t modlevel;
  uint16_t fixlevel;
};
#endif

/// Points *vrmf at the installed product version. The record belongs to the library and lives as long as the
/// process. `which` selects a component; 0, the product itself, is the only one.
/// The environment variable ZN_CU_VERSION ("V.R.M.F"), read at the first call, overrides the built-in version.
/// Returns 0, EINVAL for a null `vrmf` or an unknown `which` (then *vrmf stays as it was).
int cu_get_version_1(int which, struct cu_vrmf_t** vrmf);

/// Fills *now with the wall-clock time. Returns 0, or EINVAL for a null pointer.
int cu_get_current_time_1(struct timespec* now);

/// The stack size to create a thread with that asks for `wanted` bytes (0: the system's default): never under the
/// system's minimum, rounded up to whole pages.
size_t cu_pick_thread_stacksize_1(size_t wanted);

/// Registers the calling thread for stack dumps: when a fatal signal (SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT) ends
/// the process, the id and the backtrace of every registered thread are written to standard error first.
/// Registering twice is the same as once. Returns 0, or ENOMEM when no further thread can be registered.
int cu_stackdump_thread_enable_1(void);

/// Takes a thread out again. Returns 0, or ESRCH when it was not registered.
int cu_stackdump_thread_disable_1(pthread_t thread);

#ifdef __cplusplus
}
#endif

#endif
