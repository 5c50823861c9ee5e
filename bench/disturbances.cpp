// What others feel when something happens to those beside them: a death in a thousand groups, the end of a session
// with a thousand providers, sessions that do not read, people who look. Each figure over a daemon of its own.
//
//   disturbances [--quick] [--benchmark_out=FILE]
#include <signal.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <utility>
#include <vector>

#include "bench/figures.h"
#include "bench/process_roles.h"
#include "bench/waits.h"
#include "examples/processes.h"
#include "gscl/GSUtils.h"

namespace {

using zelt_gscl_V1::GSController;
using zn::Clock;
using zn::Failure;
using zn::Process;

constexpr int64_t kEvery = 2'000'000;  // nanoseconds from one request to the next
constexpr int kAtOnce = 20;            // joins or changes before everybody has to catch up

struct Settings {
  int groups = 1000;
  int readers = 5;
  int crowd = 1000;  // providers of each of two sessions
  int deaf = 100;    // sessions that do not read
  int quiet = 1000;  // requests with nothing going on
  int deaths = 5;    // runs of the first of these
  int members = 10;  // of each of the groups that are looked at
  int looks = 20;
  int changes = 500;  // beside each kind of onlooker, so many times each
  int rounds = 7;

  static Settings quick() { return {20, 2, 10, 3, 100, 1, 3, 2, 20, 1}; }
};

/// A daemon, the processes around it, and a member in a group of its own whose requests are timed.
class Scene {
 public:
  explicit Scene(const std::vector<std::string>& options = {});

  void add(const std::string& role, int count, const std::string& argument);
  Process& at(int i) { return *children_[static_cast<size_t>(i)]; }
  zn::Slot& slot(int i) { return board_[i]; }
  pid_t daemon() const { return daemon_.pid(); }

  /// Tells process `i` to "join" or "state", member by member, `told` processes being told of each by as many
  /// notifications as the function says.
  void tell(int i, const char* what, int members, const std::vector<int>& told);
  /// Milliseconds of each request, until `done`.
  template <class Done>
  std::vector<double> requests(Done done);
  /// The same with changes of the state; the middle one of so many, and the daemon's own time for each.
  std::pair<double, double> changes(int count);
  /// How long the last of these went on.
  double lasted_ms() const { return lasted_ms_; }
  /// How many of the processes have lost their sessions.
  int closed(int first, int count);
  /// gsctl with these arguments, its output in a file, until that has something.
  std::unique_ptr<Process> onlooker(const std::string& arguments);
  /// Processor time of the daemon so far, in milliseconds.
  double daemon_ms() const;
  const zn::Process::Environment environment() const { return daemon_.environment(); }

