#include "storm/hosts.h"

#include <signal.h>
#include <sys/wait.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <utility>

namespace storm {
namespace {

using std::chrono::milliseconds;
using zn::Clock;
using zn::Failure;
using zn::Process;

std::size_t descriptors(const Process& daemon) {
  const std::filesystem::directory_iterator all("/proc/" + std::to_string(daemon.pid()) + "/fd");
  return static_cast<std::size_t>(std::distance(begin(all), end(all)));
}

double resident_mib(const Process& daemon) {
  std::ifstream status("/proc/" + std::to_string(daemon.pid()) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind("VmRSS:", 0) == 0) return std::stod(line.substr(6)) / 1024;
  }
  throw Failure{"the daemon is gone"};
}

void await_killed(Process& daemon) {
  const int status = daemon.wait_end(Clock::now() + kHang);
  if (WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) return;
  throw Failure{"a daemon ended before it was killed, with wait status " + std::to_string(status)};
}

}  // namespace

void expect_running(const Process& child, const std::string& who) {
  siginfo_t info{};
  const int failed = ::waitid(P_PID, static_cast<id_t>(child.pid()), &info, WEXITED | WNOHANG | WNOWAIT);
  if (failed || info.si_pid != child.pid()) return;
  throw Failure{"a " + who +
                (info.si_code == CLD_EXITED ? " has ended by itself, status " : " has died of signal ") +
                std::to_string(info.si_status)};
}

void await_good_end(Process& process, const std::string& who) {
  const int status = process.wait_end(Clock::now() + kHang);
  if (status != 0) throw Failure{"a " + who + " ended with wait status " + std::to_string(status)};
}

void wait_until(const std::string& what, const std::function<bool()>& condition) {
  const auto deadline = Clock::now() + kHang;
  while (!condition()) {
    if (Clock::now() > deadline) throw Failure{"waited in vain: " + what};
    zn::pause_for(milliseconds(20));
  }
}

Hosts::Hosts(const Settings& settings, const std::string& folder, Board& board)
    : settings_(settings), folder_(folder), board_(board), hosts_(static_cast<std::size_t>(settings.count)) {
  for (int i = 0; i < settings.count; i++) hosts_[static_cast<std::size_t>(i)].number = i + 1;
}

std::vector<std::string> Hosts::on(int host, std::vector<std::string> command) const {
  if (are_many()) command.insert(command.begin(), {settings_.cluster, "on", std::to_string(host)});
  return command;
}

void Hosts::cluster(const std::vector<std::string>& words) const {
  std::vector<std::string> command{settings_.cluster};
  command.insert(command.end(), words.begin(), words.end());
  Process process(command, {});
  await_good_end(process, "change of the cluster (" + words[0] + " " + words[1] + ")");
}

std::unique_ptr<Process> Hosts::start_client(int host, const std::vector<std::string>& command) const {
  const Process::Environment environment{{"GSD_ENDPOINT", "unix:" + socket(host)}};
  return std::make_unique<Process>(on(host, command), environment, folder_ + "/errors");
}

void Hosts::start() {
  if (are_many()) ++board_.life;  // one, whatever becomes of single daemons
  for (Host& host : hosts_) start_daemon(host);
  for (Host& host : hosts_) {
    wait_until_served(host);
    host.descriptors_at_start = descriptors(*host.daemon);
    host.mib_at_start = resident_mib(*host.daemon);
  }
}

void Hosts::start_daemon(Host& host) {
  if (!are_many()) ++board_.life;
  std::vector<std::string> command{zn::program("gsd"), "--socket-path=" + socket(host.number), "--ready-fd=1",
                                   "--log-level=debug",  // which leaves no line out
                                   "--queue-bound=" + std::to_string(1 << 20)};
  if (are_many()) command.insert(command.end(), {"--ordering=corosync", "--member-timeout=2"});
  host.daemon = std::make_unique<Process>(on(host.number, command), Process::Environment{}, log(host.number));
  host.daemon->wait_line(Clock::now() + kHang);
}

