// The hosts of the domain as the events have told of them.
#pragma once

#include <map>
#include <set>

#include "engine/digest.h"
#include "engine/types.h"

namespace gs {

struct DomainHost {
  std::uint32_t epoch = 0;
  Adapters adapters;
};

/// A host that nobody has told of is neither here nor gone: its clients are served all the same.
class HostTable {
 public:
  using Hosts = std::map<std::uint32_t, DomainHost>;
  using Notifications = std::vector<DomainNotification>;

  HostTable() = default;
  HostTable(Hosts here, std::set<std::uint32_t> gone, std::uint64_t seqnum)
      : here_(std::move(here)), gone_(std::move(gone)), seqnum_(seqnum) {}

  // Each change has a number above `numbers_above` and those before it; what is to be told of it goes to `told`.
  void come(std::uint32_t node, std::uint64_t numbers_above, Notifications& told);
  void go(std::uint32_t node, std::uint64_t numbers_above, Notifications& told);
  /// Of a host that is not here they are forgotten.
  void set_adapters(const AdaptersEvent& event);

  bool is_gone(std::uint32_t node) const { return gone_.contains(node); }
  DomainView view() const;
  const Hosts& here() const { return here_; }
  const std::set<std::uint32_t>& gone() const { return gone_; }
  std::uint64_t seqnum() const { return seqnum_; }
  void add_to(Digest& digest) const;

 private:
  Hosts here_;
  std::set<std::uint32_t> gone_;
  std::uint64_t seqnum_ = 0;
};

}  // namespace gs
