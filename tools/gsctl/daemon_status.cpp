// gsctl status: the daemon in five lines.
#include "tools/gsctl/inspection.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/reports.h"

namespace gsctl {
namespace {

std::string serving_text(const inspect::DaemonT& daemon) {
  if (daemon.serving) return "serves";
  if (daemon.quorum == "lost") return "does not serve: its part of the hosts has no quorum";
  return daemon.will_serve ? "does not serve yet" : "does not serve: see its log";
}

std::string nodes_text(const inspect::DaemonT& daemon) {
  std::string nodes;
  for (const std::uint32_t node : daemon.nodes) nodes += (nodes.empty() ? "" : " ") + std::to_string(node);
  const std::string own = daemon.node == 0 ? "no node yet" : "node " + std::to_string(daemon.node);
  return own + (nodes.empty() ? "" : " of " + nodes) + ", ordering " + daemon.ordering +
         (daemon.quorum == "none" ? "" : ", quorum: " + daemon.quorum);
}

/// "1 group", "2 groups".
std::string counted(std::uint64_t count, const std::string& what) {
  return std::to_string(count) + " " + what + (count == 1 ? "" : "s");
}

void print(const inspect::DaemonT& daemon) {
  const auto count = [&](const char* name) { return count_of(daemon, name); };
  print_line("gsd " + daemon.version + ", pid " + std::to_string(daemon.pid) + ", " + serving_text(daemon));
  print_line("up " + duration_text(daemon.age_ms));
  print_line(nodes_text(daemon));
  print_line(counted(count("groups"), "group") + ", " + counted(count("members"), "member") + ", " +
             counted(count("subscribers"), "subscriber") + ", " + counted(count("running_protocols"), "protocol") +
             " running");
  print_line(counted(count("sessions"), "session") + ", " + size_text(count("waiting_bytes")) + " to be read");
}

int status(const Settings& settings) {
  const inspect::DaemonT daemon = connected(settings).daemon();
  if (settings.json) {
    print_json(to_json(daemon));
  } else {
    print(daemon);
  }
  return daemon.serving ? kDone : kRefused;
}

}  // namespace

Run add_status(CLI::App&) { return status; }

}  // namespace gsctl
