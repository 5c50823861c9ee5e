// How the driver of a benchmark passes the time: waiting for what others report, and asking at a steady pace.
#pragma once

#include <time.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <vector>

#include "bench/board.h"
#include "examples/processes.h"

namespace zn {

constexpr auto kWaitLimit = std::chrono::seconds(60);  // a bound on a hang, not on what is measured

/// Sleeps, so as to disturb nobody, until the condition holds. Throws Failure when it never does.
template <class Condition>
void await(const std::string& what, Condition condition) {
  const auto deadline = Clock::now() + kWaitLimit;
  while (!condition()) {
    if (Clock::now() > deadline) throw Failure{"waited in vain: " + what};
    ::usleep(200);
  }
}

/// Asks every so many nanoseconds until `done(requests so far)` and gives the milliseconds from when each request
/// was due to its answer: one that hangs makes the next ones late, and so counts as often as it would have hurt.
template <class Request, class Done>
std::vector<double> steadily(int64_t every, Request request, Done done) {
  std::vector<double> samples;
  const auto deadline = Clock::now() + kWaitLimit;
  const int64_t start = now_ns();
  for (int64_t due = start + every; samples.empty() || !done(samples.size()) || due < now_ns(); due += every) {
    if (Clock::now() > deadline) throw Failure{"waited in vain: the disturbance is over"};
    const timespec when{due / 1'000'000'000, due % 1'000'000'000};
    ::clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &when, nullptr);
    request();
    samples.push_back(static_cast<double>(now_ns() - due) / 1e6);
  }
  return samples;
}

}  // namespace zn
