// Version, clock and stack sizes. Stack dumps are in stackdump.cpp.
#include "zn_cu.h"

#include <errno.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>

namespace {

constexpr cu_vrmf_t kBuiltInVersion = {3, 2, 6, 0};

// "V.R.M.F" and nothing else; false leaves the version as it was.
bool parseVersion(const char* text, cu_vrmf_t* version) {
  uint16_t parts[4];
  for (int i = 0; i < 4; ++i) {
    if (*text < '0' || *text > '9') return false;
    char* end = nullptr;
    const unsigned long part = strtoul(text, &end, 10);
    if (part > UINT16_MAX || *end != (i < 3 ? '.' : '\0')) return false;
    parts[i] = static_cast<uint16_t>(part);
    text = end + 1;
  }
  *version = {parts[0], parts[1], parts[2], parts[3]};
  return true;
}

cu_vrmf_t readVersion() {
  cu_vrmf_t version = kBuiltInVersion;
  if (const char* text = getenv("ZN_CU_VERSION")) parseVersion(text, &version);
  return version;
}

size_t systemDefaultStack() {
  pthread_attr_t attributes;
  size_t size = 0;
  if (pthread_attr_init(&attributes) != 0) return 0;
  pthread_attr_getstacksize(&attributes, &size);
  pthread_attr_destroy(&attributes);
  return size;
}

}  // namespace

int cu_get_version_1(int which, cu_vrmf_t** vrmf) {
  if (which != 0 || vrmf == nullptr) return EINVAL;
  static cu_vrmf_t version = readVersion();
  *vrmf = &version;
  return 0;
}

int cu_get_current_time_1(timespec* now) {
  if (now == nullptr) return EINVAL;
  return clock_gettime(CLOCK_REALTIME, now) == 0 ? 0 : errno;
}

size_t cu_pick_thread_stacksize_1(size_t wanted) {
  const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
  const long minimum = sysconf(_SC_THREAD_STACK_MIN);
  if (wanted == 0) wanted = systemDefaultStack();
  wanted = std::max(wanted, minimum > 0 ? static_cast<size_t>(minimum) : 4 * page);
  if (wanted > SIZE_MAX - page) return SIZE_MAX / page * page;
  return (wanted + page - 1) / page * page;
}
