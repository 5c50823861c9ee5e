// A storm of whole processes around a daemon of its own: members and subscribers come, go, vote and talk at random
// while they and the daemon are killed, stopped and started again; or around the daemons of several hosts, which
// are cut off, hang and die. In the end whoever is left must agree on who that is, and the logs of all must fit
// together (verdict.h). It runs in rounds, each with a seed of its own; a round that fails says its seed and keeps
// its logs, the others leave nothing behind.
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <random>
#include <set>
#include <sstream>

#include "common/command_line.h"
#include "examples/processes.h"
#include "storm/board.h"
#include "storm/client.h"
#include "storm/hosts.h"
#include "storm/verdict.h"

namespace {

using std::chrono::milliseconds;
using storm::Account;
using storm::await_good_end;
using storm::expect_running;
using storm::Hosts;
using storm::kHang;
using storm::wait_until;
using zn::Clock;
using zn::Failure;
using zn::pause_for;
using zn::Process;

constexpr auto kRound = std::chrono::seconds(10);  // of storm, at most, before the processes come to rest
constexpr int kLeftBehind = 8;                     // processes left behind by clients in a round, at most

struct Settings {
  int seconds = 60;
  std::uint64_t seed = 1;
  int members = 10;
  int subscribers = 2;
  Hosts::Settings hosts;
};

class Round {
 public:
  Round(const Settings& settings, std::uint64_t seed) : settings_(settings), seed_(seed), random_(seed) {}

  /// Throws Failure with what is wrong.
  Account run(milliseconds time) {
    if (!board_ || ::pipe2(lifeline_, O_CLOEXEC) != 0) throw Failure{"no board or pipe"};
    ::fcntl(lifeline_[0], F_SETFD, 0);
    hosts_ = std::make_unique<Hosts>(settings_.hosts, folder_.path(), *board_);
    hosts_->start();
    for (int i = 0; i < settings_.members; i++) clients_.push_back(start_client("member"));
    for (int i = 0; i < settings_.subscribers; i++) clients_.push_back(start_client("subscriber"));
    clients_.push_back(start_client("deaf"));
    const auto end = Clock::now() + time;
    while (Clock::now() < end) {
      step();
      pause_for(milliseconds(upto(120)));
    }
    hosts_->repair();
    rally();
    end_clients();
    end_hosts();
    const std::string errors = zn::content_of(folder_.path() + "/errors");
    if (!errors.empty()) throw Failure{"a client wrote to standard error:\n" + errors};
    for (const std::string& log : hosts_->logs()) check_daemon_log(log);
    return storm::judge(logs(), hosts_->are_many());
  }

  /// Moves what the processes wrote to where it stays, and says where that is.
  std::string keep() const {
    const std::string kept = folder_.path() + "-kept";
    std::error_code error;
    std::filesystem::rename(folder_.path(), kept, error);
    return error ? "could not be kept: " + error.message() : kept;
  }

 private:
  struct Client {
    std::string role;
    int host = 0;
    std::unique_ptr<Process> process;
    Clock::time_point resumes{};  // while it is stopped
  };

  /// What the clients say of one group.
  struct Standing {
    std::set<std::string> seqnums, members;  // each as it was said
    std::set<int> living;

    bool agrees() const {
      if (seqnums.size() != 1 || members.size() != 1) return false;
      std::set<int> ids;
      std::istringstream in(*members.begin());
      for (std::string id; std::getline(in, id, ',');) ids.insert(std::atoi(id.c_str()));
      return ids == living;
    }
  };

  int upto(int n) { return static_cast<int>(random_() % static_cast<unsigned>(n + 1)); }

  Client start_client(const std::string& role) {
    const int serial = ++started_;
    std::vector<std::string> command{zn::program("storm"), "--role=" + role, "--folder=" + folder_.path()};
    command.push_back("--serial=" + std::to_string(serial));
    command.push_back("--seed=" + std::to_string(seed_ * 10007 + static_cast<std::uint64_t>(serial)));
    command.push_back("--lifeline=" + std::to_string(lifeline_[0]));
    const int host = 1 + serial % hosts_->count();
    Client client{role, host, hosts_->start_client(host, command), {}};
    if (role == "deaf") deaf_.insert(client.process->pid());
    return client;
  }

