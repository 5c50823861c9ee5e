// The hosts of a storm, with a daemon on each: one, which is this machine, or those of a cluster.sh that runs
// this.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "examples/processes.h"
#include "storm/board.h"

namespace storm {

constexpr auto kHang = std::chrono::seconds(120);  // a bound on a hang, not on what is tested

class Hosts {
 public:
  struct Settings {
    int count = 1;
    std::string cluster;  // the script, where there are several
    int growth = 32;      // MiB that a daemon may be larger at the end than at the start
  };
  using Upto = std::function<int(int)>;           // at random, 0 to the argument
  using OnCrash = std::function<void(int host)>;  // whatever ran there is dead

  Hosts(const Settings& settings, const std::string& folder, Board& board);

  int count() const { return settings_.count; }
  bool are_many() const { return settings_.count > 1; }
  void start();
  /// A client of the host's daemon, with its errors in the folder's file "errors".
  std::unique_ptr<zn::Process> start_client(int host, const std::vector<std::string>& command) const;
  /// Does harm to a host, if the others can spare it: in passing to a single one, to one of several for a while.
  void disturb(const Upto& upto, const OnCrash& on_crash);
  void cure_those_due();
  /// Ends all harm.
  void repair();
  void expect_alive() const;
  bool is_harmed(int host) const { return hosts_[static_cast<std::size_t>(host - 1)].cure != nullptr; }
  /// Waits until the daemons have let go of their clients, and ends them.
  void end();
  std::vector<std::string> logs() const;

 private:
  using Clock = zn::Clock;
  struct Host {
    int number = 0;
    std::unique_ptr<zn::Process> daemon;
    std::size_t descriptors_at_start = 0;
    double mib_at_start = 0;
    std::function<void()> cure;  // while it is harmed
    Clock::time_point cured_at{};
  };

  void start_daemon(Host& host);
  void kill_daemon(Host& host);
  void disturb_one(const Upto& upto);
  void cure(Host& host);
  void harm(Host& host, int how, const OnCrash& on_crash);
  void wait_until_served(const Host& host) const;
  void end_daemon(Host& host);
  std::vector<std::string> on(int host, std::vector<std::string> command) const;
  /// Into the file "faults": what was done and when, on the clock of gsd's logs.
  void note(const std::string& what, const Host& host) const;
  void cluster(const std::vector<std::string>& words) const;
  std::string socket(int host) const { return folder_ + "/gsd." + std::to_string(host) + ".sock"; }
  std::string log(int host) const { return folder_ + "/gsd." + std::to_string(host) + ".log"; }

  const Settings settings_;
  const std::string folder_;
  Board& board_;
  std::vector<Host> hosts_;
};

/// Throws if the child has ended; it is not reaped.
void expect_running(const zn::Process& child, const std::string& who);
void await_good_end(zn::Process& process, const std::string& who);
void wait_until(const std::string& what, const std::function<bool()>& condition);

}  // namespace storm
