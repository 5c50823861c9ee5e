// How soon the members on other hosts know that a daemon, or a host, is gone.
#include <signal.h>

#include <algorithm>

#include "bench/cluster_scene.h"
#include "bench/raw_cpg.h"

namespace zn {
namespace {

constexpr int kCrowd = 30;  // the slot of the member on host 0, if there were one

std::unique_ptr<Process> join(ClusterScene& scene, int host) {
  auto member = scene.client(host, "crowd", kCrowd + host, "1");
  await("a process is ready", [&] { return scene.slot(kCrowd + host).ready != 0; });
  member->write_line("join 0");
  scene.await_counts(kCrowd + host, kCrowd + host, 1);
  return member;
}

/// A member on each host but the one that is going to die.
ClusterScene::Processes survivors(ClusterScene& scene) {
  ClusterScene::Processes members;
  for (int host = 1; host < scene.spare_host(); host++) members.push_back(join(scene, host));
  return members;
}

/// Until all survivors have been told of so many failures; when the last of them was.
int64_t await_failure(ClusterScene& scene, uint64_t failures) {
  int64_t latest = 0;
  for (int host = 1; host < scene.spare_host(); host++) {
    Slot& slot = scene.slot(kCrowd + host);
    await("a survivor is told", [&] {
      if (slot.ready == 0) throw Failure{"a survivor has lost its session"};
      return slot.failures >= failures;
    });
    latest = std::max(latest, slot.time.load());
  }
  return latest;
}

/// When Corosync has told a process on this host both, of the process group and of the ring.
int64_t noticed(ClusterScene& scene, int host) {
  const int slot = ClusterScene::raw_slot(host);
  return std::max(scene.slot(slot + kViewSlot).time.load(), scene.slot(slot + kQuorumSlot).time.load());
}

double raw_death(ClusterScene& scene) {
  const int host = scene.spare_host();
  const auto others = static_cast<uint64_t>(host - 1);
  const int64_t start = now_ns();
  scene.raw(host).signal(SIGKILL);
  scene.await_raw(1, host - 1, others, static_cast<uint64_t>(scene.nodes()));
  int64_t latest = 0;
  for (int other = 1; other < host; other++) latest = std::max(latest, noticed(scene, other));
  scene.start_raw(host);
  return milliseconds(start, latest);
}

struct HostDeaths {
  std::vector<double> notice, after;  // milliseconds
};

void lose_host(ClusterScene& scene, bool cut, uint64_t failures, HostDeaths* deaths) {
  const int host = scene.spare_host();
  const int64_t start = now_ns();
  if (cut) {
    scene.hosts().cut(host);
  } else {
    scene.hosts().kill_corosync(host);
    scene.hosts().end_daemon(host, SIGKILL);
  }
  await_failure(scene, failures);
  scene.await_raw(1, host - 1, static_cast<uint64_t>(host - 1), static_cast<uint64_t>(host - 1));
  double after = 0;
  int64_t last = 0;
  for (int other = 1; other < host; other++) {
    after = std::max(after, milliseconds(noticed(scene, other), scene.slot(kCrowd + other).time));
    last = std::max(last, noticed(scene, other));
  }
  deaths->after.push_back(after);
  deaths->notice.push_back(milliseconds(start, last));
}

void bring_back(ClusterScene& scene, bool cut) {
  const int host = scene.spare_host();
  if (cut) {
    scene.hosts().forget_log(host);
    scene.hosts().heal();
    const auto all = static_cast<uint64_t>(scene.nodes());
    scene.await_raw(1, scene.nodes(), all, all);
  } else {
    scene.hosts().start_corosync(host);
    scene.start_raw(host);
    scene.hosts().start_daemon(host);
  }
  scene.hosts().await_serving(host);
}

}  // namespace

void deaths_of_daemons(ClusterScene& scene, const ClusterSettings& settings, Figures* figures) {
  const int host = scene.spare_host();
  if (host == 0) return;
  const auto others = survivors(scene);
  std::vector<double> samples, raw;
  for (int i = 1; i <= settings.daemon_deaths; i++) {
    const auto victim = join(scene, host);
    const int64_t start = now_ns();
    scene.hosts().end_daemon(host, SIGKILL);
    samples.push_back(milliseconds(start, await_failure(scene, static_cast<uint64_t>(i))));
    scene.hosts().start_daemon(host);
    raw.push_back(raw_death(scene));
    scene.hosts().await_serving(host);
  }
  figures->add("SIGKILL of a gsd to the last survivor's failure leave, p50", percentile(samples, 0.5), "ms");
  figures->add("  p99 of " + std::to_string(settings.daemon_deaths), percentile(samples, 0.99), "ms", 20);
  figures->add("  raw CPG, the same, p50", percentile(raw, 0.5), "ms");
  figures->add("  p50 over raw CPG", percentile(samples, 0.5) / percentile(raw, 0.5), "x");
}

void deaths_of_hosts(ClusterScene& scene, const ClusterSettings& settings, Figures* figures) {
  const int host = scene.spare_host();
  if (host == 0) return;
  const auto others = survivors(scene);
  HostDeaths killed, cut_off;
  for (int i = 1; i <= settings.host_deaths; i++) {
    const bool cut = i % 2 == 0;
    const auto victim = join(scene, host);
    lose_host(scene, cut, static_cast<uint64_t>(i), cut ? &cut_off : &killed);
    bring_back(scene, cut);
  }
  for (auto* deaths : {&killed, &cut_off}) {
    const std::string what = deaths == &killed ? "host killed" : "host cut off";
    figures->add(
        what + ": failure leave after Corosync's notice, longest of " + std::to_string(deaths->after.size()),
        percentile(deaths->after, 1), "ms", 30);
    figures->add("  p50", percentile(deaths->after, 0.5), "ms");
    figures->add("  Corosync's notice, p50 (by its token time)", percentile(deaths->notice, 0.5), "ms");
  }
}

}  // namespace zn
