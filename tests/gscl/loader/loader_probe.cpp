// What a process does that has not loaded the base API yet: the first argument says with which operation it
// begins.
#include <dlfcn.h>
#include <stdio.h>
#include <string.h>

#include <atomic>
#include <thread>

#include "gscl/gscl.h"

namespace {

std::atomic<int> opened{0};

int fail(const char* what) {
  printf("failed: %s\n", what);
  return 1;
}

#define REQUIRE(condition) \
  if (!(condition)) return fail(#condition)

int destroyController() {
  { zelt_gscl_V1::GSController controller; }
  REQUIRE(GSAPIRtns == nullptr);
  REQUIRE(opened == 0);
  return 0;
}

int query() {
  int node = -1;
  REQUIRE(zelt_gscl_V1::GSController::get_node_number(&node) == static_cast<wyx_rc_t>(23));
  REQUIRE(node == 1);
  REQUIRE(GSAPIRtns != nullptr);
  REQUIRE(GSAPIRtns->wyx_join == nullptr);
  REQUIRE(zelt_gscl_V1::GSController::pell_migrate_prep() == WYX_NOT_SUPPORTED);
  REQUIRE(zelt_gscl_V1::GSDispatcher().dispatch(WYX_NON_BLOCKING) == WYX_NOT_SUPPORTED);
  REQUIRE(reinterpret_cast<void**>(GSAPIRtns)[16] == reinterpret_cast<void*>(GSAPIRtns->wyx_quit));
  REQUIRE(reinterpret_cast<void**>(GSAPIRtns)[31] != nullptr);
  const GSAPIRtnCollection_t before = *GSAPIRtns;
  Load_GSAPI_Routines();
  REQUIRE(memcmp(&before, GSAPIRtns, sizeof before) == 0);
  return 0;
}

int race() {
  constexpr int kThreads = 8;
  std::atomic<int> ready{0}, wrong{0};
  std::atomic<GSAPIRtnCollection_t*> table{nullptr};
  std::thread threads[kThreads];
  for (std::thread& thread : threads) {
    thread = std::thread([&] {
      ++ready;
      while (ready < kThreads) std::this_thread::yield();
      int node = -1;
      if (zelt_gscl_V1::GSController::get_node_number(&node) != static_cast<wyx_rc_t>(23) || node != 1) ++wrong;
      GSAPIRtnCollection_t* mine = __atomic_load_n(&GSAPIRtns, __ATOMIC_ACQUIRE);
      GSAPIRtnCollection_t* other = table.exchange(mine);
      if (other != nullptr && other != mine) ++wrong;
    });
  }
  for (std::thread& thread : threads) thread.join();
  REQUIRE(wrong == 0);
  REQUIRE(opened == 1);
  return 0;
}

}  // namespace

// Stands before the one of the C library and counts.
extern "C" __attribute__((visibility("default"))) void* dlopen(const char* name, int flags) noexcept(true) {
  using Open = void* (*)(const char*, int);
  static const Open real = reinterpret_cast<Open>(dlsym(RTLD_NEXT, "dlopen"));
  if (name != nullptr && strcmp(name, "libwyx_r.so") == 0) {
    if (flags != RTLD_NOW) fail("RTLD_NOW");
    ++opened;
  }
  return real(name, flags);
}

int main(int argc, char** argv) {
  const char* mode = argc > 1 ? argv[1] : "";
  if (strcmp(mode, "destroy") == 0) return destroyController();
  if (strcmp(mode, "query") == 0) return query();
  if (strcmp(mode, "race") == 0) return race();
  return fail("mode");
}
