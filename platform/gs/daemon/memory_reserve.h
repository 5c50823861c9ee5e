// Memory for the moment in which there is no more, so that what the daemon is about can be finished.
#pragma once

namespace gs::daemon::memory_reserve {

/// An allocation that finds no memory from now on takes the reserve before it fails.
void hold();
/// It has been taken: little is left.
bool taken();
/// Sets it aside again. False: there is no memory for it.
bool refill();

}  // namespace gs::daemon::memory_reserve
