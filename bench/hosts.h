// The hosts of scripts/cluster.sh around this process, each with its Corosync and a gsd.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "examples/processes.h"

namespace zn {

/// Hosts are numbered from 1, as cluster.sh does.
class Hosts {
 public:
  /// A gsd on each of them, which serves. `script` is cluster.sh.
  Hosts(std::string script, int count, std::string delivery);

  int count() const { return count_; }
  /// Of what the processes of all hosts share.
  static std::string board() { return "/dev/shm/board"; }

  /// What daemons and Corosyncs have logged last, to standard error.
  static void print_logs(int count);

  pid_t daemon(int host) const { return daemons_[static_cast<size_t>(host)]->pid(); }
  void start_daemon(int host);
  void await_serving(int host) const;
  /// Waits until it has ended.
  void end_daemon(int host, int signal);
  /// What its log has so far is over: await_serving waits for what comes.
  void forget_log(int host) const;

  /// Corosync of the host dies, or all that goes to and from the host is dropped; and back again, waiting until
  /// all hosts have a verdict on their ring.
  void kill_corosync(int host) const { script({"kill", std::to_string(host)}); }
  void start_corosync(int host) const;
  void cut(int host) const { script({"cut", std::to_string(host)}); }
  void heal() const;

  /// This program in a role (process_roles.h), as a client of the host's gsd.
  std::unique_ptr<Process> client(int host, const std::string& role, int slot, const std::string& more = "") const;
  /// The same on the host itself, with its network.
  std::unique_ptr<Process> on_host(int host, const std::string& role, int slot) const;
  std::string endpoint(int host) const;

 private:
  void script(const std::vector<std::string>& arguments) const;
  void await_ring() const;
  static std::string log(int host) { return "/run/gsd." + std::to_string(host) + ".log"; }

  const std::string script_;
  const int count_;
  const std::string delivery_;
  std::vector<std::unique_ptr<Process>> daemons_;  // by host; there is no host 0
};

}  // namespace zn
