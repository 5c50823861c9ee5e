// Groups over several hosts with a Corosync each, set against its bare process groups between the same hosts in
// the same run. Started inside scripts/cluster.sh, by scripts/cluster_bench.sh.
//
//   cluster --script=CLUSTER.SH --nodes=N --delivery=safe|agreed [--quick] [--benchmark_out=FILE]
#include <cstdio>
#include <cstdlib>

#include "bench/cluster_scene.h"
#include "bench/raw_cpg.h"

int main(int argc, char** argv) {
  const std::string role = zn::option(argc, argv, "role");
  if (role == "raw" && argc == 4) {
    zn::Board board(argv[2]);
    return board.ok() ? zn::run_raw_cpg(board, std::atoi(argv[3])) : 2;
  }
  if (!role.empty()) return zn::run_role(role, argc - 2, argv + 2);

  const std::string script = zn::option(argc, argv, "script");
  if (script.empty()) {
    std::fprintf(stderr, "cluster: needs hosts around it: start scripts/cluster_bench.sh\n");
    return 2;
  }
  zn::catch_interrupts();
  zn::print_host();
  const zn::ClusterSettings settings =
      zn::flag(argc, argv, "quick") ? zn::ClusterSettings::quick() : zn::ClusterSettings{};
  const int nodes = std::atoi(zn::option(argc, argv, "nodes").c_str());
  const std::string delivery = zn::option(argc, argv, "delivery");
  std::printf("settings: %d hosts, %s, %d x %d samples of each latency, %d messages a sender, %d deaths of gsd\n",
              nodes, delivery.c_str(), settings.rounds, settings.samples, settings.messages,
              settings.daemon_deaths);
  try {
    zn::ClusterScene scene(script, nodes, delivery);
    zn::Figures figures;
    zn::many_groups(scene, settings, &figures);
    zn::agreement(scene, settings, &figures);
    zn::throughput(scene, settings, &figures);
    zn::deaths_of_daemons(scene, settings, &figures);
    zn::deaths_of_hosts(scene, settings, &figures);
    figures.print();
    return figures.write_json(zn::option(argc, argv, "benchmark_out")) ? 0 : 1;
  } catch (const zn::Failure& failure) {
    std::fprintf(stderr, "cluster: %s\n", failure.text.c_str());
    zn::Hosts::print_logs(nodes);
    return 1;
  }
}
