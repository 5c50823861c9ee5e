// Figures of a benchmark run, each beside its bound: a table to read and JSON for machines.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

namespace zn {

/// The machine and the build that a run was made with, as lines to print first.
void print_host();

/// One measured figure. A ratio says what it is measured in: "mutex pairs", "ping-pongs".
struct Figure {
  std::string name;
  double measured = 0;
  std::string unit;
  std::optional<double> at_most;  // none: told, not judged
  std::string failed = "";        // why the figure counts as missed whatever was measured; empty: it does not
};

class Figures {
 public:
  void add(std::string name, double measured, std::string unit, std::optional<double> at_most = std::nullopt,
           std::string failed = "") {
    figures_.push_back({std::move(name), measured, std::move(unit), at_most, std::move(failed)});
  }
  /// "figure, measured, bound, met or missed".
  void print() const;
  /// Nothing is written for an empty path; false when the file cannot be written.
  bool write_json(const std::string& path) const;

 private:
  std::vector<Figure> figures_;
};

/// The value of --NAME=VALUE, or empty.
std::string option(int argc, char** argv, const std::string& name);
bool flag(int argc, char** argv, const std::string& name);

/// The sample below which `share` (0 to 1) of all lie; the samples are sorted.
double percentile(std::vector<double>& samples, double share);

/// Memory of a process that is in the machine's; 0 when it is gone.
double resident_kib(pid_t process);

}  // namespace zn
