// A thousand groups: the memory they take on each host, and how soon a newcomer has them.
#include <signal.h>

#include <algorithm>
#include <functional>

#include "bench/cluster_scene.h"
#include "gscl/GSUtils.h"

namespace zn {
namespace {

constexpr int kMany = 20, kNewcomer = 21;  // slots
constexpr int kGroups = 1000;
constexpr int kStates = (16 << 20) / kBigState;  // 16 MiB
constexpr int64_t kEvery = 5'000'000;            // nanoseconds from one request to the next
constexpr int kAtOnce = 20;                      // before the member of all groups has to catch up

void tell(ClusterScene& scene, Process& many, const char* what, int groups) {
  const Slot& its = scene.slot(kMany);
  uint64_t target = its.count;
  for (int i = 0; i < groups; i++) {
    many.write_line(std::string(what) + " " + std::to_string(i));
    target++;
    if (i % kAtOnce == kAtOnce - 1 || i == groups - 1) scene.await_counts(kMany, kMany, target);
  }
  if (its.errors != 0) throw Failure{std::string("a request was refused: ") + what};
}

/// The most that any gsd has grown by.
void add_memory(ClusterScene& scene, Process& many, Figures* figures) {
  std::vector<double> before;
  for (int host = 1; host <= scene.nodes(); host++) before.push_back(resident_kib(scene.hosts().daemon(host)));
  tell(scene, many, "join", kGroups);
  double most = 0;
  for (int host = 1; host <= scene.nodes(); host++) {
    const double grown = resident_kib(scene.hosts().daemon(host)) - before[static_cast<size_t>(host - 1)];
    most = std::max(most, grown);
  }
  figures->add("memory of gsd for 1,000 idle groups", most, "KiB");
  figures->add("  gsd without", before[0], "KiB");
}

/// Of a client of the host that sends the state.
std::vector<double> requests(ClusterScene& scene, zelt_gscl_V1::GSProvider& member,
                             const std::function<bool(size_t)>& done) {
  char text[] = "unrelated";
  return steadily(
      kEvery,
      [&] {
        const wyx_rc_t rc = member.send_message({sizeof text, text}, WYX_1_PHASE, 0);
        scene.controller().dispatch(WYX_NON_BLOCKING);
        if (rc == WYX_OK) return;
        throw Failure{"an unrelated request was refused: " + std::string(zelt_gscl::gscl_rc_name(rc))};
      },
      done);
}

void add_newcomers(ClusterScene& scene, const ClusterSettings& settings, Figures* figures) {
  const int host = scene.spare_host();
  zelt_gscl_V1::GSProvider member("unrelated", 1, nullptr);
  if (member.joinGroup() != WYX_OK) throw Failure{"no join"};
  std::vector<double> times, quiet, meanwhile;
  for (int i = 0; i < settings.newcomers; i++) {
    scene.hosts().end_daemon(host, SIGTERM);
    const auto before =
        requests(scene, member, [&](size_t n) { return n >= static_cast<size_t>(settings.quiet); });
    const int64_t start = now_ns();
    scene.hosts().start_daemon(host);
    const auto newcomer = scene.client(host, "newcomer", kNewcomer);
    const auto during = requests(scene, member, [&](size_t) { return scene.slot(kNewcomer).ready != 0; });
    times.push_back(milliseconds(start, scene.slot(kNewcomer).time));
    quiet.insert(quiet.end(), before.begin(), before.end());
    meanwhile.insert(meanwhile.end(), during.begin(), during.end());
  }
  member.goodbyeGroup();
  figures->add("newcomer, 1,000 groups with 16 MiB of state, until it serves, longest",
               *std::max_element(times.begin(), times.end()), "ms", 2000);
  figures->add("  p50", percentile(times, 0.5), "ms");
  figures->add("  requests of others meanwhile, p99", percentile(meanwhile, 0.99), "ms");
  figures->add("  over p99 with nothing going on", percentile(meanwhile, 0.99) / percentile(quiet, 0.99), "x", 2);
  figures->add("  longest request meanwhile", percentile(meanwhile, 1), "ms");
}

}  // namespace

void many_groups(ClusterScene& scene, const ClusterSettings& settings, Figures* figures) {
  const auto many = scene.client(1, "everywhere", kMany, std::to_string(kGroups));
  await("a process is ready", [&] { return scene.slot(kMany).ready != 0; });
  add_memory(scene, *many, figures);
  if (scene.spare_host() == 0) return;
  tell(scene, *many, "state", kStates);
  add_newcomers(scene, settings, figures);
}

}  // namespace zn
