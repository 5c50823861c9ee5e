// How the files of the daemon environment report that a step failed; not installed.
#ifndef DAE_DAE_FAILURE_INTERNAL_H
#define DAE_DAE_FAILURE_INTERNAL_H

#include <errno.h>

#include "dae/dae_internal.h"

namespace dae {

/// Records the error text at the caller's place and returns `code`.
inline int fail(int code, const char* text, const char* file = __builtin_FILE(), long line = __builtin_LINE()) {
  dae_detail_error__INTERNAL__(text, file, ZN_GSCL_VERSION, line);
  return code;
}

/// Records the failure of a system call and returns `code`.
inline int fail_call(int code, const char* call, int error = errno, const char* file = __builtin_FILE(),
                     long line = __builtin_LINE()) {
  dae_detail_errno__INTERNAL__(call, error, file, ZN_GSCL_VERSION, line);
  return code;
}

/// Installs a handler with an empty mask. Returns 0, or `code` with the failure recorded.
int set_signal(int signo, void (*handler)(int), int flags, int code);

/// Puts errno back at the end of the scope.
class KeepErrno {
 public:
  KeepErrno() : saved_(errno) {}
  ~KeepErrno() { errno = saved_; }
  KeepErrno(const KeepErrno&) = delete;
  KeepErrno& operator=(const KeepErrno&) = delete;

 private:
  int saved_;
};

}  // namespace dae

#endif
