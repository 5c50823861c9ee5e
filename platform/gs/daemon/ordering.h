// Gives events the one order in which every replica of the engine is given them.
#pragma once

#include <functional>

#include "engine/types.h"

namespace gs::daemon {

class Ordering {
 public:
  /// Called with each event in order, its own and those of other nodes; never from inside another call of itself.
  using Sink = std::function<void(const Event&)>;

  virtual ~Ordering() = default;
  /// Once, before the first submit.
  virtual void start(Sink sink) = 0;
  /// Has `event` ordered: the sink gets it now or later.
  virtual void submit(Event event) = 0;
};

}  // namespace gs::daemon
