// What is around each figure of cluster.cpp: hosts with a gsd and a raw process each, clients, and what they
// report.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "bench/figures.h"
#include "bench/hosts.h"
#include "bench/process_roles.h"
#include "bench/waits.h"

namespace zn {

struct ClusterSettings {
  int rounds = 20;      // of each latency, alternating
  int samples = 100;    // in each round
  int messages = 3000;  // of each sender
  int raw_messages = 30000;
  int daemon_deaths = 200;
  int host_deaths = 8;
  int newcomers = 8;
  int quiet = 100;  // requests with nothing going on, before each newcomer

  static ClusterSettings quick() { return {2, 50, 200, 2000, 5, 2, 2, 50}; }
};

class ClusterScene {
 public:
  using Processes = std::vector<std::unique_ptr<Process>>;

  /// `script` is cluster.sh. Everybody is there when this is done, and this process has a session on host 1.
  ClusterScene(const std::string& script, int nodes, const std::string& delivery);

  Hosts& hosts() { return hosts_; }
  int nodes() const { return hosts_.count(); }
  /// A host whose failure leaves a majority; 0 where there are too few for that.
  int spare_host() const { return nodes() < 3 ? 0 : nodes(); }
  /// On one phase, in echoes and round trips.
  double bound() const { return bound_; }
  Slot& slot(int number) { return board_[number]; }
  zelt_gscl_V1::GSController& controller() { return controller_; }

  std::unique_ptr<Process> client(int host, const std::string& role, int slot, const std::string& more = "");
  /// Members in slots first to last, the one of slot `first` + i on host i + 1 as far as there are hosts, each in
  /// the group before the next one.
  Processes members(int first, int last, const std::string& group);
  template <class Condition>
  void until(Condition condition) {
    dispatch_until(controller_, condition);
  }
  int64_t await_counts(int first, int last, uint64_t target) {
    return zn::await_counts(board_, first, last - first + 1, target);
  }
  void check(int first, int last) { zn::check(board_, first, last - first + 1); }

  Process& raw(int host) { return *raw_[static_cast<size_t>(host)]; }
  static int raw_slot(int host);
  /// (Again), and waits until all know of it.
  void start_raw(int host);
  /// Until the raw processes of these hosts have been told of so many members, and of so many on the ring.
  void await_raw(int first_host, int last_host, uint64_t members, uint64_t ring);

 private:
  Hosts hosts_;
  const double bound_;
  Board board_{Hosts::board()};
  Processes raw_;  // by host; there is no host 0
  zelt_gscl_V1::GSController controller_;
};

inline double microseconds(int64_t from, int64_t to) { return static_cast<double>(to - from) / 1e3; }
inline double milliseconds(int64_t from, int64_t to) { return static_cast<double>(to - from) / 1e6; }

// The figures, each group with everything it needs.

void agreement(ClusterScene& scene, const ClusterSettings& settings, Figures* figures);
void throughput(ClusterScene& scene, const ClusterSettings& settings, Figures* figures);
/// Of 1,000 groups: the memory, and with their state a newcomer.
void many_groups(ClusterScene& scene, const ClusterSettings& settings, Figures* figures);
void deaths_of_daemons(ClusterScene& scene, const ClusterSettings& settings, Figures* figures);
void deaths_of_hosts(ClusterScene& scene, const ClusterSettings& settings, Figures* figures);

}  // namespace zn
