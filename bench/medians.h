// What the Google Benchmark programs here share: the median of each benchmark, and a run whose two sides of a
// ratio are disturbed alike.
#pragma once

#include <benchmark/benchmark.h>

#include <map>
#include <string>
#include <vector>

namespace zn {

/// Shows the table and keeps the medians in nanoseconds, by "function" + "arguments".
class Medians : public benchmark::ConsoleReporter {
 public:
  /// `time` picks what is kept of a run: its CPU time or its real time.
  explicit Medians(double (Run::*time)() const) : ConsoleReporter(OO_Tabular), time_(time) {}

  void ReportRuns(const std::vector<Run>& runs) override {
    ConsoleReporter::ReportRuns(runs);
    for (const Run& run : runs) {
      if (run.aggregate_name != "median") continue;
      medians_[run.run_name.function_name + run.run_name.args] = (run.*time_)();
    }
  }
  double of(const std::string& name) const { return medians_.at(name); }
  std::size_t count() const { return medians_.size(); }

 private:
  double (Run::*time_)() const;
  std::map<std::string, double> medians_;
};

/// Runs every benchmark of the program, in interleaved repetitions: what disturbs the machine disturbs both sides
/// of a ratio. `settings`: further options, such as the number of repetitions; the command line may override them.
inline void run_interleaved(int argc, char** argv, std::vector<std::string> settings, Medians* medians) {
  settings.push_back("--benchmark_enable_random_interleaving=true");
  settings.push_back("--benchmark_display_aggregates_only=true");
  std::vector<char*> arguments{argv[0]};
  for (std::string& setting : settings) arguments.push_back(setting.data());
  arguments.insert(arguments.end(), argv + 1, argv + argc);
  int count = static_cast<int>(arguments.size());
  arguments.push_back(nullptr);
  benchmark::Initialize(&count, arguments.data());
  benchmark::RunSpecifiedBenchmarks(medians);
}

}  // namespace zn
