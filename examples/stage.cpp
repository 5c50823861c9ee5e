#include "examples/stage.h"

#include <signal.h>
#include <sys/wait.h>

#include <algorithm>
#include <cstdio>

#include "examples/demo.h"
#include "examples/say.h"

namespace zn {
namespace {

constexpr const char* kNames[Stage::kColumns] = {"member 1", "member 2", "member 3", "watcher"};
constexpr int kTextWidth = 50;
constexpr int kTimeWidth = 10;

double now() { return std::chrono::duration<double>(Clock::now().time_since_epoch()).count(); }

const char* kind_of(const std::string& text) {
  if (text.find("failed") != std::string::npos || text.find("rejected") == 0) return "31";
  return text.find("approved") == 0 ? "32" : "0";
}

}  // namespace

/// One line that a process printed.
struct Stage::Seen {
  double time = 0;  // seconds, of the host's monotonic clock
  unsigned long long event = 0;
  std::string text;

  explicit Seen(const std::string& line) {
    unsigned long long seconds = 0, micros = 0;
    int end = 0;
    const bool numbered = std::sscanf(line.c_str(), "%lf %llu.%6llu %n", &time, &seconds, &micros, &end) == 3;
    if (!numbered && (std::sscanf(line.c_str(), "%lf - %n", &time, &end) != 1 || end == 0)) {
      throw Failure{"not a line of the timeline: " + line};
    }
    event = seconds * 1000000 + micros;
    text = line.substr(static_cast<size_t>(end));
  }
};

Stage::Stage(Numbers numbers) : numbers_(numbers), start_(now()) {
  std::printf("%s%18s  %-*s", colour("1"), "event", kTextWidth, "what happens");
  for (const char* name : kNames) std::printf("%*s", kTimeWidth, name);
  std::printf("%s\n", colour_off());
}

void Stage::action(const std::string& text) const {
  std::printf("%s%20s%s%s\n", colour("2"), "", text.c_str(), colour_off());
  std::fflush(stdout);
}

void Stage::start(size_t column, const std::vector<std::string>& command, const Process::Environment& environment,
                  const std::string& where) {
  action(std::string("start ") + kNames[column] + where);
  processes_[column] = std::make_unique<Process>(command, environment);
}

void Stage::command(size_t column, const std::string& line) {
  action(std::string("tell ") + kNames[column] + ": " + line);
  processes_[column]->write_line(line);
}

void Stage::kill(size_t column) {
  action(std::string("kill -9 ") + kNames[column]);
  processes_[column]->signal(SIGKILL);
}

Stage::Seen Stage::next(size_t column) {
  try {
    return Seen(processes_[column]->wait_line(Clock::now() + kStepLimit));
  } catch (const Failure& failure) {
    throw Failure{std::string(kNames[column]) + ": " + failure.text};
  }
}

void Stage::check_number(unsigned long long number) {
  if (number == 0) return;  // not of the group's, but about this host
  const bool follows =
      numbers_ == Numbers::kRising || last_event_ == 0 ? number >= last_event_ : number - last_event_ <= 1;
  if (!follows) {
    throw Failure{"event " + event_text(number) + " does not follow event " + event_text(last_event_)};
  }
  last_event_ = number;
}

void Stage::check_row(const Expected& event) {
  std::map<size_t, double> times;
  unsigned long long number = 0;
  auto look = [&](size_t column, const std::string& text) {
    const Seen seen = next(column);
    if (times.empty()) number = seen.event;
    if (seen.text != text || seen.event != number) {
      throw Failure{std::string(kNames[column]) + " saw event " + event_text(seen.event) + " \"" + seen.text +
                    "\" where event " + event_text(number) + " \"" + text + "\" was expected"};
    }
    times[column] = seen.time;
  };
  for (size_t member : event.members) look(member - 1, event.text);
  if (!event.watcher.empty()) look(kWatcher, event.watcher);
  print_row(number, event.members.empty() ? event.watcher : event.text, times);
  if (event.members.empty())
    last_event_ = std::max(last_event_, number);
  else
    check_number(number);
}

void Stage::print_row(unsigned long long event, const std::string& text,
                      const std::map<size_t, double>& times) const {
  const std::string number = event_text(event);
  std::printf("%18s  %s%-*s%s", number.c_str(), colour(kind_of(text)), kTextWidth, text.c_str(), colour_off());
  int blank = 0;  // kept back, so that no line ends in blanks
  for (size_t c = 0; c < kColumns; c++) {
    blank += kTimeWidth;
    auto time = times.find(c);
    if (time == times.end()) continue;
    std::printf("%*.1f", blank, (time->second - start_) * 1e3);
    blank = 0;
  }
  std::printf("\n");
  std::fflush(stdout);
}

void Stage::expect(const std::vector<Expected>& events) {
  for (const Expected& event : events) check_row(event);
}

void Stage::expect_end(size_t column, bool killed) {
  const int status = processes_[column]->wait_end(Clock::now() + kStepLimit);
  const bool as_it_must = killed ? WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL : status == 0;
  if (!as_it_must) throw Failure{std::string(kNames[column]) + " ended with status " + std::to_string(status)};
  while (processes_[column]->read_some()) {
  }
  if (auto line = processes_[column]->next_line()) {
    throw Failure{std::string(kNames[column]) + " saw more than it should: " + *line};
  }
}

double Stage::milliseconds() const { return (now() - start_) * 1e3; }

}  // namespace zn
