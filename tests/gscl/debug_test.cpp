#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <memory>
#include <regex>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "gscl/GSDebug.h"
#include "gscl/GSValues.h"
#include "tests/support/fresh_process.h"

// Level word, file and routines are set once in a process, so every test runs in one of its own and answers
// through its standard output.

namespace {

using testing::HasSubstr;
using testing::MatchesRegex;
using testing::Not;

#define TRACE_PREFIX "[A-Z][a-z][a-z] [ 0-9][0-9] [0-9][0-9]:[0-9][0-9]:[0-9][0-9] TID=0x[0-9a-f]+ "

/// A file that is gone with the test.
class TempFile {
 public:
  explicit TempFile(const std::string& text) {
    const int fd = mkstemp(path_);
    if (fd >= 0) close(fd);
    std::ofstream(path_) << text;
  }
  ~TempFile() { unlink(path_); }
  TempFile(const TempFile&) = delete;
  TempFile& operator=(const TempFile&) = delete;

  const char* path() const { return path_; }
  std::string text() const {
    std::ostringstream all;
    all << std::ifstream(path_).rdbuf();
    return all.str();
  }

 private:
  char path_[32] = "/tmp/gscl_debug_test.XXXXXX";
};

void environment(const char* level, const char* file) {
  level != nullptr ? setenv("GSCL_DBGLVL", level, 1) : unsetenv("GSCL_DBGLVL");
  file != nullptr ? setenv("GSCL_DBGFILE", file, 1) : unsetenv("GSCL_DBGFILE");
}

std::string level_read_from(const char* text) {
  return in_fresh_process([=] {
           environment(text, nullptr);
           printf("%x %x %x", GSDebugLevel(), GSDebugging(0x20000000), GSDebugging(0));
         })
      .out;
}

TEST(Debug, levelInTheEnvironment_isReadInEveryForm) {
  EXPECT_EQ(level_read_from(nullptr), "0 0 1");
  EXPECT_EQ(level_read_from("0x20000000"), "20000000 1 1");
  EXPECT_EQ(level_read_from("0X20000000"), "20000000 1 1");
  EXPECT_EQ(level_read_from("536870912"), "20000000 1 1");
  EXPECT_EQ(level_read_from("0xb8000000"), "b8000000 1 1");
  EXPECT_EQ(level_read_from("0x120000001"), "20000001 1 1") << "cut to 32 bits";
  EXPECT_EQ(level_read_from(" -1"), "ffffffff 1 1");
  EXPECT_EQ(level_read_from("16 and more"), "10 0 1");
  EXPECT_EQ(level_read_from("0x"), "0 0 1");
  EXPECT_EQ(level_read_from("0xyz"), "0 0 1");
  EXPECT_EQ(level_read_from("high"), "0 0 1");
  EXPECT_EQ(level_read_from(""), "0 0 1");
}

TEST(Debug, levelSetFirst_environmentIsNeverRead) {
  const TempFile file("kept");
  const FreshOutput seen = in_fresh_process([&] {
    environment("0xffffffff", file.path());
    GSSetDebugLevel(8);
    printf("%d", GSDebugLevel());
    GStracef(GSCL_TRC_API, "off\n");
    GStracef(8, "on\n");
  });
  EXPECT_EQ(seen.out, "8");
  EXPECT_THAT(seen.err, MatchesRegex(TRACE_PREFIX "TRC_GSCL on\n"));
  EXPECT_EQ(file.text(), "kept");
}

TEST(Debug, levelZeroOrNullRoutine_leaveTheEnvironmentUnread) {
  const TempFile file("kept");
  const FreshOutput seen = in_fresh_process([&] {
    environment("0x20000000", file.path());
    GStracef(0, "always\n");
    GSdebugf(0, "%s\n", "always too");
    GSSetDebugRtn(nullptr);
    const gscl_tracef_rtn standard = GSSetTraceRtn(nullptr);
    const GSTraceFn unseen("unseen");
    GStracef(GSCL_TRC_API, "silent\n");
    GSSetTraceRtn(standard);
    environment("0x10000000", nullptr);
    GStracef(GSCL_TRC_API, "off\n");
    GStracef(GSCL_TRC_DETAIL, "on\n");
  });
  EXPECT_THAT(seen.err, MatchesRegex(TRACE_PREFIX "TRC_GSCL always\n" TRACE_PREFIX "always too\n" TRACE_PREFIX
                                                  "TRC_GSCL on\n"));
  EXPECT_EQ(file.text(), "kept");
}

TEST(Debug, firstLineOfTheLibraryItself_readsTheEnvironment) {
  const FreshOutput seen = in_fresh_process([] {
    environment("0x10000000", nullptr);
    wyx_provider_t id = {};
    const wyx_membership_t record = {1, &id};
    zelt_gscl_V1::GSMembershipList(&record).plus(&record);
  });
  EXPECT_THAT(seen.err, HasSubstr("TRC_GSCL GSMbrship::plus() is already included\n"));
}

TEST(Debug, fileSet_replacesTheOneBefore) {
  const TempFile first("");
  const TempFile second("");
  const FreshOutput seen = in_fresh_process([&] {
    GSSetDebugLevel(0);
    gscl_set_debug_file(first.path());
    GStracef(0, "one\n");
    gscl_set_debug_file(second.path());
    GStracef(0, "two\n");
    gscl_set_debug_file("/nowhere/at/all");
    GStracef(0, "three\n");
    gscl_set_debug_file(second.path());
    gscl_set_debug_file(nullptr);
    GStracef(0, "four\n");
  });
  EXPECT_THAT(first.text(), MatchesRegex(TRACE_PREFIX "TRC_GSCL one\n"));
  EXPECT_EQ(second.text(), "") << "opened again, so truncated";
  EXPECT_THAT(seen.err, MatchesRegex(TRACE_PREFIX "TRC_GSCL three\n" TRACE_PREFIX "TRC_GSCL four\n"));
}

TEST(Debug, prefix_namesLocalTimeAndThread) {
  const FreshOutput seen = in_fresh_process([] {
    setenv("TZ", "UTC", 1);
    GStracef(0, "x\n");
    setenv("TZ", "FAR+11:30", 1);
    const time_t before = time(nullptr);
    GStracef(0, "x\n");
    const time_t after = time(nullptr);
    printf("%.15s\n%.15s\n", std::string(ctime(&before) + 4).c_str(), std::string(ctime(&after) + 4).c_str());
    printf("TID=0x%x ", static_cast<unsigned int>(pthread_self()));
  });
  std::istringstream lines(seen.out);
  std::string before;
  std::string after;
  std::string thread;
  std::getline(lines, before);
  std::getline(lines, after);
  std::getline(lines, thread);
  const std::string line = seen.err.substr(seen.err.find('\n') + 1);
  EXPECT_THAT(line.substr(0, 15), testing::AnyOf(before, after));
  EXPECT_THAT(line, HasSubstr(" " + thread));
}

TEST(Debug, text_isCutAt2047AndGoesOutVerbatim) {
  const FreshOutput seen = in_fresh_process([] {
    GStracef(0, "%s\n", "100%s %n %d");
    GSdebugf(0, "%s\n", "100%s %n %d");
    const std::string longer(5000, 'Z');
    GStracef(0, "%s", longer.c_str());
    GSSetTraceRtn([](int level, char* text) { printf("%d %zu", level, strlen(text)); });
    GStracef(0, "%s", longer.c_str());
  });
  EXPECT_EQ(seen.out, "0 2047");
  EXPECT_THAT(seen.err, MatchesRegex(TRACE_PREFIX "TRC_GSCL 100%s %n %d\n" TRACE_PREFIX
                                                  "100%s %n %d\n" TRACE_PREFIX "TRC_GSCL Z+"));
  EXPECT_EQ(std::count(seen.err.begin(), seen.err.end(), 'Z'), 2047);
}

TEST(Debug, routinesReplaced_giveBackTheOneBefore) {
  const FreshOutput seen = in_fresh_process([] {
    GSSetDebugLevel(0x5);
    const gscl_tracef_rtn mine = [](int level, char* text) { printf("trace %d %s", level, text); };
    const gscl_tracef_rtn standard = GSSetTraceRtn(mine);
    GStracef(4, "a\n");
    GStracef(2, "off\n");
    _gs_debugf_ = [](int level, char* text) { printf("debug %d %s", level, text); };
    GSdebugf(1, "b\n");
    printf("%d\n", GSSetTraceRtn(nullptr) == mine);
    GStracef(0, "silent\n");
    printf("%d\n", GSSetTraceRtn(standard) == nullptr);
    GStracef(0, "back\n");
    printf("%d\n", _gs_tracef_ == standard);
    GSSetTraceRtn([](int, char*) { throw std::runtime_error("from the routine\n"); });
    try {
      GStracef(0, "thrown");
    } catch (const std::runtime_error& error) {
      printf("%s", error.what());
    }
  });
  EXPECT_EQ(seen.status, 0);
  EXPECT_EQ(seen.out, "trace 4 a\ndebug 1 b\n1\n1\n1\nfrom the routine\n");
  EXPECT_THAT(seen.err, MatchesRegex(TRACE_PREFIX "TRC_GSCL back\n"));
}

TEST(TraceFn, nested_indentsByDepthUpToThirty) {
  const FreshOutput seen = in_fresh_process([] {
    const GSTraceFn unseen("unseen");  // counts although nothing is written
    GSSetDebugLevel(GSCL_TRC_FUNC);
    {
      const GSTraceFn outer("outer");
      {
        const GSTraceFn inner("inner");
        GSdebugf(0, "x\n");
      }
      GSdebugf(0, "y\n");
    }
    printf("%s\n", GSTraceDebugName());
    GSSetDebugLevel(0);
    std::vector<std::unique_ptr<GSTraceFn>> deep;
    for (int i = 0; i < 40; i++) deep.push_back(std::make_unique<GSTraceFn>("deep"));
    GSdebugf(0, "z\n");
    while (!deep.empty()) deep.pop_back();
  });
  EXPECT_EQ(seen.out, "unseen\n");
  const std::string depth30(30, ' ');
  std::string lines = std::regex_replace(seen.err, std::regex(TRACE_PREFIX), "");
  EXPECT_EQ(lines, "   outer:Entering....\n" + std::string("    inner:Entering....\n") + "    inner:x\n" +
                       "    inner:Leaving...\n" + "   outer:y\n" + "   outer:Leaving...\n" + depth30 +
                       " deep:z\n");
}

TEST(TraceFn, routineThrows_nameAndDepthAreRestored) {
  const FreshOutput seen = in_fresh_process([] {
    GSSetDebugLevel(GSCL_TRC_FUNC);
    const gscl_debugf_rtn standard = GSSetDebugRtn([](int, char* text) {
      if (text[0] == 'E') throw std::runtime_error(text);
    });
    try {
      const GSTraceFn refused("refused");
    } catch (const std::runtime_error&) {
      printf("%d\n", GSTraceDebugName() == nullptr);
    }
    GSSetDebugRtn([](int, char* text) {
      if (text[0] == 'L') throw std::runtime_error(text);
    });
    try {
      const GSTraceFn left("left");
    } catch (const std::runtime_error&) {
      printf("%d\n", GSTraceDebugName() == nullptr);
    }
    GSSetDebugRtn(standard);
    const GSTraceFn fine("fine");
  });
  EXPECT_EQ(seen.out, "1\n1\n");
  EXPECT_THAT(seen.err, HasSubstr("   fine:Entering....\n"));
  EXPECT_THAT(seen.err, Not(HasSubstr("    fine")));
}

constexpr int kThreads = 6;

template <class Function>
void in_threads(Function function) {
  std::atomic<int> ready{0};
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; i++) {
    threads.emplace_back([&, i] {
      ready++;
      while (ready < kThreads) std::this_thread::yield();
      function(i);
    });
  }
  for (std::thread& thread : threads) thread.join();
}

