// What a command is to the rest of gsctl.
#pragma once

#include <CLI/CLI.hpp>
#include <functional>
#include <optional>
#include <span>
#include <string>

#include "tools/gsctl/status.h"

namespace gsctl {

/// The options that every command takes, before or after its name.
struct Settings {
  bool json = false;
  std::string endpoint;           // as GSD_ENDPOINT has it; empty: the environment's
  std::optional<double> timeout;  // seconds; none: no limit
};

/// Does the work and gives the exit status. Throws Error.
using Run = std::function<int(const Settings&)>;

/// Adds a command's options and arguments to `command`, which has its name and one line of help already. The
/// result owns what they are read into. (CLI11 keeps references into it: make it a shared pointer.)
using Add = Run (*)(CLI::App& command);

struct Command {
  const char* name;
  const char* help;
  Add add;
};

/// All there are, in the order of --help.
std::span<const Command> commands();

// Each in the file of its name.
Run add_expel(CLI::App& command);
Run add_get(CLI::App& command);
Run add_join(CLI::App& command);
Run add_lead(CLI::App& command);
Run add_lock(CLI::App& command);
Run add_send(CLI::App& command);
Run add_set(CLI::App& command);
Run add_wait(CLI::App& command);
Run add_watch(CLI::App& command);

// Those that look.
Run add_chart(CLI::App& command);
Run add_groups(CLI::App& command);
Run add_members(CLI::App& command);
Run add_nodes(CLI::App& command);
Run add_record(CLI::App& command);
Run add_sessions(CLI::App& command);
Run add_stats(CLI::App& command);
Run add_status(CLI::App& command);  // in daemon_status.cpp
Run add_top(CLI::App& command);

}  // namespace gsctl
