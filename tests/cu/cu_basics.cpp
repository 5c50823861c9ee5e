// Version, clock and stack sizes of the common utilities.
#include <errno.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdint>
#include <string>

#include "zn_cu.h"

namespace {

std::string versionText() {
  cu_vrmf_t* v = nullptr;
  if (cu_get_version_1(0, &v) != 0) return "none";
  return std::to_string(v->version) + "." + std::to_string(v->release) + "." + std::to_string(v->modlevel) + "." +
         std::to_string(v->fixlevel);
}

// Each in a process of its own, since the environment is read once.
std::string versionWith(const char* environment) {
  int ends[2];
  if (pipe(ends) != 0) return "no pipe";
  const pid_t child = fork();
  if (child == 0) {
    setenv("ZN_CU_VERSION", environment, 1);
    const std::string text = versionText();
    _exit(write(ends[1], text.data(), text.size()) > 0 ? 0 : 1);
  }
  close(ends[1]);
  char buffer[64];
  const ssize_t n = read(ends[0], buffer, sizeof(buffer));
  close(ends[0]);
  int status = 0;
  waitpid(child, &status, 0);
  return std::string(buffer, n > 0 ? static_cast<size_t>(n) : 0);
}

TEST(CuVersion, environment_overridesTheBuiltInVersionOnlyWhenWellFormed) {
  EXPECT_EQ(versionWith("2.3.0.10"), "2.3.0.10");
  EXPECT_EQ(versionWith("65535.0.0.65535"), "65535.0.0.65535");
  for (const char* bad :
       {"", "4", "4.5.6", "4.5.6.7.8", "4.5.6.7 ", " 4.5.6.7", "4.-5.6.7", "4.5.6.65536", "a.b.c.d"}) {
    EXPECT_EQ(versionWith(bad), "3.2.6.0") << '"' << bad << '"';
  }
}

TEST(CuVersion, record_isOneForTheProcessAndBadArgumentsLeaveThePointerAlone) {
  const auto isRight = [] {
    cu_vrmf_t* first = nullptr;
    cu_vrmf_t* second = nullptr;
    if (cu_get_version_1(0, &first) != 0 || cu_get_version_1(0, &second) != 0 || first != second) return false;
    return cu_get_version_1(1, &second) == EINVAL && second == first && cu_get_version_1(0, nullptr) == EINVAL;
  };
  EXPECT_EXIT(_exit(isRight() ? 0 : 1), testing::ExitedWithCode(0), "");
}

TEST(CuClock, currentTime_liesBetweenTwoReadingsOfTheWallClock) {
  const auto nanos = [](const timespec& t) { return int64_t{t.tv_sec} * 1000000000 + t.tv_nsec; };
  timespec before, now, after;
  clock_gettime(CLOCK_REALTIME, &before);
  ASSERT_EQ(cu_get_current_time_1(&now), 0);
  clock_gettime(CLOCK_REALTIME, &after);
  EXPECT_LE(nanos(before), nanos(now));
  EXPECT_LE(nanos(now), nanos(after));
  EXPECT_EQ(cu_get_current_time_1(nullptr), EINVAL);
}

TEST(CuStackSize, anyRequest_givesWholePagesThatTheThreadsLibraryTakes) {
  const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
  pthread_attr_t attributes;
  ASSERT_EQ(pthread_attr_init(&attributes), 0);
  for (const size_t wanted : {size_t{0}, size_t{1}, page, size_t{1000001}, size_t{8} << 20}) {
    const size_t size = cu_pick_thread_stacksize_1(wanted);
    EXPECT_GE(size, wanted);
    EXPECT_EQ(size % page, 0u) << wanted;
    EXPECT_EQ(pthread_attr_setstacksize(&attributes, size), 0) << wanted;
  }
  pthread_attr_destroy(&attributes);
  EXPECT_EQ(cu_pick_thread_stacksize_1(16 * page), 16 * page);
  EXPECT_EQ(cu_pick_thread_stacksize_1(SIZE_MAX) % page, 0u) << "rounding up does not wrap";
  EXPECT_GT(cu_pick_thread_stacksize_1(SIZE_MAX), SIZE_MAX / 2);
}

}  // namespace
