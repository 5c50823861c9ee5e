// The third act: three hosts, which are namespaces of this machine, with a Corosync, a gsd and a member on each. A
// cable is pulled and put back, a host dies; what goes on are the group, its state and its order of events.
#include <sys/wait.h>

#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "examples/demo.h"
#include "examples/processes.h"
#include "examples/stage.h"

namespace {

using zn::Clock;
using zn::Failure;
using zn::Process;
using zn::Stage;
using Texts = std::vector<std::string>;

constexpr int kHosts = 3;

class Cluster {
 public:
  explicit Cluster(const std::string& folder) : folder_(folder) {}
  void run();

 private:
  /// The command as it is run on a host.
  static Texts on(int host, Texts command);
  /// Does it to the hosts, with a line that says so.
  void act(const std::string& text, const Texts& words);
  std::string log_of(int host) const { return zn::content_of(folder_ + "/gsd." + std::to_string(host) + ".log"); }
  void start_daemon(int host);
  /// Until the daemon says in its log, behind the first `from` bytes, that it serves.
  void wait_until_served(int host, size_t from) const;
  void start(size_t column, int host, const Texts& command);
  void meet();
  void pull_a_cable();
  void put_it_back();
  void lose_the_leader();
  void stop();

  const std::string folder_;
  Stage stage_{Stage::Numbers::kRising};
  std::unique_ptr<Process> daemons_[kHosts + 1];  // by host
};

Texts Cluster::on(int host, Texts command) {
  command.insert(command.begin(), {ZN_CLUSTER_SCRIPT, "on", std::to_string(host)});
  return command;
}

void Cluster::act(const std::string& text, const Texts& words) {
  stage_.action(text);
  Texts command{ZN_CLUSTER_SCRIPT};
  command.insert(command.end(), words.begin(), words.end());
  if (Process(command, {}).wait_end(Clock::now() + zn::kStepLimit) != 0) throw Failure{"cannot " + text};
}

void Cluster::start_daemon(int host) {
  const std::string log = folder_ + "/gsd." + std::to_string(host) + ".log";
  daemons_[host] = std::make_unique<Process>(
      on(host, {zn::program("gsd"), "--ordering", "corosync", "--socket-path", "/run/gsd.sock"}),
      Process::Environment{}, log);
}

void Cluster::wait_until_served(int host, size_t from) const {
  const auto deadline = Clock::now() + zn::kStepLimit;
  while (log_of(host).find("info serving", from) == std::string::npos) {
    if (Clock::now() > deadline) throw Failure{"the daemon of a host does not serve: " + log_of(host)};
    zn::pause_for(std::chrono::milliseconds(10));
  }
}

void Cluster::start(size_t column, int host, const Texts& command) {
  stage_.start(column, on(host, command), {{"GSD_ENDPOINT", "unix:/run/gsd.sock"}},
               " on host " + std::to_string(host));
}

void Cluster::meet() {
  for (int host = 1; host <= kHosts; host++) start_daemon(host);
  for (int host = 1; host <= kHosts; host++) wait_until_served(host, 0);
  const std::string member = zn::program("member");
  start(0, 1, {member, "crew", "1"});
  stage_.expect({{"1 joins; members: 1", {1}, ""}, {"1 leads", {1}, ""}});
  start(1, 2, {member, "crew", "2"});
  stage_.expect({{"2 joins; members: 1 2", {1, 2}, ""}});
  start(2, 3, {member, "crew", "3"});
  stage_.expect({{"3 joins; members: 1 2 3", {1, 2, 3}, ""}});
  stage_.command(0, "state ready");
  stage_.expect({{"1 proposes state \"ready\", phase 1", {1, 2, 3}, ""},
                 {"1 proposes state \"ready\", phase 2", {1, 2, 3}, ""},
                 {"approved; the state is \"ready\"", {1, 2, 3}, ""}});
}

void Cluster::pull_a_cable() {
  act("pull the cable of host 3", {"cut", "3"});
  stage_.expect({{"announcement: WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY", {3}, ""},
                 {"3 has failed, WYX_HOST_FAILURE; members: 1 2", {1, 2}, ""}});
  stage_.command(1, "state steady");
  stage_.expect({{"2 proposes state \"steady\", phase 1", {1, 2}, ""},
                 {"2 proposes state \"steady\", phase 2", {1, 2}, ""},
                 {"approved; the state is \"steady\"", {1, 2}, ""}});
}

void Cluster::put_it_back() {
  const size_t before = log_of(3).size();
  act("put the cable of host 3 back", {"heal", "3"});
  wait_until_served(3, before);
  start(Stage::kWatcher, 3, {zn::program("watcher"), "crew"});
  stage_.expect({{"", {}, "members: 1 2; state: \"steady\""}});
  start(2, 3, {zn::program("member"), "crew", "3"});
  stage_.expect({{"3 joins; members: 1 2 3", {1, 2, 3}, "members: 1 2 3; state: \"steady\""}});
}

void Cluster::lose_the_leader() {
  act("host 1 dies, with all that runs on it", {"crash", "1"});
  stage_.expect({{"1 has failed, WYX_HOST_FAILURE; members: 2 3", {2, 3}, "members: 2 3; state: \"steady\""},
                 {"2 leads", {2}, ""}});
  stage_.command(2, "state without 1");
  stage_.expect({{"3 proposes state \"without 1\", phase 1", {2, 3}, ""},
                 {"3 proposes state \"without 1\", phase 2", {2, 3}, ""},
                 {"approved; the state is \"without 1\"", {2, 3}, "members: 2 3; state: \"without 1\""}});
}

void Cluster::stop() {
  for (int host = 2; host <= kHosts; host++) {
    daemons_[host]->signal(SIGTERM);
    if (daemons_[host]->wait_end(Clock::now() + zn::kStepLimit) == 0) continue;
    throw Failure{"a daemon did not stop in order: " + log_of(host)};
  }
}

void Cluster::run() {
  meet();
  pull_a_cable();
  put_it_back();
  lose_the_leader();
  stop();
}

/// Why there can be no hosts here; empty: there can.
std::string hosts_obstacle() {
  Process tried({ZN_CLUSTER_SCRIPT, "check"}, {{"WAIT", "15"}});  // less than the limit, so that it says why
  const int status = tried.wait_end(Clock::now() + zn::kStepLimit);
  while (tried.read_some()) {
  }
  return status == 0 ? "" : tried.next_line().value_or("there is no " ZN_CLUSTER_SCRIPT);
}

}  // namespace

void zn::demo_hosts(const std::string& folder) {
  Cluster cluster(folder);
  cluster.run();
}

void zn::demo_cluster() {
  std::printf("\n%sThree hosts, with a Corosync, a gsd and a member on each%s\n", colour("1"), colour_off());
  std::fflush(stdout);
  const auto start = Clock::now();
  const std::string obstacle = hosts_obstacle();
  if (!obstacle.empty()) {
    say_skipped(obstacle);
    return;
  }
  const TempFolder folder;
  Process::Environment environment{{"TOKEN", "1000"}, {"LOGS", folder.path()}};
  if (*colour("0")) environment.push_back({kColoured, "1"});
  Process hosts({ZN_CLUSTER_SCRIPT, "run", std::to_string(kHosts), program("demo"), kOnHosts, folder.path()},
                environment);
  relay(hosts, start + 4 * kStepLimit);
  if (hosts.wait_end(Clock::now() + kStepLimit) != 0) throw Failure{"the third act went wrong"};
  std::printf("\nOne order of events on all hosts, and none that was taken back: %.0f ms in all.\n",
              std::chrono::duration<double, std::milli>(Clock::now() - start).count());
}
