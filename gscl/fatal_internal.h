// The end of the process on a condition that must not be survived, in every build type.
#ifndef GSCL_FATAL_H
#define GSCL_FATAL_H

#include <cstdio>
#include <cstdlib>

namespace gscl_internal {

/// Writes which expectation failed, and where, to standard error and aborts.
[[noreturn]] inline void failAssertion(const char* expectation, const char* file, int line, const char* function) {
  std::fprintf(stderr, "%s:%d: %s: Assertion `%s' failed.\n", file, line, function, expectation);
  std::abort();
}

}  // namespace gscl_internal

/// Unlike assert, this one also stands in a release build.
#define GSCL_REQUIRE(condition, text)                                                              \
  do {                                                                                             \
    if (!(condition)) gscl_internal::failAssertion(text, __FILE__, __LINE__, __PRETTY_FUNCTION__); \
  } while (0)

#endif
