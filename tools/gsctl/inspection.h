// Asking the daemon about itself, on the side of the commands that look.
#pragma once

#include "inspect/inspector.h"
#include "tools/gsctl/command.h"
#include "tools/gsctl/status.h"

namespace gsctl {

/// Of the daemon's socket. Throws Error: the environment names none.
std::string daemon_path();

/// Connects; --timeout is the limit of each answer. Throws Error or InspectError.
gs::inspect::Inspector connected(const Settings& settings);

/// Throws Error: one is no name of a group, or there are more than can be asked for; what to do then is said.
void check_groups(const std::vector<std::string>& groups, const std::string& instead);

/// How a command ends that did not catch it.
Error explained(const gs::inspect::InspectError& error);

}  // namespace gsctl
