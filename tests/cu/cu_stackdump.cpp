// What a process that dies of a fatal signal writes about its registered threads, and how it then ends.
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <future>
#include <regex>
#include <string>
#include <thread>

#include "zn_cu.h"

namespace {

using testing::ExitedWithCode;
using testing::HasSubstr;
using testing::KilledBySignal;
using testing::Not;
using testing::Truly;

// Runs only in the process that is to die: the sanitizers' own handlers go, no core file is left.
void prepareToDie() {
  for (const int sig : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT}) signal(sig, SIG_DFL);
  const rlimit none = {0, 0};
  setrlimit(RLIMIT_CORE, &none);
}

// Starts a thread that registers, announces its id as "NAME=id" and stays until the process ends.
void startRegistered(const char* name, bool blockSignals = false) {
  std::promise<void> registered;
  std::thread([&registered, name, blockSignals] {
    if (blockSignals) {
      sigset_t all;
      sigfillset(&all);
      pthread_sigmask(SIG_BLOCK, &all, nullptr);
    }
    if (cu_stackdump_thread_enable_1() != 0) _exit(99);
    fprintf(stderr, "%s=%ld\n", name, syscall(SYS_gettid));
    registered.set_value();
    for (;;) poll(nullptr, 0, -1);
  }).detach();
  registered.get_future().wait();
}

std::string announcedId(const std::string& text, const std::string& name) {
  std::smatch match;
  return std::regex_search(text, match, std::regex(name + "=([0-9]+)\n")) ? match[1].str() : "missing";
}

size_t countOf(const std::string& text, const std::string& part) {
  size_t n = 0;
  for (size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) ++n;
  return n;
}

// Exactly one stack of the thread with at least `frames` addresses under its heading.
bool hasStack(const std::string& text, const std::string& name, int frames = 2) {
  const std::string heading = "stack of thread " + announcedId(text, name) + ":\n";
  if (countOf(text, heading) != 1) return false;
  const std::string rest = text.substr(text.find(heading) + heading.size());
  return std::regex_search(rest, std::regex("^(.*\\[0x[0-9a-f]+\\]\n){" + std::to_string(frames) + "}"));
}

class CuStackDump : public testing::Test {
 protected:
  CuStackDump() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(CuStackDump, fatalSignal_dumpsEveryRegisteredThreadAndEndsByThatSignal) {
  for (const int sig : {SIGABRT, SIGSEGV, SIGFPE, SIGBUS, SIGILL}) {
    EXPECT_EXIT(
        {
          prepareToDie();
          startRegistered("one");
          startRegistered("two");
          raise(sig);
        },
        KilledBySignal(sig), Truly([sig](const std::string& text) {
          return countOf(text, "fatal signal " + std::to_string(sig)) == 1 && hasStack(text, "one") &&
                 hasStack(text, "two");
        }));
  }
}

TEST_F(CuStackDump, faultInARegisteredThread_isDumpedOnce) {
  EXPECT_EXIT(
      {
        prepareToDie();
        startRegistered("other");
        cu_stackdump_thread_enable_1();
        cu_stackdump_thread_enable_1();
        fprintf(stderr, "self=%ld\n", syscall(SYS_gettid));
        abort();
      },
      KilledBySignal(SIGABRT),
      Truly([](const std::string& text) { return hasStack(text, "self") && hasStack(text, "other"); }));
}

// Without an alternate stack the handler could not run at all.
[[gnu::noinline]] int recurse(volatile char* above, long times) {
  volatile char frame[4096];
  frame[0] = above[0];
  return times == 0 ? 0 : recurse(frame, times - 1) + frame[0];
}

TEST_F(CuStackDump, stackOverflowInARegisteredThread_isDumped) {
  EXPECT_EXIT(
      {
        prepareToDie();
        std::thread([] {
          cu_stackdump_thread_enable_1();
          fprintf(stderr, "deep=%ld\n", syscall(SYS_gettid));
          char start = 0;
          exit(recurse(&start, LONG_MAX));
        }).join();
      },
      KilledBySignal(SIGSEGV), Truly([](const std::string& text) { return hasStack(text, "deep", 10); }));
}

TEST_F(CuStackDump, threadThatBlocksAllSignals_isNamedAndDoesNotHoldUpTheEnd) {
  EXPECT_EXIT(
      {
        prepareToDie();
        startRegistered("deaf", true);
        startRegistered("well");
        abort();
      },
      KilledBySignal(SIGABRT), Truly([](const std::string& text) {
        return countOf(text, "stack of thread " + announcedId(text, "deaf") + ": no answer\n") == 1 &&
               hasStack(text, "well");
      }));
}

TEST_F(CuStackDump, threadsThatLeftOrEnded_areNotDumped) {
  EXPECT_EXIT(
      {
        prepareToDie();
        startRegistered("stays");
        std::thread([] { cu_stackdump_thread_enable_1(); }).join();
        cu_stackdump_thread_enable_1();
        cu_stackdump_thread_disable_1(pthread_self());
        startRegistered("taken");
        std::thread([] { abort(); }).join();
      },
      KilledBySignal(SIGABRT), Truly([](const std::string& text) {
        return countOf(text, "stack of thread ") == 3 && hasStack(text, "stays") && hasStack(text, "taken");
      }));
}

TEST_F(CuStackDump, handlerOfTheApplication_keepsItsSignal) {
  EXPECT_EXIT(
      {
        prepareToDie();
        signal(SIGABRT, [](int) { _exit(7); });
        startRegistered("one");
        struct sigaction present = {};
        sigaction(SIGRTMAX, nullptr, &present);
        if (present.sa_handler != SIG_DFL) _exit(8);
        abort();
      },
      ExitedWithCode(7), Not(HasSubstr("fatal signal")));
}

TEST_F(CuStackDump, twoThreadsFailingAtOnce_giveOneWholeDump) {
  EXPECT_EXIT(
      {
        prepareToDie();
        startRegistered("one");
        std::thread second(abort);
        abort();
      },
      KilledBySignal(SIGABRT),
      Truly([](const std::string& text) { return countOf(text, "fatal signal") == 1 && hasStack(text, "one"); }));
}

TEST_F(CuStackDump, childOfAFork_dumpsOnlyItsOwnThreads) {
  EXPECT_EXIT(
      {
        prepareToDie();
        startRegistered("parents");
        cu_stackdump_thread_enable_1();
        if (const pid_t child = fork(); child != 0) {
          int status = 0;
          waitpid(child, &status, 0);
          raise(WIFSIGNALED(status) ? SIGKILL : SIGTERM);
        }
        cu_stackdump_thread_enable_1();
        fprintf(stderr, "child=%ld\n", syscall(SYS_gettid));
        abort();
      },
      KilledBySignal(SIGKILL), Truly([](const std::string& text) {
        return hasStack(text, "child") && countOf(text, "stack of thread") == 1;
      }));
}

}  // namespace
