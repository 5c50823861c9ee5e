// Level word, file and routines are set once in a process, so every test runs in one of its own and answers
// through its standard output.
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <barrier>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <memory>
#include <regex>
#include <sstream>
#include <stdexcept>
#include <thread>
#include <vector>

#include "common/sanitizers.h"
#include "gscl/GSDebug.h"
#include "gscl/GSValues.h"
#include "tests/support/fresh_process.h"
#include "tests/support/temp_dir.h"

namespace {

using testing::HasSubstr;
using testing::MatchesRegex;

#define PREFIX "[A-Z][a-z][a-z] [ 0-9][0-9] [0-9][0-9]:[0-9][0-9]:[0-9][0-9] TID=0x[0-9a-f]+ "

/// A file that is gone with the test.
class TempFile {
 public:
  explicit TempFile(const std::string& text) { std::ofstream(path_) << text; }

  const char* path() const { return path_.c_str(); }
  std::string text() const {
    std::ostringstream all;
    all << std::ifstream(path_).rdbuf();
    return all.str();
  }

 private:
  test_support::TempDir dir_;
  std::string path_ = dir_ / "trace";
};

void environment(const char* level, const char* file) {
  level != nullptr ? setenv("GSCL_DBGLVL", level, 1) : unsetenv("GSCL_DBGLVL");
  file != nullptr ? setenv("GSCL_DBGFILE", file, 1) : unsetenv("GSCL_DBGFILE");
}

TEST(Debug, levelInTheEnvironment_isReadInEveryForm) {
  struct Case {
    const char *text, *level;
  };
  for (const Case& c : {Case{nullptr, "0"}, Case{"0x20000000", "20000000"}, Case{"0X20000000", "20000000"},
                        Case{"536870912", "20000000"}, Case{"0x120000001", "20000001"}, Case{" -1", "ffffffff"},
                        Case{"016 and more", "10"}, Case{"0xyz", "0"}, Case{"high", "0"}, Case{"", "0"}}) {
    const FreshOutput seen = in_fresh_process([&] {
      environment(c.text, nullptr);
      printf("%x", GSDebugLevel());
    });
    EXPECT_EQ(seen.out, c.level) << c.text;
  }
}

TEST(Debug, environment_isReadByTheFirstLineThatNeedsItUnlessTheLevelWasSet) {
  const TempFile file("kept");
  FreshOutput seen = in_fresh_process([&] {
    environment("0xffffffff", file.path());
    GSSetDebugLevel(8);
    GStracef(GSCL_TRC_API, "off\n");
    GStracef(8, "on\n");
  });
  EXPECT_THAT(seen.err, MatchesRegex(PREFIX "TRC_GSCL on\n"));

  seen = in_fresh_process([&] {
    environment("0x20000000", file.path());
    GStracef(0, "always\n");
    GSdebugf(0, "%s\n", "always too");
    GSSetDebugRtn(nullptr);
    const gscl_tracef_rtn standard = GSSetTraceRtn(nullptr);
    const GSTraceFn unseen("unseen");
    GStracef(GSCL_TRC_API, "silent\n");
    GSSetTraceRtn(standard);
    environment("0x10000000", nullptr);
    wyx_provider_t id = {};
    const wyx_membership_t record = {1, &id};
    zelt_gscl_V1::GSMembershipList(&record).plus(&record);
    GStracef(GSCL_TRC_API, "off\n");
  });
  EXPECT_THAT(seen.err, MatchesRegex(PREFIX "TRC_GSCL always\n" PREFIX "always too\n" PREFIX
                                            "TRC_GSCL GSMbrship::plus\\(\\) is already included\n"));
  EXPECT_EQ(file.text(), "kept");
}

TEST(Debug, prefix_namesLocalTimeAndThread) {
  const FreshOutput seen = in_fresh_process([] {
    setenv("TZ", "UTC", 1);
    GStracef(0, "x\n");
    setenv("TZ", "FAR+11:30", 1);
    const time_t before = time(nullptr);
    GSdebugf(0, "x\n");
    const time_t after = time(nullptr);
    // Only now: ctime notices the change of TZ for everybody.
    printf("(%.15s|", ctime(&before) + 4);
    printf("%.15s) TID=0x%x x\n", ctime(&after) + 4, static_cast<unsigned>(pthread_self()));
  });
  EXPECT_THAT(seen.err.substr(seen.err.find('\n') + 1), MatchesRegex(seen.out));
}

TEST(Debug, text_isCutAt2047AndGoesOutVerbatim) {
  const FreshOutput seen = in_fresh_process([] {
    const std::string longer(5000, 'Z');
    GSdebugf(0, "%s\n", "100%s %n %d");
    GStracef(0, "%s%s", "100%s %n %d", longer.c_str());
  });
  EXPECT_THAT(seen.err, MatchesRegex(PREFIX "100%s %n %d\n" PREFIX "TRC_GSCL 100%s %n %dZ+"));
  EXPECT_EQ(std::count(seen.err.begin(), seen.err.end(), 'Z'), 2047 - 11);
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
    const bool previous = GSSetTraceRtn(nullptr) == mine;
    GStracef(0, "silent\n");
    printf("%d\n", previous && GSSetTraceRtn(standard) == nullptr && _gs_tracef_ == standard);
  });
  EXPECT_EQ(seen.out, "trace 4 a\ndebug 1 b\n1\n");
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
  EXPECT_EQ(std::regex_replace(seen.err, std::regex(PREFIX), ""),
            "   outer:Entering....\n    inner:Entering....\n    inner:x\n    inner:Leaving...\n   outer:y\n"
            "   outer:Leaving...\n" +
                std::string(30, ' ') + " deep:z\n");
}

