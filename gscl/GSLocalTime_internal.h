// The time of a line, as ctime has it, without the lock that the C library takes for the time zone.
#ifndef GSCL_GSLOCALTIME_INTERNAL_H
#define GSCL_GSLOCALTIME_INTERNAL_H

namespace gscl_internal {

constexpr int kLineTimeBytes = 16;

/// "Nov 16 20:46:11": now, in local time.
void lineTime(char (&text)[kLineTimeBytes]);

}  // namespace gscl_internal

#endif
