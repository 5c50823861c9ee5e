// An event of the loop that goes with its owner, and before the descriptor that it watches.
#pragma once

#include <event2/event.h>

#include <memory>

namespace platform {

struct FreeEvent {
  void operator()(event* e) const { event_free(e); }
};
using EventPtr = std::unique_ptr<event, FreeEvent>;

}  // namespace platform