TEST(TraceFn, routineThrows_nameAndDepthAreRestored) {
  const FreshOutput seen = in_fresh_process([] {
    static char refused;
    GSSetDebugLevel(GSCL_TRC_FUNC);
    const gscl_debugf_rtn standard = GSSetDebugRtn([](int, char* text) {
      if (text[0] == refused) throw std::runtime_error(text);
    });
    for (const char* text : {"Entering", "Leaving", "Leaving while another one"}) {
      refused = text[0];
      try {
        const GSTraceFn thrown("thrown");
        if (strlen(text) > 8) throw std::runtime_error("the function's\n");
      } catch (const std::runtime_error& error) {
        printf("%d %s", GSTraceDebugName() == nullptr, error.what());
      }
    }
    GSSetDebugRtn(standard);
    const GSTraceFn fine("fine");
  });
  EXPECT_EQ(seen.out, "1 Entering....\n1 Leaving...\n1 the function's\n");
  EXPECT_THAT(seen.err, MatchesRegex(PREFIX "  fine:Entering....\n" PREFIX "  fine:Leaving...\n"));
}

constexpr int kThreads = 6;

/// Runs it in all threads at once.
template <class Function>
void in_threads(Function function) {
  std::barrier start(kThreads);
  std::vector<std::jthread> threads;
  for (int i = 0; i < kThreads; i++) {
    threads.emplace_back([&, i] {
      start.arrive_and_wait();
      function(i);
    });
  }
}

int expectWholeLines(const std::string& text) {
  static const std::regex whole(PREFIX
                                "(TRC_GSCL trace line [0-9]|( *scope:)?(debug line end|Entering....|Leaving...))");
  int n = 0;
  std::istringstream stream(text);
  for (std::string line; std::getline(stream, line); ++n) EXPECT_TRUE(std::regex_match(line, whole)) << line;
  return n;
}

TEST(Debug, firstUseInManyThreads_truncatesTheFileAndLosesNoLine) {
  const TempFile file("old contents");
  const FreshOutput seen = in_fresh_process([&] {
    environment("0x20000000", file.path());
    in_threads([](int i) {
      GStracef(GSCL_TRC_API, "trace line %d\n", i);
      GSdebugf(GSCL_TRC_API, "debug line end\n");
    });
  });
  EXPECT_EQ(seen.status, 0) << seen.err;
  EXPECT_EQ(seen.err, "");
  EXPECT_EQ(expectWholeLines(file.text()), 2 * kThreads);
}