std::vector<std::string> lines_of(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream stream(text);
  for (std::string line; std::getline(stream, line);) lines.push_back(line);
  return lines;
}

TEST(Debug, firstUseInManyThreads_truncatesTheFileAndLosesNoLine) {
  const TempFile file("old contents");
  const FreshOutput seen = in_fresh_process([&] {
    environment("0x20000000", file.path());
    in_threads([](int i) {
      GStracef(GSCL_TRC_API, "thread %d\n", i);
      GSdebugf(GSCL_TRC_API, "debug\n");
    });
  });
  EXPECT_EQ(seen.status, 0) << seen.err;
  EXPECT_EQ(seen.err, "");
  EXPECT_EQ(lines_of(file.text()).size(), 2u * kThreads);
  EXPECT_THAT(lines_of(file.text()), testing::Each(MatchesRegex(TRACE_PREFIX "(TRC_GSCL thread [0-9]|debug)")));
}

TEST(Debug, manyWritersWhileFileAndLevelChange_everyLineIsWhole) {
  const TempFile file("");
  const FreshOutput seen = in_fresh_process([&] {
    GSSetDebugLevel(GSCL_TRC_API);
    in_threads([&](int i) {
      for (int round = 0; round < 200; round++) {
        if (i == 0) {
          gscl_set_debug_file(round % 2 == 0 ? file.path() : nullptr);
          GSSetDebugLevel(round % 3 == 0 ? GSCL_TRC_API : GSCL_TRC_FUNC);
          GSSetTraceRtn(GSSetTraceRtn(nullptr));
        } else {
          const GSTraceFn scope("scope");
          GSdebugf(0, "debug line end\n");
          GStracef(0, "trace line end\n");
        }
      }
    });
  });
  EXPECT_EQ(seen.status, 0) << seen.err;
  const std::regex whole(TRACE_PREFIX
                         "(TRC_GSCL trace line end|( *scope:)?(debug line end|Entering....|Leaving...))");
  for (const std::string& line : lines_of(seen.err + file.text())) {
    EXPECT_TRUE(std::regex_match(line, whole)) << line;
  }
}

}  // namespace