  void step() {
    hosts_->expect_alive();
    for (const Client& client : clients_) expect_running(*client.process, client.role);
    resume_those_due();
    hosts_->cure_those_due();
    Client& client = clients_[static_cast<std::size_t>(upto(static_cast<int>(clients_.size()) - 1))];
    const int dice = upto(99);
    if (dice < 25) return kill(client);
    if (dice < 35) return stop(client);
    if (dice < 38 && left_behind_ < kLeftBehind) {
      left_behind_++;
      return client.process->write_line("fork");
    }
    if (dice < 41 && client.resumes == Clock::time_point{} && !hosts_->is_harmed(client.host)) {
      client.process->write_line("quit");
      await_good_end(*client.process, client.role);
      return replace(client);
    }
    // Harm to one of several hosts lasts, and only few can be harmed at a time.
    if (dice < (hosts_->are_many() ? 70 : 47)) {
      hosts_->disturb([this](int n) { return upto(n); }, [this](int host) { crash(host); });
    }
  }

  void kill(Client& victim) {
    killed_.insert(victim.process->pid());
    replace(victim);
  }

  void crash(int host) {
    for (Client& client : clients_) {
      if (client.host == host) kill(client);
    }
  }

  /// The old one is killed with its object, if it has not ended.
  void replace(Client& old) {
    const std::string role = old.role;
    old = start_client(role);
  }

  void stop(Client& victim) {
    if (victim.resumes != Clock::time_point{}) return;
    victim.process->signal(SIGSTOP);
    victim.resumes = Clock::now() + milliseconds(20 + upto(700));
  }

  void resume_those_due() {
    for (Client& client : clients_) {
      if (client.resumes == Clock::time_point{} || client.resumes > Clock::now()) continue;
      client.process->signal(SIGCONT);
      client.resumes = {};
    }
  }

  /// Nothing is disturbed any more; everybody joins everything and says where it stands, until all say the same.
  void rally() {
    std::erase_if(clients_, [](const Client& client) { return client.role == "deaf"; });
    for (Client& client : clients_) {
      client.process->signal(SIGCONT);
      client.process->write_line("rally");
    }
    std::string stands;
    const auto deadline = Clock::now() + kHang;
    while (!at_rest(&stands)) {
      if (Clock::now() > deadline) {
        std::ofstream(folder_.path() + "/stands") << stands;
        throw Failure{"those who live do not come to agree on who that is (see stands)"};
      }
      pause_for(milliseconds(50));
    }
  }

  /// Takes in a line of a client's report; false: that one is out, or has a request open.
  static bool take_report(const std::string& line, std::map<int, Standing>& groups) {
    std::istringstream in(line);
    char mark = 0;
    int group = 0, instance = -1, open = 0;
    std::string seqnum, members;
    in >> mark >> group;
    if (mark == 'P') in >> instance >> seqnum;
    in >> members >> open;
    Standing& standing = groups[group];
    standing.members.insert(members);
    if (mark == 'P') standing.living.insert(instance);
    if (mark == 'P') standing.seqnums.insert(seqnum);
    return instance != 0 && open == 0;
  }

  /// All providers are in, with nothing open; all have the same last event and members, which are the living ones.
  bool at_rest(std::string* stands) {
    std::map<int, Standing> groups;
    bool rest = true;
    stands->clear();
    for (Client& client : clients_) {
      client.process->write_line("report");
      for (std::string line; (line = client.process->wait_line(Clock::now() + kHang)) != ".";) {
        *stands += std::to_string(client.process->pid()) + ": " + line + "\n";
        rest = take_report(line, groups) && rest;
      }
    }
    return rest && std::all_of(groups.begin(), groups.end(), [](const auto& g) { return g.second.agrees(); });
  }

  void end_clients() {
    for (Client& client : clients_) client.process->write_line("quit");
    for (Client& client : clients_) await_good_end(*client.process, client.role);
    ::close(std::exchange(lifeline_[1], -1));
    clients_.clear();
  }

  void end_hosts() {
    hosts_->end();
    ::close(std::exchange(lifeline_[0], -1));
    wait_until("those left behind by clients end", [] { return ::waitpid(-1, nullptr, WNOHANG) < 0; });
  }

