// The first act: a private daemon, three members and a watcher, each a process of its own; one timeline of what
// every one of them saw and when.
#include <signal.h>
#include <sys/wait.h>

#include <cstdio>
#include <map>
#include <string>
#include <vector>

#include "examples/demo.h"
#include "examples/processes.h"

namespace {

using zn::Clock;
using zn::Failure;
using zn::Process;

constexpr auto kStepLimit = std::chrono::seconds(20);  // a bound on a hang; a step takes milliseconds
constexpr const char* kNames[] = {"member 1", "member 2", "member 3", "watcher"};
constexpr size_t kColumns = 4;
constexpr size_t kWatcher = 3;

/// One line that a process printed.
struct Seen {
  double time = 0;  // seconds, of the host's monotonic clock
  unsigned long long event = 0;
  std::string text;
};

/// One event as it must be seen: by which members, and in which words by the watcher (empty: it is not told).
struct Expected {
  std::string text;
  std::vector<size_t> members;
  std::string watcher;
};

Seen parse(const std::string& line) {
  Seen seen;
  int end = 0;
  if (std::sscanf(line.c_str(), "%lf %llu %n", &seen.time, &seen.event, &end) != 2) {
    throw Failure{"not a line of the timeline: " + line};
  }
  seen.text = line.substr(static_cast<size_t>(end));
  return seen;
}

double now() { return std::chrono::duration<double>(Clock::now().time_since_epoch()).count(); }

/// The printed table. Colours only on a terminal.
class Timeline {
 public:
  void head() {
    std::printf("%s%5s  %-44s", zn::colour("1"), "event", "what happens");
    for (const char* name : kNames) std::printf("%10s", name);
    std::printf("%s\n", zn::colour_off());
  }
  void action(const std::string& text) {
    std::printf("%s%7s%s%s\n", zn::colour("2"), "", text.c_str(), zn::colour_off());
  }
  void row(unsigned long long event, const std::string& text, const std::map<size_t, double>& times) {
    std::printf("%5llu  %s%-44s%s", event, zn::colour(kind(text)), text.c_str(), zn::colour_off());
    int blank = 0;  // kept back, so that no line ends in blanks
    for (size_t c = 0; c < kColumns; c++) {
      blank += 10;
      auto time = times.find(c);
      if (time == times.end()) continue;
      std::printf("%*.1f", blank, (time->second - start_) * 1e3);
      blank = 0;
    }
    std::printf("\n");
    std::fflush(stdout);
  }
  double seconds() const { return now() - start_; }

 private:
  static const char* kind(const std::string& text) {
    if (text.find("failed") != std::string::npos || text.find("rejected") == 0) return "31";
    return text.find("approved") == 0 ? "32" : "0";
  }

  const double start_ = now();
};

class Group {
 public:
  void run();

 private:
  void start(size_t column, const std::vector<std::string>& command);
  void command(size_t column, const std::string& line);
  /// Waits until everybody has seen the events, checks them and prints them.
  void expect(const std::vector<Expected>& events);
  void check_row(const Expected& event);
  Seen next(size_t column);
  /// The process must have ended in this way, having said nothing more.
  void expect_end(size_t column, bool killed);

