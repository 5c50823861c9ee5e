// What acts with a group share: three members and a watcher, each a process of its own, and one timeline of what
// every one of them saw and when.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "examples/processes.h"

namespace zn {

/// One event as it must be seen: by which members, and in which words by the watcher (empty: it is not told).
struct Expected {
  std::string text;
  std::vector<size_t> members;
  std::string watcher;
};

class Stage {
 public:
  enum class Numbers { kWithoutGaps, kRising };  // of the group's events
  static constexpr size_t kColumns = 4;
  static constexpr size_t kWatcher = 3;

  /// Prints the head of the timeline.
  explicit Stage(Numbers numbers);

  /// A line that says what is done.
  void action(const std::string& text) const;
  /// `where` is said behind the name.
  void start(size_t column, const std::vector<std::string>& command, const Process::Environment& environment,
             const std::string& where = "");
  void command(size_t column, const std::string& line);
  void kill(size_t column);
  /// Waits until everybody has seen the events, checks them and prints them.
  void expect(const std::vector<Expected>& events);
  /// The process must have ended in this way, having said nothing more.
  void expect_end(size_t column, bool killed);
  double milliseconds() const;

 private:
  struct Seen;

  void check_row(const Expected& event);
  Seen next(size_t column);
  void check_number(unsigned long long number);
  void print_row(unsigned long long event, const std::string& text, const std::map<size_t, double>& times) const;

  const Numbers numbers_;
  const double start_;
  std::unique_ptr<Process> processes_[kColumns];
  unsigned long long last_event_ = 0;
};

}  // namespace zn