 private:
  zn::PrivateDaemon daemon_;
  zn::Board board_{daemon_.folder() + "/board"};
  std::vector<std::unique_ptr<Process>> children_;
  std::unique_ptr<GSController> controller_;
  std::unique_ptr<zelt_gscl_V1::GSProvider> unrelated_;
  double lasted_ms_ = 0;
  uint64_t changes_ = 0;
};

Scene::Scene(const std::vector<std::string>& options) : daemon_(options) {
  if (!board_.ok()) throw Failure{"no shared board"};
  ::setenv("GSD_ENDPOINT", daemon_.environment()[0].second.c_str(), 1);
  controller_ = std::make_unique<GSController>();
  if (controller_->initialize() != WYX_OK) throw Failure{"no session"};
  unrelated_ = std::make_unique<zelt_gscl_V1::GSProvider>("unrelated", 1, nullptr);
  if (unrelated_->joinGroup() != WYX_OK) throw Failure{"no join"};
  controller_->dispatch(WYX_NON_BLOCKING);
}

void Scene::add(const std::string& role, int count, const std::string& argument) {
  const int first = static_cast<int>(children_.size());
  for (int i = first; i < first + count; i++) {
    const std::vector<std::string> command{zn::program("disturbances"), "--role=" + role,
                                           daemon_.folder() + "/board", std::to_string(i), argument};
    children_.push_back(std::make_unique<Process>(command, daemon_.environment()));
  }
  for (int i = first; i < first + count; i++) zn::await("a process is ready", [&] { return slot(i).ready != 0; });
}

void Scene::tell(int i, const char* what, int members, const std::vector<int>& told) {
  std::vector<uint64_t> targets;
  for (size_t who = 0; who < told.size(); who++) targets.push_back(slot(static_cast<int>(who)).count);
  for (int member = 0; member < members; member++) {
    at(i).write_line(std::string(what) + " " + std::to_string(member));
    const bool joins = std::string(what) == "join";
    for (size_t who = 0; who < told.size(); who++) {
      // In a crowd, each that has joined already is told of the next one, and that one too.
      const bool grows = joins && told[who] == 0;
      targets[who] += static_cast<uint64_t>(grows ? member + 1 : told[who]);
    }
    if (told[0] == 1 && member % kAtOnce != kAtOnce - 1 && member != members - 1) continue;  // a crowd: each alone
    for (size_t who = 0; who < told.size(); who++) {
      const zn::Slot& slot_of = slot(static_cast<int>(who));
      zn::await("everybody is told", [&] {
        if (slot_of.ready == 0) throw Failure{"a reader was closed while its groups were set up"};
        return slot_of.count >= targets[who];
      });
    }
  }
  if (slot(i).errors != 0) throw Failure{std::string("a request was refused: ") + what};
}

template <class Done>
std::vector<double> Scene::requests(Done done) {
  char text[] = "unrelated";
  const int64_t start = zn::now_ns();
  std::vector<double> samples = zn::steadily(
      kEvery,
      [&] {
        const wyx_rc_t rc = unrelated_->send_message({sizeof text, text}, WYX_1_PHASE, 0);
        controller_->dispatch(WYX_NON_BLOCKING);
        if (rc == WYX_OK) return;
        throw Failure{"an unrelated request was refused: " + std::string(zelt_gscl::gscl_rc_name(rc))};
      },
      done);
  lasted_ms_ = static_cast<double>(zn::now_ns() - start) / 1e6;
  return samples;
}

std::pair<double, double> Scene::changes(int count) {
  const double before = daemon_ms();
  std::vector<double> samples = zn::steadily(
      kEvery,
      [&] {
        std::string state = zn::Payload{1, zn::kPayload, ++changes_}.bytes();
        const wyx_rc_t rc = unrelated_->changeStateValue({zn::kPayload, state.data()}, WYX_1_PHASE, 0);
        controller_->dispatch(WYX_NON_BLOCKING);
        if (rc != WYX_OK) throw Failure{"a change was refused: " + std::string(zelt_gscl::gscl_rc_name(rc))};
      },
      [&](size_t done) { return done >= static_cast<size_t>(count); });
  const double own = (daemon_ms() - before) / static_cast<double>(samples.size());
  return {zn::percentile(samples, 0.5), own};
}

std::unique_ptr<Process> Scene::onlooker(const std::string& arguments) {
  const std::string file = daemon_.folder() + "/seen";
  ::unlink(file.c_str());
  const std::string line = "exec " + zn::program("gsctl") + " " + arguments + " >" + file;
  auto process = std::make_unique<Process>(std::vector<std::string>{"/bin/sh", "-c", line}, environment());
  zn::await("gsctl looks", [&] { return !zn::content_of(file).empty(); });
  return process;
}

double Scene::daemon_ms() const {
  clockid_t clock{};
  timespec time{};
  if (::clock_getcpuclockid(daemon(), &clock) != 0 || ::clock_gettime(clock, &time) != 0)
    throw Failure{"no clock"};
  return static_cast<double>(time.tv_sec) * 1e3 + static_cast<double>(time.tv_nsec) / 1e6;
}

int Scene::closed(int first, int count) {
  int closed = 0;
  for (int i = first; i < first + count; i++) closed += slot(i).ready == 0;
  return closed;
}

std::string failed(int closed, int readers) {
  if (closed == 0) return "";
  return std::to_string(closed) + " of " + std::to_string(readers) + " healthy readers were closed";
}

struct Disturbed {
  double p99 = 0, longest = 0, quiet_p99 = 0, lasted_ms = 0;
  int closed = 0;
};

// Every reader and the one that dies are members of all groups.
Disturbed one_death(const Settings& s) {
  Scene scene;
  scene.add("everywhere", s.readers + 1, std::to_string(s.groups));
  std::vector<int> told;
  for (int i = 0; i <= s.readers; i++) {
    told.push_back(1);
    scene.tell(i, "join", s.groups, told);
  }
  scene.tell(0, "state", s.groups, told);

  std::vector<double> quiet = scene.requests([&](size_t count) { return count >= static_cast<size_t>(s.quiet); });
  scene.at(s.readers).signal(SIGKILL);
  std::vector<double> meanwhile = scene.requests([&](size_t) {
    for (int i = 0; i < s.readers; i++) {
      if (scene.slot(i).ready != 0 && scene.slot(i).failures < static_cast<uint64_t>(s.groups)) return false;
    }
    return true;
  });
  return {zn::percentile(meanwhile, 0.99), meanwhile.back(), zn::percentile(quiet, 0.99), scene.lasted_ms(),
          scene.closed(0, s.readers)};
}

// Of several, the one in the middle: a machine that others share stands still now and then.
void death_in_many_groups(const Settings& s, zn::Figures* figures) {
  std::vector<Disturbed> runs;
  int closed = 0;
  for (int i = 0; i < s.deaths; i++) {
    runs.push_back(one_death(s));
    closed = std::max(closed, runs.back().closed);
  }
  std::sort(runs.begin(), runs.end(), [](const Disturbed& a, const Disturbed& b) { return a.p99 < b.p99; });
  const Disturbed& middle = runs[runs.size() / 2];
  figures->add("one death in " + std::to_string(s.groups) + " groups of 64 KiB, " + std::to_string(s.readers) +
                   " readers: request beside it, p99",
               middle.p99, "ms", 5, failed(closed, s.readers));
  figures->add("  longest", middle.longest, "ms");
  figures->add("  p99 of the other runs, least", runs.front().p99, "ms");
  figures->add("  p99 of the other runs, most", runs.back().p99, "ms");
  figures->add("  with nothing going on, p99", middle.quiet_p99, "ms");
  figures->add("  time that the disturbance lasted", middle.lasted_ms, "ms");
}

void end_of_a_crowd(const Settings& s, zn::Figures* figures) {
  Scene scene;
  scene.add("crowd", 2, std::to_string(s.crowd));
  scene.tell(0, "join", s.crowd, {0});
  scene.tell(1, "join", s.crowd, {s.crowd, 0});

  std::vector<double> quiet = scene.requests([&](size_t count) { return count >= static_cast<size_t>(s.quiet); });
  const auto all = static_cast<uint64_t>(s.crowd) * static_cast<uint64_t>(s.crowd);
  scene.at(1).signal(SIGKILL);
  const std::vector<double> meanwhile =
      scene.requests([&](size_t) { return scene.slot(0).ready == 0 || scene.slot(0).failures >= all; });
  const std::string name = std::to_string(s.crowd) + " providers";
  figures->add("two sessions with " + name + " in one group, one ends: longest wait",
               *std::max_element(meanwhile.begin(), meanwhile.end()), "ms", 50, failed(scene.closed(0, 1), 1));
  figures->add("  with nothing going on, longest", *std::max_element(quiet.begin(), quiet.end()), "ms");
  figures->add("  time that the disturbance lasted", scene.lasted_ms(), "ms");
}

void memory_after_the_deaf(const Settings& s, zn::Figures* figures) {
  Scene scene({"--queue-bound", std::to_string(4 * 1024 * 1024)});
  const double before = zn::resident_kib(scene.daemon()) / 1024;
  scene.add("deaf", s.deaf, "");
  const double meanwhile = zn::resident_kib(scene.daemon()) / 1024;
  for (int i = 0; i < s.deaf; i++) scene.at(i).write_line("on");
  zn::await("all are closed", [&] { return scene.closed(0, s.deaf) == s.deaf; });
  for (int i = 0; i < s.deaf; i++) scene.at(i).wait_end(Clock::now() + zn::kWaitLimit);
  scene.requests([](size_t count) { return count >= 300; });  // memory is given back ten times a second
  const double after = zn::resident_kib(scene.daemon()) / 1024;
  figures->add("memory of the daemon after " + std::to_string(s.deaf) + " sessions that did not read 4 MiB",
               after - before, "MiB over before");
  figures->add("  while they were there", meanwhile - before, "MiB over before");
  figures->add("  before", before, "MiB");
}

// All groups in one list.
void look_at_groups(const Settings& s, zn::Figures* figures) {
  Scene scene;
  scene.add("everywhere", s.members, std::to_string(s.groups));
  std::vector<int> told;
  for (int i = 0; i < s.members; i++) {
    told.push_back(1);
    scene.tell(i, "join", s.groups, told);
  }
  std::vector<double> whole;
  const double before = scene.daemon_ms();
  for (int i = 0; i < s.looks; i++) {
    const int64_t start = zn::now_ns();
    Process gsctl({zn::program("gsctl"), "groups"}, scene.environment());
    while (gsctl.read_some()) zn::wait_readable({gsctl.output()}, Clock::now() + zn::kWaitLimit);
    if (gsctl.wait_end(Clock::now() + zn::kWaitLimit) != 0) throw Failure{"gsctl groups failed"};
    whole.push_back(static_cast<double>(zn::now_ns() - start) / 1e6);
  }
  const double own = (scene.daemon_ms() - before) / s.looks;
  const std::string name = std::to_string(s.groups) + " groups of " + std::to_string(s.members) + " members";
  figures->add("gsctl groups with " + name + ", the whole command, p50", zn::percentile(whole, 0.5), "ms", 50);
  figures->add("  of it the daemon's processor time", own, "ms", 2);
}

double middle(std::vector<double> values) { return zn::percentile(values, 0.5); }

// Changes of a group with nobody, a subscriber, gsctl watch, and a tap of everything beside it, in turns.
void look_at_changes(const Settings& s, zn::Figures* figures) {
  Scene scene;
  std::vector<double> latency, cost, tapped, watched;
  for (int round = 0; round < s.rounds; round++) {
    const auto [alone, own] = scene.changes(s.changes);
    const auto with = [&](const char* arguments) {
      const auto onlooker = scene.onlooker(arguments);
      return scene.changes(s.changes);
    };
    tapped.push_back(with("record --all -o /dev/stdout").first / alone);
    const double watch = with("watch unrelated").second;
    scene.add("subscriber", 1, "unrelated");
    watched.push_back(watch / scene.changes(s.changes).second);
    scene.at(round).signal(SIGKILL);
    scene.at(round).wait_end(Clock::now() + zn::kWaitLimit);
    latency.push_back(alone);
    cost.push_back(own * 1000);
  }
  figures->add("change of a group with a tap of everything, p50", middle(tapped), "of that without", 1.05);
  figures->add("  without, p50", middle(latency), "ms");
  figures->add("the daemon's time for a change with gsctl watch", middle(watched), "of that with a subscriber",
               1.05);
  figures->add("  with neither", middle(cost), "us");
}

}  // namespace

int main(int argc, char** argv) {
  const std::string role = zn::option(argc, argv, "role");
  if (!role.empty()) return zn::run_role(role, argc - 2, argv + 2);

  zn::catch_interrupts();
  zn::print_host();
  const Settings settings = zn::flag(argc, argv, "quick") ? Settings::quick() : Settings{};
  try {
    zn::Figures figures;
    death_in_many_groups(settings, &figures);
    end_of_a_crowd(settings, &figures);
    memory_after_the_deaf(settings, &figures);
    look_at_groups(settings, &figures);
    look_at_changes(settings, &figures);
    figures.print();
    return figures.write_json(zn::option(argc, argv, "benchmark_out")) ? 0 : 1;
  } catch (const Failure& failure) {
    std::fprintf(stderr, "disturbances: %s\n", failure.text.c_str());
    return 1;
  }
}
