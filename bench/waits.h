// How the driver of a benchmark passes the time: waiting for what others report, and asking at a steady pace.
#pragma once

#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

#include "bench/board.h"
#include "examples/processes.h"
#include "gscl/gscl.h"

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

/// Dispatches, when there is something to, until the condition holds.
template <class Condition>
void dispatch_until(zelt_gscl_V1::GSController& controller, Condition condition) {
  const auto deadline = Clock::now() + kWaitLimit;
  while (!condition()) {
    wait_readable({controller.getGSDescriptor()}, deadline);
    if (controller.dispatch(WYX_NON_BLOCKING) != WYX_OK) throw Failure{"dispatch failed"};
  }
}

/// Until so many slots have counted so far; the time of the latest.
inline int64_t await_counts(Board& board, int first, int count, uint64_t target) {
  int64_t latest = 0;
  for (int i = first; i < first + count; i++) {
    await("everybody is told", [&] { return board[i].count.load(std::memory_order_acquire) >= target; });
    latest = std::max(latest, board[i].time.load());
  }
  return latest;
}

/// What was seen was right, and the same everywhere.
inline void check(Board& board, int first, int count) {
  for (int i = first; i < first + count; i++) {
    if (board[i].errors != 0) throw Failure{"slot " + std::to_string(i) + ": wrong sequence or contents"};
    if (board[i].digest != board[first].digest) throw Failure{"members do not agree on what they saw"};
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
