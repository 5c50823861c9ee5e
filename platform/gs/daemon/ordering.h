// Gives events the one order in which every replica of the engine is given them.
#pragma once

#include "cluster/replica.h"

namespace gs::daemon {

using cluster::Domain;
using cluster::Node;
using cluster::Replica;

class Ordering {
 public:
  virtual ~Ordering() = default;
  /// Once, before anything else. Tells `replica` when it serves, now or later, and then whatever is ordered, its
  /// own events and those of other nodes; never from inside another such call.
  virtual void start(Replica& replica) = 0;
  /// Has `event` ordered: the replica gets it now or later, unless it stops to serve before.
  virtual void submit(Event event) = 0;
  /// The replica's state cannot be relied on any more.
  virtual void fail(const std::string& why) = 0;
  /// While it does not serve: that is only a matter of time.
  virtual bool will_serve() const = 0;
  /// For more that keeps memory until it is ordered.
  virtual bool has_room() const { return true; }
};

}  // namespace gs::daemon
