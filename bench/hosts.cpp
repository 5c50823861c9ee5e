#include "bench/hosts.h"

#include <unistd.h>

#include <algorithm>
#include <cstdio>

#include "bench/waits.h"

namespace zn {

Hosts::Hosts(std::string script, int count, std::string delivery)
    : script_(std::move(script)),
      count_(count),
      delivery_(std::move(delivery)),
      daemons_(static_cast<size_t>(count) + 1) {
  for (int host = 1; host <= count; host++) start_daemon(host);
  for (int host = 1; host <= count; host++) await_serving(host);
}

void Hosts::print_logs(int count) {
  constexpr std::size_t kTail = 1500;  // bytes
  for (int host = 1; host <= count; host++) {
    for (const std::string& file : {log(host), "/run/cluster/corosync." + std::to_string(host) + ".log"}) {
      const std::string text = content_of(file);
      std::fprintf(stderr, "%s:\n%s\n", file.c_str(),
                   text.substr(text.size() - std::min(text.size(), kTail)).c_str());
    }
  }
}

void Hosts::start_daemon(int host) {
  forget_log(host);
  const std::vector<std::string> command{script_,         "on",           std::to_string(host), program("gsd"),
                                         "--ordering",    "corosync",     "--delivery",         delivery_,
                                         "--socket-path", "/run/gsd.sock"};
  daemons_[static_cast<size_t>(host)] = std::make_unique<Process>(command, Process::Environment{}, log(host));
}

void Hosts::await_serving(int host) const {
  await("gsd serves", [&] { return content_of(log(host)).find("serving, was") != std::string::npos; });
}

void Hosts::end_daemon(int host, int signal) {
  Process& daemon = *daemons_[static_cast<size_t>(host)];
  daemon.signal(signal);
  daemon.wait_end(Clock::now() + kWaitLimit);
}

void Hosts::forget_log(int host) const { ::truncate(log(host).c_str(), 0); }

void Hosts::start_corosync(int host) const {
  script({"start", std::to_string(host)});
  await_ring();
}

void Hosts::heal() const {
  script({"heal"});
  await_ring();
}

void Hosts::await_ring() const {
  std::string all;
  for (int host = 1; host <= count_; host++) all += (host == 1 ? "" : ",") + std::to_string(host);
  script({"wait", all});
}

std::unique_ptr<Process> Hosts::client(int host, const std::string& role, int slot,
                                       const std::string& more) const {
  const std::vector<std::string> command{program("cluster"), "--role=" + role, board(), std::to_string(slot),
                                         more};
  return std::make_unique<Process>(command, Process::Environment{{"GSD_ENDPOINT", endpoint(host)}});
}

std::unique_ptr<Process> Hosts::on_host(int host, const std::string& role, int slot) const {
  const std::vector<std::string> command{script_,          "on",    std::to_string(host), program("cluster"),
                                         "--role=" + role, board(), std::to_string(slot)};
  return std::make_unique<Process>(command, Process::Environment{});
}

/// A pathname can be reached from outside the host.
std::string Hosts::endpoint(int host) const {
  return "unix:/run/cluster/" + std::to_string(host) + "/run/gsd.sock";
}

void Hosts::script(const std::vector<std::string>& arguments) const {
  std::vector<std::string> command{script_};
  command.insert(command.end(), arguments.begin(), arguments.end());
  Process process(command, {});
  if (process.wait_end(Clock::now() + kWaitLimit) == 0) return;
  throw Failure{"cluster.sh " + arguments[0] + " has failed"};
}

}  // namespace zn
