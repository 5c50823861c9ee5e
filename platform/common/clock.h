// Time as the daemons' loops count it.
#pragma once

#include <chrono>

namespace platform {

using Duration = std::chrono::milliseconds;
using Time = Duration;  // since a moment of the clock's own; never goes back

inline Time now() { return std::chrono::duration_cast<Time>(std::chrono::steady_clock::now().time_since_epoch()); }

}  // namespace platform