TEST(Debug, manyWritersWhileFileAndLevelChange_everyLineIsWhole) {
  const TempFile file("");
  const FreshOutput seen = in_fresh_process([&] {
    GSSetDebugLevel(GSCL_TRC_API);
    in_threads([&](int i) {
      for (int round = 0; round < 2000; round++) {
        if (i == 0) {
          gscl_set_debug_file(round % 2 == 0 ? file.path() : nullptr);
          GSSetDebugLevel(round % 3 == 0 ? GSCL_TRC_API : GSCL_TRC_FUNC);
          GSSetTraceRtn(GSSetTraceRtn(nullptr));
        } else {
          const GSTraceFn scope("scope");
          GSdebugf(0, "debug line end\n");
          GStracef(0, "trace line %d\n", i);
        }
      }
    });
  });
  EXPECT_EQ(seen.status, 0) << seen.err;
  expectWholeLines(seen.err + file.text());
}

TEST(Debug, fileClosedByTheApplication_isNeverMistakenForWhatTakesItsNumber) {
  const TempFile trace(""), unlinked(""), data("data"), late("");
  const FreshOutput seen = in_fresh_process([&] {
    gscl_set_debug_file(unlinked.path());
    unlink(unlinked.path());
    unlink(late.path());
    close_range(STDERR_FILENO + 1, ~0U, 0);
    open(late.path(), O_RDWR | O_CREAT, 0600);  // may get the inode of the one that is gone
    GStracef(0, "gone\n");
    unlink(trace.path());
    umask(0);
    gscl_set_debug_file(trace.path());
    struct stat created = {};
    stat(trace.path(), &created);
    GStracef(0, "kept\n");
    close_range(STDERR_FILENO + 1, ~0U, 0);
    for (int i = 0; i < 20; ++i) open(data.path(), O_RDWR);
    GStracef(0, "closed\n");
    gscl_set_debug_file(nullptr);
    printf("%o %d", created.st_mode & 0777, fcntl(STDERR_FILENO + 1, F_GETFD) != -1);
  });
  EXPECT_EQ(seen.out, "644 1");
  EXPECT_THAT(seen.err, MatchesRegex(PREFIX "TRC_GSCL gone\n" PREFIX "TRC_GSCL closed\n"));
  EXPECT_EQ(late.text(), "");
  EXPECT_THAT(trace.text(), MatchesRegex(PREFIX "TRC_GSCL kept\n"));
  EXPECT_EQ(data.text(), "data");
}

TEST(Debug, childrenForkedWhileOthersWrite_writeTheirLinesToo) {
#if ZN_ADDRESS_SANITIZER
  GTEST_SKIP() << "the sanitizer's memory, unlike the system's, is not whole in a child of several threads";
#endif
  constexpr int kChildren = 100;
  const TempFile file("");
  const FreshOutput seen = in_fresh_process([&] {
    gscl_set_debug_file(file.path());
    std::atomic<bool> done = false;
    std::vector<std::jthread> writers;
    for (int i = 0; i < 3; ++i) {
      writers.emplace_back([&] {
        while (!done) GStracef(0, "trace line 0\n");
      });
    }
    for (int i = 0, status = 0; i < kChildren && status == 0; ++i) {
      const pid_t child = fork();
      if (child == 0) {
        alarm(60);  // should it hang
        GStracef(0, "trace line 1\n");
        _exit(0);
      }
      waitpid(child, &status, 0);
    }
    done = true;
  });
  EXPECT_EQ(seen.status, 0) << seen.err;
  expectWholeLines(file.text());
  const std::string text = file.text();
  int children = 0;
  for (size_t at = 0; (at = text.find("line 1\n", at)) != text.npos; ++at) ++children;
  EXPECT_EQ(children, kChildren);
}

}  // namespace
