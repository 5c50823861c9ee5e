// What events are ordered for: an engine and the clients of this host.
#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <vector>

#include "engine/snapshot_bytes.h"
#include "engine/types.h"

namespace gs::cluster {

using Node = std::uint32_t;  // 1 to 32767; 0 too where there is one host

/// The serving hosts as a client may know them.
struct Domain {
  Node self = 0;
  std::vector<Node> nodes;           // ascending; the first is the master
  std::size_t rank = 0;              // of this one: who is to order first what all are to order
  std::uint64_t sessions_above = 0;  // numbers that no earlier session of this node has
};

class Replica {
 public:
  virtual ~Replica() = default;
  /// The next event in order.
  virtual void apply(const Event& event) = 0;
  /// Of the state now. Empty: it is more than a snapshot can hold.
  virtual SnapshotBytes snapshot() = 0;
  /// Becomes what the snapshot is of. False: `error` says why it does not fit, and nothing has changed.
  virtual bool restore(const SnapshotBytes& snapshot, std::string* error) = 0;
  /// Clients may come, or the domain has changed.
  virtual void serve(const Domain& domain) = 0;
  /// Who waits to be a client waits in vain.
  virtual void wait_no_more() {}
  /// All clients end, and none may come; the state stays.
  virtual void drop_clients(const std::string& why) = 0;
  /// The same, and the state is empty again.
  virtual void reset(const std::string& why) = 0;
};

}  // namespace gs::cluster
