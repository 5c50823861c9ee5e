// A storm of whole processes around a daemon of its own: members and subscribers come, go, vote and talk at random
// while they and the daemon are killed, stopped and started again. In the end whoever is left must agree on who
// that is, and the logs of all must fit together (verdict.h). It runs in rounds, each with a seed of its own; a
// round that fails says its seed and keeps its logs, the others leave nothing behind.
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
#include "storm/verdict.h"

namespace {

using std::chrono::milliseconds;
using storm::Account;
using zn::Clock;
using zn::Failure;
using zn::pause_for;
using zn::Process;

constexpr auto kHang = std::chrono::seconds(120);  // a bound on a hang, not on what is tested
constexpr auto kRound = std::chrono::seconds(10);  // of storm, at most, before the processes come to rest
constexpr int kLeftBehind = 8;                     // processes left behind by clients in a round, at most

struct Settings {
  int seconds = 60;
  std::uint64_t seed = 1;
  int members = 10;
  int subscribers = 2;
  int growth = 32;  // MiB that the daemon may be larger after a round than before
};

/// Whether a child has ended; it is not reaped.
bool has_ended(pid_t child) {
  siginfo_t info{};
  return ::waitid(P_PID, static_cast<id_t>(child), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
         info.si_pid == child;
}

void await_good_end(Process& process, const std::string& who) {
  const int status = process.wait_end(Clock::now() + kHang);
  if (status != 0) throw Failure{"a " + who + " ended with wait status " + std::to_string(status)};
}

template <class Condition>
void wait_until(const std::string& what, Condition condition) {
  const auto deadline = Clock::now() + kHang;
  while (!condition()) {
    if (Clock::now() > deadline) throw Failure{"waited in vain: " + what};
    pause_for(milliseconds(20));
  }
}

class Round {
 public:
  Round(const Settings& settings, std::uint64_t seed) : settings_(settings), seed_(seed), random_(seed) {}

  /// Throws Failure with what is wrong.
  Account run(milliseconds time) {
    if (!board_ || ::pipe2(lifeline_, O_CLOEXEC) != 0) throw Failure{"no board or pipe"};
    ::fcntl(lifeline_[0], F_SETFD, 0);
    start_daemon();
    descriptors_at_start_ = descriptors();
    mib_at_start_ = resident_mib();
    for (int i = 0; i < settings_.members; i++) clients_.push_back(start_client("member"));
    for (int i = 0; i < settings_.subscribers; i++) clients_.push_back(start_client("subscriber"));
    clients_.push_back(start_client("deaf"));
    const auto end = Clock::now() + time;
    while (Clock::now() < end) {
      step();
      pause_for(milliseconds(upto(120)));
    }
    rally();
    end_clients();
    end_daemon();
    const std::string errors = zn::content_of(folder_.path() + "/errors");
    if (!errors.empty()) throw Failure{"a client wrote to standard error:\n" + errors};
    check_daemon_log();
    return storm::judge(logs());
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
    const Process::Environment environment{{"GSD_ENDPOINT", "unix:" + socket_}};
    Client client{role, std::make_unique<Process>(command, environment, folder_.path() + "/errors"), {}};
    if (role == "deaf") deaf_.insert(client.process->pid());
    return client;
  }

  void start_daemon() {
    ++board_->life;
    const std::vector<std::string> command{zn::program("gsd"), "--socket-path=" + socket_, "--ready-fd=1",
                                           "--log-level=debug",  // which leaves no line out
                                           "--queue-bound=" + std::to_string(1 << 20)};
    daemon_ = std::make_unique<Process>(command, Process::Environment{}, folder_.path() + "/gsd.log");
    daemon_->wait_line(Clock::now() + kHang);
  }

  void kill_daemon() {
    daemon_->signal(SIGKILL);
    daemon_->wait_end(Clock::now() + kHang);
    start_daemon();
  }

  void step() {
    if (has_ended(daemon_->pid())) throw Failure{"the daemon has ended by itself"};
    for (const Client& client : clients_) {
      if (has_ended(client.process->pid())) throw Failure{"a " + client.role + " has ended by itself"};
    }
    resume_those_due();
    Client& client = clients_[static_cast<std::size_t>(upto(static_cast<int>(clients_.size()) - 1))];
    const int dice = upto(99);
    if (dice < 25) return kill(client);
    if (dice < 35) return stop(client);
    if (dice < 39) {
      daemon_->signal(SIGSTOP);
      pause_for(milliseconds(10 + upto(200)));
      return daemon_->signal(SIGCONT);
    }
    if (dice < 41 && seed_ % 3 != 0) return kill_daemon();
    if (dice < 44 && left_behind_ < kLeftBehind) {
      left_behind_++;
      return client.process->write_line("fork");
    }
    if (dice < 47 && client.resumes == Clock::time_point{}) {
      client.process->write_line("quit");
      await_good_end(*client.process, client.role);
      replace(client);
    }
  }

  void kill(Client& victim) {
    killed_.insert(victim.process->pid());
    replace(victim);
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

  void end_daemon() {
    wait_until("the daemon closes the descriptors of its clients",
               [&] { return descriptors() <= descriptors_at_start_; });
    const double growth = resident_mib() - mib_at_start_;
    if (growth > settings_.growth) throw Failure{"the daemon has grown by " + std::to_string(growth) + " MiB"};
    daemon_->signal(SIGTERM);
    await_good_end(*daemon_, "daemon");
    ::close(std::exchange(lifeline_[0], -1));
    wait_until("those left behind by clients end", [] { return ::waitpid(-1, nullptr, WNOHANG) < 0; });
    if (std::filesystem::exists(socket_)) throw Failure{"the daemon has left its socket"};
  }

  /// Nobody who reads is closed, nor for a stop that is shorter than the daemon's drain-time.
  void check_daemon_log() const {
    std::ifstream log(folder_.path() + "/gsd.log");
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
      throw Failure{"the daemon has closed a client that reads: " + line};
    }
    if (!some_quit) throw Failure{"the daemon's log does not say who quits"};
  }

  std::vector<std::string> logs() const {
    std::vector<std::string> all;
    for (const auto& file : std::filesystem::directory_iterator(folder_.path())) {
      if (file.path().extension() == ".log" && file.path().stem() != "gsd") all.push_back(file.path());
    }
    std::sort(all.begin(), all.end());
    return all;
  }

  std::size_t descriptors() const {
    const std::filesystem::directory_iterator all("/proc/" + std::to_string(daemon_->pid()) + "/fd");
    return static_cast<std::size_t>(std::distance(begin(all), end(all)));
  }

  double resident_mib() const {
    std::ifstream status("/proc/" + std::to_string(daemon_->pid()) + "/status");
    for (std::string line; std::getline(status, line);) {
      if (line.rfind("VmRSS:", 0) == 0) return std::stod(line.substr(6)) / 1024;
    }
    throw Failure{"the daemon is gone"};
  }

  const Settings settings_;
  const std::uint64_t seed_;
  std::mt19937 random_;
  zn::TempFolder folder_;
  const std::string socket_ = folder_.path() + "/gsd.sock";
  storm::Board* board_ = storm::map_board(folder_.path());
  int lifeline_[2] = {-1, -1};  // clients hold the reading end, this process alone the other
  std::unique_ptr<Process> daemon_;
  std::size_t descriptors_at_start_ = 0;
  double mib_at_start_ = 0;
  std::vector<Client> clients_;
  std::set<pid_t> deaf_;  // the daemon may close them
  std::set<pid_t> killed_;
  int started_ = 0;
  int left_behind_ = 0;
};

int run_rounds(const Settings& settings) {
  ::prctl(PR_SET_CHILD_SUBREAPER, 1);  // what clients leave behind is waited for here
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
  app.add_option("--growth", settings.growth, "MiB that the daemon may be larger after a round than before");
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
