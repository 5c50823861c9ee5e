// A libwyx_r.so that has only some of the entry points and counts how often it was loaded.
#include "gscl/wyx_api.h"

#define ENTRY extern "C" __attribute__((visibility("default")))

namespace {
int loads = 0;
__attribute__((constructor)) void countLoad() { ++loads; }
}  // namespace

ENTRY wyx_rc_t wyx_get_node_number(int* node) {
  *node = loads;
  return static_cast<wyx_rc_t>(23);
}
ENTRY wyx_rc_t wyx_quit() { return WYX_OK; }
ENTRY wyx_rc_t wyx_dissolve_subcluster(const wyx_subcluster_dissolution_info_t*) { return WYX_EXISTS; }
