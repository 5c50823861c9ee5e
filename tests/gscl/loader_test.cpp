// Loading the base API library: once, with gaps, or not at all. Each test is a process of its own, in which this
// program takes the library's place.
#include <dlfcn.h>
#include <string.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "gscl/gscl.h"
#include "tests/support/fresh_process.h"

namespace {

std::atomic<int> opened{0};
bool present = true;

constexpr auto kAnswer = static_cast<wyx_rc_t>(23);

}  // namespace

#define EXPORTED extern "C" __attribute__((visibility("default")))

// Stands before the one of the C library.
EXPORTED void* dlopen(const char* name, int flags) noexcept(true) {
  using Open = void* (*)(const char*, int);
  static const Open real = reinterpret_cast<Open>(dlsym(RTLD_NEXT, "dlopen"));
  if (name == nullptr || strcmp(name, "libwyx_r.so") != 0) return real(name, flags);
  opened += flags == RTLD_NOW ? 1 : 100;
  usleep(10000);  // room for other threads to (wrongly) open it too
  return present ? real(nullptr, RTLD_NOW) : nullptr;
}
EXPORTED wyx_rc_t wyx_get_node_number(int* node) {
  *node = 1;
  return kAnswer;
}
EXPORTED wyx_rc_t wyx_quit() { return WYX_OK; }
EXPORTED wyx_rc_t wyx_dissolve_subcluster(const wyx_subcluster_dissolution_info_t*) { return WYX_EXISTS; }

namespace {

using zelt_gscl_V1::GSController;

#define REQUIRE(condition) \
  if (!(condition)) printf("failed: %s\n", #condition)

TEST(Loader, Missing_saysSoAndAborts) {
  const FreshOutput seen = in_fresh_process([] {
    present = false;
    { GSController controller; }
    REQUIRE(opened == 0 && GSAPIRtns == nullptr);
    GSController::pell_migrate_prep();
    printf("lived on\n");
  });
  EXPECT_NE(seen.status, 0);
  EXPECT_EQ(seen.out, "");
  EXPECT_THAT(seen.err, testing::ContainsRegex("^dlopen libwyx_r.so errno=[0-9]+\n.*Assertion"));
}

TEST(Loader, EntryPointsThatAreMissing_areNotSupported) {
  const FreshOutput seen = in_fresh_process([] {
    int node = 0;
    REQUIRE(GSController::get_node_number(&node) == kAnswer && node == 1);
    REQUIRE(GSAPIRtns->wyx_join == nullptr);
    REQUIRE(GSController::pell_migrate_prep() == WYX_NOT_SUPPORTED);
    REQUIRE(zelt_gscl_V1::GSDispatcher().dispatch(WYX_NON_BLOCKING) == WYX_NOT_SUPPORTED);
    REQUIRE(stub_dissolve_subcluster(nullptr) == WYX_EXISTS);
    REQUIRE(reinterpret_cast<void**>(GSAPIRtns)[16] == reinterpret_cast<void*>(wyx_quit));
    REQUIRE(reinterpret_cast<void**>(GSAPIRtns)[31] == reinterpret_cast<void*>(wyx_dissolve_subcluster));
    const GSAPIRtnCollection_t before = *GSAPIRtns;
    Load_GSAPI_Routines();
    REQUIRE(memcmp(&before, GSAPIRtns, sizeof before) == 0);
  });
  EXPECT_EQ(seen.out + seen.err, "");
  EXPECT_EQ(seen.status, 0);
}

TEST(Loader, FirstOperationsOfManyThreads_loadOnce) {
  const FreshOutput seen = in_fresh_process([] {
    constexpr int kThreads = 8;
    std::atomic<int> ready{0};
    std::thread threads[kThreads];
    for (std::thread& thread : threads) {
      thread = std::thread([&] {
        ++ready;
        while (ready < kThreads) std::this_thread::yield();
        int node = 0;
        REQUIRE(GSController::get_node_number(&node) == kAnswer && node == 1);
      });
    }
    for (std::thread& thread : threads) thread.join();
    REQUIRE(opened == 1);
  });
  EXPECT_EQ(seen.out + seen.err, "");
  EXPECT_EQ(seen.status, 0);
}

}  // namespace
