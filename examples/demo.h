// The acts of the demonstration, and how they print. Each act throws Failure when anything is not as it must be.
#pragma once

#include <string>

#include "examples/processes.h"

namespace zn {

constexpr auto kStepLimit = std::chrono::seconds(20);  // a bound on a hang; a step takes milliseconds

/// Processes join a group, vote, talk, are watched and die.
void demo_group();

/// The master runs daemons and an operator asks them, with namespaces of its own around all of it. Says why and
/// comes back where it may not have those.
void demo_master();

/// Groups over three hosts, which are namespaces of this machine. Says why and comes back where they cannot be
/// had.
void demo_cluster();

/// First argument of the demonstration when it is to run demo_inside or demo_hosts; the second is the folder.
inline constexpr const char* kInside = "--inside";
inline constexpr const char* kOnHosts = "--on-hosts";

/// The part of demo_master that runs inside of the namespaces, as process 1. `folder` is for its files.
void demo_inside(const std::string& folder);

/// The part of demo_cluster that runs where the hosts are. `folder` is for its files.
void demo_hosts(const std::string& folder);

/// Says why an act that needs processes apart from all others is skipped: in a chroot because of that, elsewhere
/// `why`.
void say_skipped(const std::string& why);

/// Prints what a part says, to its end.
void relay(Process& part, Clock::time_point deadline);

/// In the environment: the output is relayed to a terminal.
inline constexpr const char* kColoured = "ZN_DEMO_COLOURED";

/// What switches a colour of the terminal on and off; empty where the output is no terminal or NO_COLOR is set.
const char* colour(const char* code);
const char* colour_off();

}  // namespace zn