void Hosts::wait_until_served(const Host& host) const {
  if (!are_many()) return;
  wait_until("the daemon of host " + std::to_string(host.number) + " serves",
             [&] { return zn::content_of(log(host.number)).find("info serving") != std::string::npos; });
}

void Hosts::kill_daemon(Host& host) {
  host.daemon->signal(SIGKILL);
  await_killed(*host.daemon);
}

void Hosts::disturb_one(const Upto& upto) {
  Host& host = hosts_.front();
  if (upto(2) == 0) {
    kill_daemon(host);
    return start_daemon(host);
  }
  host.daemon->signal(SIGSTOP);
  zn::pause_for(milliseconds(10 + upto(200)));
  host.daemon->signal(SIGCONT);
}

void Hosts::disturb(const Upto& upto, const OnCrash& on_crash) {
  if (!are_many()) return disturb_one(upto);
  const auto harmed =
      std::count_if(hosts_.begin(), hosts_.end(), [](const Host& host) { return host.cure != nullptr; });
  Host& host = hosts_[static_cast<std::size_t>(upto(count() - 1))];
  if (host.cure || 2 * (harmed + 1) >= count()) return;
  harm(host, upto(5), on_crash);
  host.cured_at = Clock::now() + milliseconds(100 + upto(3500));
}

void Hosts::note(const std::string& what, const Host& host) const {
  const double now = std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
  std::ofstream(folder_ + "/faults", std::ios::app)
      << std::fixed << now << " host " << host.number << ": " << what << "\n";
}

void Hosts::cure(Host& host) {
  note("is cured", host);
  std::exchange(host.cure, nullptr)();
  note("was cured", host);
}

void Hosts::harm(Host& host, int how, const OnCrash& on_crash) {
  static constexpr const char* kHarms[] = {"is cut off",      "its daemon hangs",  "its Corosync hangs",
                                           "its daemon dies", "its Corosync dies", "all of it dies"};
  note(kHarms[how], host);
  const std::string number = std::to_string(host.number);
  switch (how) {
    case 0:
      cluster({"cut", number});
      host.cure = [this, number] { cluster({"heal", number}); };
      return;
    case 1:
      host.daemon->signal(SIGSTOP);
      host.cure = [&host] { host.daemon->signal(SIGCONT); };
      return;
    case 2:
      cluster({"kill", number, "STOP"});
      host.cure = [this, number] { cluster({"kill", number, "CONT"}); };
      return;
    case 3:
      kill_daemon(host);
      host.cure = [this, &host] { start_daemon(host); };
      return;
    case 4:
      cluster({"kill", number});
      host.cure = [this, number] { cluster({"start", number}); };
      return;
    default:
      cluster({"crash", number});
      await_killed(*host.daemon);
      on_crash(host.number);
      host.cure = [this, number, &host] {
        cluster({"start", number});
        start_daemon(host);
      };
  }
}

void Hosts::cure_those_due() {
  for (Host& host : hosts_) {
    if (host.cure && host.cured_at <= Clock::now()) cure(host);
  }
}

void Hosts::repair() {
  for (Host& host : hosts_) {
    if (host.cure) cure(host);
  }
}

void Hosts::expect_alive() const {
  for (const Host& host : hosts_) {
    if (!host.cure) expect_running(*host.daemon, "daemon (of host " + std::to_string(host.number) + ")");
  }
}

void Hosts::end() {
  for (Host& host : hosts_) end_daemon(host);
}

void Hosts::end_daemon(Host& host) {
  wait_until("the daemon closes the descriptors of its clients",
             [&] { return descriptors(*host.daemon) <= host.descriptors_at_start; });
  const double growth = resident_mib(*host.daemon) - host.mib_at_start;
  if (growth > settings_.growth) throw Failure{"the daemon has grown by " + std::to_string(growth) + " MiB"};
  host.daemon->signal(SIGTERM);
  await_good_end(*host.daemon, "daemon");
  if (std::filesystem::exists(socket(host.number))) throw Failure{"the daemon has left its socket"};
}

std::vector<std::string> Hosts::logs() const {
  std::vector<std::string> all;
  for (const Host& host : hosts_) all.push_back(log(host.number));
  return all;
}

}  // namespace storm
