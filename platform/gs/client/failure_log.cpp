#include "client/failure_log.h"

#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>

#include "client/environment.h"
#include "client/fork.h"

namespace gs::client {
namespace {

constinit char last_id[kFailureIdSize] GS_GUARDED_BY(process_mutex) = "";
constinit unsigned failures GS_GUARDED_BY(process_mutex) = 0;
constinit unsigned generation_of_last GS_GUARDED_BY(process_mutex) = 0;

/// In UTC, without the C library's conversion, whose lock another thread may hold at a fork.
std::string time_now() {
  const auto now = std::chrono::floor<std::chrono::seconds>(std::chrono::system_clock::now());
  const auto day = std::chrono::floor<std::chrono::days>(now);
  const std::chrono::year_month_day date(day);
  const std::chrono::hh_mm_ss time(now - day);
  char text[32];
  std::snprintf(text, sizeof(text), "%04d%02u%02uT%02d%02d%02dZ", static_cast<int>(date.year()),
                static_cast<unsigned>(date.month()), static_cast<unsigned>(date.day()),
                static_cast<int>(time.hours().count()), static_cast<int>(time.minutes().count()),
                static_cast<int>(time.seconds().count()));
  return text;
}

/// In one piece. What cannot be written is dropped, and a broken pipe raises no signal.
void say(const std::string& line) {
  sigset_t pipe, before, pending;
  sigemptyset(&pipe);
  sigaddset(&pipe, SIGPIPE);
  sigpending(&pending);
  pthread_sigmask(SIG_BLOCK, &pipe, &before);
  const bool written = write(STDERR_FILENO, line.data(), line.size()) >= 0;
  if (!written && sigismember(&pending, SIGPIPE) == 0) {
    const timespec at_once{};
    sigtimedwait(&pipe, nullptr, &at_once);
  }
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
}

}  // namespace

void record_failure(const std::string& what, int code, const std::string& text) {
  const std::string when = time_now();
  std::string id;
  {
    MutexLock lock(process_mutex);
    if (generation_of_last != fork_generation()) failures = 0;
    generation_of_last = fork_generation();
    std::snprintf(last_id, sizeof(last_id), "%.20s-%d-%d-%u-%s", what.c_str(), code, static_cast<int>(getpid()),
                  ++failures, when.c_str());
    id = last_id;
  }
  if (debug_wanted()) say("wyx_r: " + text + " (" + id + ")\n");
}

std::string last_failure_id() {
  MutexLock lock(process_mutex);
  return generation_of_last == fork_generation() ? last_id : "";
}

}  // namespace gs::client
