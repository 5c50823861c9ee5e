#include "client/failure_log.h"

#include <unistd.h>

#include <cstdio>
#include <ctime>

#include "client/mutex.h"

namespace gs::client {
namespace {

struct FailureLog {
  Mutex mutex;
  char last[kFailureIdSize] GS_GUARDED_BY(mutex) = "";
  unsigned count GS_GUARDED_BY(mutex) = 0;
};

// Never destroyed: a failure may be met while the process ends.
FailureLog& failure_log() {
  static FailureLog& log = *new FailureLog;
  return log;
}

}  // namespace

void record_failure(const char* what, int code) {
  const std::time_t now = std::time(nullptr);
  std::tm utc{};
  gmtime_r(&now, &utc);
  char when[20];
  std::strftime(when, sizeof(when), "%Y%m%dT%H%M%SZ", &utc);

  FailureLog& log = failure_log();
  MutexLock lock(log.mutex);
  ++log.count;
  std::snprintf(log.last, sizeof(log.last), "%.16s-%d-%d-%u-%s", what, code, static_cast<int>(getpid()), log.count,
                when);
}

std::string last_failure_id() {
  FailureLog& log = failure_log();
  MutexLock lock(log.mutex);
  return log.last;
}

}  // namespace gs::client
