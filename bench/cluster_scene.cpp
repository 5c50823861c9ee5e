#include "bench/cluster_scene.h"

#include <algorithm>
#include <cstdlib>

#include "bench/raw_cpg.h"

namespace zn {

ClusterScene::ClusterScene(const std::string& script, int nodes, const std::string& delivery)
    : hosts_(script, nodes, delivery), bound_(delivery == "agreed" ? 1.3 : 2) {
  if (!board_.ok()) throw Failure{"no shared board"};
  raw_.resize(static_cast<size_t>(nodes) + 1);
  for (int host = 1; host <= nodes; host++) start_raw(host);
  ::setenv("GSD_ENDPOINT", hosts_.endpoint(1).c_str(), 1);
  if (controller_.initialize() != WYX_OK) throw Failure{"no session"};
}

std::unique_ptr<Process> ClusterScene::client(int host, const std::string& role, int number,
                                              const std::string& more) {
  Slot& its = slot(number);
  its.count = its.digest = its.errors = its.failures = its.ready = 0;
  return hosts_.client(host, role, number, more);
}

ClusterScene::Processes ClusterScene::members(int first, int last, const std::string& group) {
  Processes members;
  for (int i = first; i <= last; i++) {
    members.push_back(client(std::min(i - first + 1, nodes()), "member", i, group));
    await("a member has joined", [&] { return slot(i).ready != 0; });
  }
  return members;
}

int ClusterScene::raw_slot(int host) { return 100 + host; }

void ClusterScene::start_raw(int host) {
  for (const int its : {kViewSlot, kQuorumSlot}) slot(raw_slot(host) + its).seqnum = 0;
  raw_[static_cast<size_t>(host)] = hosts_.on_host(host, "raw", raw_slot(host));
  const auto there = std::count_if(raw_.begin(), raw_.end(), [](const auto& raw) { return raw != nullptr; });
  await_raw(1, static_cast<int>(there), static_cast<uint64_t>(there), static_cast<uint64_t>(nodes()));
}

void ClusterScene::await_raw(int first_host, int last_host, uint64_t members, uint64_t ring) {
  for (int host = first_host; host <= last_host; host++) {
    await("Corosync tells of its members", [&] {
      return slot(raw_slot(host) + kViewSlot).seqnum.load(std::memory_order_acquire) == members &&
             slot(raw_slot(host) + kQuorumSlot).seqnum.load(std::memory_order_acquire) == ring;
    });
  }
}

}  // namespace zn