  Timeline timeline_;
  zn::PrivateDaemon daemon_;
  std::unique_ptr<Process> processes_[kColumns];
  unsigned long long last_event_ = 0;
};

void Group::start(size_t column, const std::vector<std::string>& command) {
  timeline_.action(std::string("start ") + kNames[column]);
  processes_[column] = std::make_unique<Process>(command, daemon_.environment());
}

void Group::command(size_t column, const std::string& line) {
  timeline_.action(std::string("tell ") + kNames[column] + ": " + line);
  processes_[column]->write_line(line);
}

Seen Group::next(size_t column) {
  try {
    return parse(processes_[column]->wait_line(Clock::now() + kStepLimit));
  } catch (const Failure& failure) {
    throw Failure{std::string(kNames[column]) + ": " + failure.text};
  }
}

void Group::check_row(const Expected& event) {
  std::map<size_t, double> times;
  unsigned long long number = 0;
  auto look = [&](size_t column, const std::string& text) {
    const Seen seen = next(column);
    if (number == 0) number = seen.event;
    if (seen.text != text || seen.event != number) {
      throw Failure{std::string(kNames[column]) + " saw event " + std::to_string(seen.event) + " \"" + seen.text +
                    "\" where event " + std::to_string(number) + " \"" + text + "\" was expected"};
    }
    times[column] = seen.time;
  };
  for (size_t member : event.members) look(member - 1, event.text);
  if (!event.watcher.empty()) look(kWatcher, event.watcher);
  timeline_.row(number, event.members.empty() ? event.watcher : event.text, times);
  if (!event.members.empty() && number != last_event_ + 1) {
    throw Failure{"event " + std::to_string(number) + " does not follow event " + std::to_string(last_event_)};
  }
  last_event_ = number;
}

void Group::expect(const std::vector<Expected>& events) {
  for (const Expected& event : events) check_row(event);
}

void Group::expect_end(size_t column, bool killed) {
  const int status = processes_[column]->wait_end(Clock::now() + kStepLimit);
  const bool as_it_must = killed ? WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL : status == 0;
  if (!as_it_must) throw Failure{std::string(kNames[column]) + " ended with status " + std::to_string(status)};
  while (processes_[column]->read_some()) {
  }
  if (auto line = processes_[column]->next_line()) {
    throw Failure{std::string(kNames[column]) + " saw more than it should: " + *line};
  }
}

void Group::run() {
  const std::string member = zn::program("member");
  timeline_.head();

  start(0, {member, "crew", "1"});
  expect({{"1 joins; members: 1", {1}, ""}});
  start(kWatcher, {zn::program("watcher"), "crew"});
  expect({{"", {}, "members: 1; state: \"\""}});
  start(1, {member, "crew", "2", "panic"});
  expect({{"2 joins; members: 1 2", {1, 2}, "members: 1 2; state: \"\""}});
  start(2, {member, "crew", "3"});
  expect({{"3 joins; members: 1 2 3", {1, 2, 3}, "members: 1 2 3; state: \"\""}});

  command(0, "state ready");
  expect({{"1 proposes state \"ready\", phase 1", {1, 2, 3}, ""},
          {"1 proposes state \"ready\", phase 2", {1, 2, 3}, ""},
          {"approved; the state is \"ready\"", {1, 2, 3}, "members: 1 2 3; state: \"ready\""}});
  command(2, "state panic");
  expect({{"3 proposes state \"panic\", phase 1", {1, 2, 3}, ""},
          {"rejected; the state stays \"ready\"", {1, 2, 3}, ""}});
  command(1, "say all hands on deck");
  expect({{"2 says \"all hands on deck\"", {1, 2, 3}, ""}});

  timeline_.action("kill -9 member 3");
  processes_[2]->signal(SIGKILL);
  expect({{"3 has failed; members: 1 2", {1, 2}, "members: 1 2; state: \"ready\""}});
  expect_end(2, true);
  command(1, "leave");
  expect({{"2 leaves; members: 1", {1, 2}, "members: 1; state: \"ready\""}});
  expect_end(1, false);
  command(0, "leave");
  expect({{"1 leaves; members: none", {1}, "members: none; state: \"ready\""}, {"", {}, "the group is gone"}});
  expect_end(0, false);
  expect_end(kWatcher, false);

  if (!daemon_.stop(Clock::now() + kStepLimit))
    throw Failure{"the daemon did not stop in order: " + daemon_.log()};
  std::printf("\nEverybody saw the same events in the same order. Times in milliseconds; %.0f in all.\n",
              timeline_.seconds() * 1e3);
}

}  // namespace

void zn::demo_group() {
  Group group;
  group.run();
}
