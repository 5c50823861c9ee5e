// Version, clock and stack sizes; and what a process that dies of a fatal signal writes about its registered
// threads, and how it then ends.
#include <errno.h>
#include <limits.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>

#include <cstdint>
#include <future>
#include <regex>
#include <string>
#include <thread>

#include "tests/support/fresh_process.h"
#include "zn_cu.h"

namespace {

TEST(CuVersion, environment_overridesTheBuiltInVersionOnlyWhenWellFormed) {
  const std::string builtIn = "3.2.6.0";
  for (const char* text : {"2.3.0.10", "65535.0.0.65535", "", "4", "4.5.6", "4.5.6.7.8", "4.5.6.7 ", " 4.5.6.7",
                           "4.-5.6.7", "4.5.6.65536", "a.b.c.d"}) {
    const bool good = text[0] == '2' || text[0] == '6';
    const FreshOutput seen = in_fresh_process([&] {  // the environment is read once
      setenv("ZN_CU_VERSION", text, 1);
      cu_vrmf_t *v = nullptr, *again = nullptr;
      if (cu_get_version_1(0, nullptr) != EINVAL || cu_get_version_1(1, &v) != EINVAL || v != nullptr) return;
      if (cu_get_version_1(0, &v) != 0 || cu_get_version_1(0, &again) != 0 || again != v) return;
      printf("%d.%d.%d.%d", v->version, v->release, v->modlevel, v->fixlevel);
    });
    EXPECT_EQ(seen.out, good ? text : builtIn) << '"' << text << '"';
  }
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

void announce(const char* name) { fprintf(stderr, "%s=%ld\n", name, syscall(SYS_gettid)); }

// Starts a thread that registers, announces its id as "NAME=id" and stays until the process ends.
void startRegistered(const char* name, bool blockSignals = false) {
  std::promise<void> registered;
  std::thread([&registered, name, blockSignals] {
    sigset_t all;
    sigfillset(&all);
    if (blockSignals) pthread_sigmask(SIG_BLOCK, &all, nullptr);
    for (int twice = 0; twice < 2; ++twice) {
      if (cu_stackdump_thread_enable_1() != 0) _exit(99);
    }
    announce(name);
    registered.set_value();
    for (;;) poll(nullptr, 0, -1);
  }).detach();
  registered.get_future().wait();
}

/// What a process wrote that did this and should have died of `sig`, or, negative, left with that status.
class Death {
 public:
  template <class Scenario>
  Death(int sig, Scenario scenario)
      : _seen(in_fresh_process([&] {
          // The sanitizers' own handlers go, no core file is left.
          for (const int fatal : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT}) signal(fatal, SIG_DFL);
          const rlimit none = {0, 0};
          setrlimit(RLIMIT_CORE, &none);
          scenario();
        })) {
    EXPECT_EQ(sig > 0 ? WTERMSIG(_seen.status) : -WEXITSTATUS(_seen.status), sig) << _seen.err;
  }
  size_t times(const std::string& part) const {
    size_t n = 0;
    for (size_t at = _seen.err.find(part); at != std::string::npos; at = _seen.err.find(part, at + 1)) ++n;
    return n;
  }
  /// Exactly one stack of each of the threads, with at least `frames` addresses, and no other thread's.
  void expectStacks(std::vector<std::string> names, int frames = 2) const {
    EXPECT_EQ(times("stack of thread "), names.size()) << _seen.err;
    for (const std::string& name : names) {
      std::smatch id;
      ASSERT_TRUE(std::regex_search(_seen.err, id, std::regex(name + "=([0-9]+)\n"))) << _seen.err;
      const std::string heading = "stack of thread " + id[1].str() + ":\n";
      EXPECT_THAT(_seen.err,
                  testing::ContainsRegex(heading + "(.*\\[0x[0-9a-f]+\\]\n){" + std::to_string(frames) + "}"));
    }
  }

 private:
  FreshOutput _seen;
};

// Without an alternate stack the handler could not run at all.
[[gnu::noinline]] int recurse(volatile char* above, long times) {
  volatile char frame[4096];
  frame[0] = above[0];
  return times == 0 ? 0 : recurse(frame, times - 1) + frame[0];
}

TEST(CuStackDump, fatalSignal_dumpsEveryRegisteredThreadOnceAndEndsByThatSignal) {
  for (const int sig : {SIGABRT, SIGSEGV, SIGFPE, SIGBUS, SIGILL}) {
    const Death death(sig, [sig] {
      startRegistered("one");
      startRegistered("two");
      cu_stackdump_thread_enable_1();
      announce("self");
      raise(sig);
    });
    EXPECT_EQ(death.times("fatal signal " + std::to_string(sig)), 1u);
    death.expectStacks({"self", "one", "two"});
  }
}

TEST(CuStackDump, stackOverflowInARegisteredThread_isDumped) {
  Death(SIGSEGV, [] {
    std::thread([] {
      cu_stackdump_thread_enable_1();
      announce("deep");
      char start = 0;
      exit(recurse(&start, LONG_MAX));
    }).join();
  }).expectStacks({"deep"}, 10);
}

TEST(CuStackDump, threadThatBlocksAllSignals_isNamedAndDoesNotHoldUpTheEnd) {
  const Death death(SIGABRT, [] {
    startRegistered("deaf", true);
    startRegistered("well");
    announce("self");
    abort();
  });
  EXPECT_EQ(death.times(": no answer\n"), 1u);
  EXPECT_EQ(death.times(":\n"), 2u) << "of the stacks that are there";
}

TEST(CuStackDump, threadsThatLeftOrEnded_giveTheirPlaceBack) {
  Death(SIGABRT, [] {
    startRegistered("stays");
    for (int i = 0; i < 5000; ++i) {
      std::thread([] {
        if (cu_stackdump_thread_enable_1() != 0) _exit(99);
      }).join();
    }
    cu_stackdump_thread_enable_1();
    cu_stackdump_thread_disable_1(pthread_self());
    startRegistered("taken");
    announce("self");
    abort();
  }).expectStacks({"stays", "taken", "self"});
}

TEST(CuStackDump, handlerOfTheApplication_keepsItsSignal) {
  const Death death(-7, [] {
    signal(SIGABRT, [](int) { _exit(7); });
    startRegistered("one");
    struct sigaction present = {};
    sigaction(SIGRTMAX, nullptr, &present);
    if (present.sa_handler == SIG_DFL) abort();
  });
  EXPECT_EQ(death.times("fatal signal"), 0u);
}

TEST(CuStackDump, twoThreadsFailingAtOnce_giveOneWholeDump) {
  const Death death(SIGABRT, [] {
    startRegistered("one");
    std::thread second(abort);
    abort();
  });
  EXPECT_EQ(death.times("fatal signal"), 1u);
}

TEST(CuStackDump, childOfAFork_dumpsOnlyItsOwnThreads) {
  Death(SIGKILL, [] {
    startRegistered("parents");
    cu_stackdump_thread_enable_1();
    if (const pid_t child = fork(); child != 0) {
      int status = 0;
      waitpid(child, &status, 0);
      raise(WIFSIGNALED(status) ? SIGKILL : SIGTERM);
    }
    cu_stackdump_thread_enable_1();
    announce("child");
    abort();
  }).expectStacks({"child"});
}

}  // namespace
