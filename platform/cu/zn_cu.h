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

#define ZN_CU_EXPORT __attribute__((visibility("default")))

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
/// The environment variable ZN_CU_VERSION ("V.R.M.F", each 0 to 65535), read at the first call, overrides the
/// built-in version; any other text in it is ignored. Returns 0, or EINVAL for a null `vrmf` or an unknown `which`
/// (then *vrmf stays as it was).
ZN_CU_EXPORT int cu_get_version_1(int which, struct cu_vrmf_t** vrmf);

/// Fills *now with the wall-clock time. Returns 0, or EINVAL for a null pointer.
ZN_CU_EXPORT int cu_get_current_time_1(struct timespec* now);

/// The stack size to create a thread with that asks for `wanted` bytes (0: the system's default): never under the
/// system's minimum, rounded up to whole pages.
ZN_CU_EXPORT size_t cu_pick_thread_stacksize_1(size_t wanted);

/// Registers the calling thread for stack dumps: when a fatal signal (SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT)
/// ends the process, the thread that got it and every registered thread write their id and their backtrace to
/// standard error first, one after the other; the process then ends by that signal as it would have without us.
/// A thread that does not answer in time (it blocks the highest real-time signal, say) is named as such.
///
/// The first registration in a process sets the actions of those signals whose action is the default one. A
/// handler of the application is left alone, and one that it sets later replaces ours. A thread that has no
/// alternate signal stack is given one while it is registered, so that a stack overflow is dumped too.
///
/// Registering twice is the same as once; a thread that ends is taken out. Not for signal handlers.
/// Returns 0, or ENOMEM when no further thread can be registered (there is room for 4096).
ZN_CU_EXPORT int cu_stackdump_thread_enable_1(void);

/// Takes a thread out again; any thread may do it for any other. Returns 0, or ESRCH when it was not registered.
ZN_CU_EXPORT int cu_stackdump_thread_disable_1(pthread_t thread);

#ifdef __cplusplus
}
#endif

#endif
