#include "engine/hosts.h"

#include <algorithm>

namespace gs {

void HostTable::come(std::uint32_t node, std::uint64_t numbers_above, Notifications& told) {
  gone_.erase(node);
  const auto [at, is_new] = here_.try_emplace(node);
  if (!is_new) return;
  seqnum_ = std::max(seqnum_, numbers_above) + 1;
  at->second.epoch = static_cast<std::uint32_t>(seqnum_);
  const DomainNode added{node, at->second.epoch};
  told.emplace_back(NodesNotification{view().nodes, {added}, {}});
  if (at == here_.begin()) told.emplace_back(MasterNotification{added, static_cast<std::uint32_t>(here_.size())});
}

void HostTable::go(std::uint32_t node, std::uint64_t numbers_above, Notifications& told) {
  gone_.insert(node);
  const auto at = here_.find(node);
  if (at == here_.end()) return;
  const bool was_master = at == here_.begin();
  const DomainNode removed{node, at->second.epoch};
  here_.erase(at);
  seqnum_ = std::max(seqnum_, numbers_above) + 1;
  DomainNodes left = view().nodes;
  const auto size = static_cast<std::uint32_t>(left.size());
  const bool new_master = was_master && size > 0;
  const DomainNode master = new_master ? left.front() : DomainNode{};
  told.emplace_back(NodesNotification{std::move(left), {}, {removed}});
  if (new_master) told.emplace_back(MasterNotification{master, size});
}

void HostTable::set_adapters(const AdaptersEvent& event) {
  const auto at = here_.find(event.node);
  if (at != here_.end()) at->second.adapters = event.adapters;
}

DomainView HostTable::view() const {
  DomainView view{{}, seqnum_};
  for (const auto& [node, host] : here_) view.nodes.push_back({node, host.epoch});
  return view;
}

void HostTable::add_to(Digest& digest) const {
  digest.add(seqnum_);
  for (const std::uint32_t node : gone_) digest.add(node);
  digest.add(here_.size());
  for (const auto& [node, host] : here_) {
    digest.add(node);
    digest.add(host.epoch);
    digest.add(host.adapters.size());
    for (const Adapter& adapter : host.adapters) {
      digest.add(adapter.name);
      for (const std::uint8_t byte : adapter.address) digest.add(byte);
    }
  }
}

}  // namespace gs