  /// Nobody who reads is closed, nor for a stop that is shorter than the daemon's drain-time.
  void check_daemon_log(const std::string& path) const {
    std::ifstream log(path);
    bool some_quit = false;
    for (std::string line; std::getline(log, line);) {
      const auto reason = line.find(": closed: ");
      if (reason == std::string::npos) continue;
      const std::string why = line.substr(reason + 10);
      const auto pid = line.find("pid ");
      const int who = pid == std::string::npos ? 0 : std::atoi(line.c_str() + pid + 4);
      some_quit |= why == "quit";
      if (deaf_.contains(who) || why == "quit" || why.rfind("the peer is gone", 0) == 0) continue;
      // One that attaches was dead when that was read.
      const bool of_dead = why == "its process has ended" || why.rfind("attaches", 0) == 0;
      if (killed_.contains(who) && of_dead) continue;
      // A host that takes no part, for now or since that one has begun.
      if (hosts_->are_many() && (why.rfind("this host", 0) == 0 || why.rfind("attaches", 0) == 0)) continue;
      throw Failure{"the daemon has closed a client that reads: " + line};
    }
    if (!some_quit && !hosts_->are_many()) throw Failure{"the daemon's log does not say who quits"};
  }

  std::vector<std::string> logs() const {
    std::vector<std::string> all;
    for (const auto& file : std::filesystem::directory_iterator(folder_.path())) {
      if (file.path().extension() == ".log" && file.path().filename().string().rfind("gsd.", 0) != 0)
        all.push_back(file.path());
    }
    std::sort(all.begin(), all.end());
    return all;
  }

  const Settings settings_;
  const std::uint64_t seed_;
  std::mt19937 random_;
  zn::TempFolder folder_;
  storm::Board* board_ = storm::map_board(folder_.path());
  int lifeline_[2] = {-1, -1};  // clients hold the reading end, this process alone the other
  std::unique_ptr<Hosts> hosts_;
  std::vector<Client> clients_;
  std::set<pid_t> deaf_;  // the daemon may close them
  std::set<pid_t> killed_;
  int started_ = 0;
  int left_behind_ = 0;
};

int run_rounds(const Settings& settings) {
  // What clients leave behind is waited for here; in a cluster Corosyncs would come with it, and its end is
  // theirs.
  if (settings.hosts.count == 1) ::prctl(PR_SET_CHILD_SUBREAPER, 1);
  const auto end = Clock::now() + std::chrono::seconds(settings.seconds);
  for (std::uint64_t seed = settings.seed; Clock::now() < end; seed++) {
    Round round(settings, seed);
    try {
      const Account a = round.run(
          std::chrono::duration_cast<milliseconds>(std::min<Clock::duration>(kRound, end - Clock::now())));
      std::printf(
          "seed %llu: %zu processes, %zu requests, %zu lives of groups, %zu events in %zu notifications, %zu to "
          "subscribers: all agree\n",
          static_cast<unsigned long long>(seed), a.logs, a.requests, a.group_lives, a.events, a.notifications,
          a.subscriptions);
      std::fflush(stdout);
    } catch (const Failure& failure) {
      const std::string kept = failure.text == "interrupted" ? "none" : round.keep();
      std::fprintf(stderr, "storm: seed %llu: %s\nlogs: %s\n", static_cast<unsigned long long>(seed),
                   failure.text.c_str(), kept.c_str());
      return 1;
    }
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app("A storm of processes around a private gsd; what they saw is compared.", "storm");
  Settings settings;
  storm::ClientSettings client;
  app.add_option("--seconds", settings.seconds, "How long, in rounds of ten seconds and what they need to end")
      ->check(CLI::Range(1, 1'000'000));
  app.add_option("--seed", settings.seed, "Seed of the first round; the next ones count on");
  app.add_option("--members", settings.members, "Member processes at a time")->check(CLI::Range(1, 200));
  app.add_option("--subscribers", settings.subscribers, "Subscriber processes at a time")
      ->check(CLI::Range(0, 50));
  app.add_option("--growth", settings.hosts.growth, "MiB that a daemon may be larger after a round than before");
  auto* cluster = app.add_option("--cluster", settings.hosts.cluster, "cluster.sh, which runs this");
  app.add_option("--hosts", settings.hosts.count, "Its hosts")->check(CLI::Range(3, 9))->needs(cluster);
  app.add_option("--role", client.role)->group("");
  app.add_option("--folder", client.folder)->group("");
  app.add_option("--serial", client.serial)->group("");
  app.add_option("--lifeline", client.lifeline)->group("");
  try {
    if (!platform::parse_command_line(app, argc, argv)) return 0;
  } catch (const platform::SettingError& error) {
    std::fprintf(stderr, "storm: %s\n", error.what());
    return 2;
  }
  client.seed = settings.seed;
  if (!client.role.empty()) return storm::run_client(client);
  zn::catch_interrupts();
  return run_rounds(settings);
}
