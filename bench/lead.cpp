// How long nobody leads: from the SIGKILL of the leading gsctl to the first line of the next one's CMD, set
// against what it takes at the least, the start of such a program.
#include <limits.h>
#include <signal.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <list>

#include "bench/figures.h"
#include "examples/processes.h"

namespace {

using std::chrono::duration;
using std::chrono::seconds;
using zn::Clock;
using zn::Failure;
using zn::Process;

constexpr seconds kLimit{30};
constexpr double kBound = 5;  // milliseconds
constexpr int kCandidates = 3;

double milliseconds_since(Clock::time_point start) {
  return duration<double, std::milli>(Clock::now() - start).count();
}

/// CMD: says that it runs, and does so until it is killed.
int run_command() {
  puts(getenv("GS_FENCE") == nullptr ? "0" : getenv("GS_FENCE"));
  fflush(stdout);
  for (;;) pause();
}

class Benchmark {
 public:
  explicit Benchmark(std::string self) : self_(std::move(self)) {}

  void measure(int deaths, zn::Figures& figures) {
    std::vector<double> bare, samples;
    for (int i = 0; i < deaths; ++i) bare.push_back(bare_start());
    while (candidates_.size() < kCandidates) stand();
    fence_of(candidates_.front());
    for (int i = 0; i < deaths; ++i) samples.push_back(death());
    figures.add("SIGKILL of the leader to the next one's CMD, p50", zn::percentile(samples, 0.5), "ms", kBound);
    figures.add("  p99", zn::percentile(samples, 0.99), "ms");
    figures.add("start of such a program alone, p50", zn::percentile(bare, 0.5), "ms");
  }

 private:
  std::vector<std::string> command() const { return {self_, "--role=command"}; }

  double bare_start() {
    const auto start = Clock::now();
    Process program(command(), {});
    program.wait_line(start + kLimit);
    return milliseconds_since(start);
  }

  /// The youngest, once it is a member.
  void stand() {
    std::vector<std::string> words = {zn::program("gsctl"), "lead", "bench", "--"};
    for (const std::string& word : command()) words.push_back(word);
    candidates_.emplace_back(words, daemon_.environment(), daemon_.folder() + "/log");
    Process wait({zn::program("gsctl"), "wait", "bench", "--members", std::to_string(candidates_.size())},
                 daemon_.environment());
    wait.wait_end(Clock::now() + kLimit);
  }

  unsigned long fence_of(Process& leader) {
    const unsigned long fence = std::stoul(leader.wait_line(Clock::now() + kLimit));
    if (fence <= fence_) throw Failure{"a leader's fence is not above that of the one before"};
    return fence_ = fence;
  }

  double death() {
    Process& leader = candidates_.front();
    Process& next = *std::next(candidates_.begin());
    const auto start = Clock::now();
    leader.signal(SIGKILL);
    fence_of(next);
    const double took = milliseconds_since(start);
    candidates_.pop_front();
    stand();
    return took;
  }

  const std::string self_;
  zn::PrivateDaemon daemon_;
  std::list<Process> candidates_;  // oldest first
  unsigned long fence_ = 0;
};

}  // namespace

int main(int argc, char** argv) {
  if (zn::option(argc, argv, "role") == "command") return run_command();
  try {
    zn::catch_interrupts();
    zn::print_host();
    zn::Figures figures;
    std::array<char, PATH_MAX> self{};
    if (readlink("/proc/self/exe", self.data(), self.size() - 1) < 0)
      throw Failure{"cannot tell this program's path"};
    Benchmark(self.data()).measure(zn::flag(argc, argv, "quick") ? 5 : 100, figures);
    figures.print();
    return figures.write_json(zn::option(argc, argv, "benchmark_out")) ? 0 : 1;
  } catch (const Failure& failure) {
    fprintf(stderr, "lead: %s\n", failure.text.c_str());
    return 1;
  }
}
