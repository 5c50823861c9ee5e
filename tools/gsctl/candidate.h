// What lead and lock have in common: to stand for election in a group, and to run CMD while this member leads.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "tools/gsctl/command.h"

namespace gsctl {

struct Candidacy {
  std::string group;
  std::string name;  // empty: CMD's
  std::vector<std::string> command;
  double grace = 10;                         // seconds from SIGTERM to SIGKILL
  std::optional<unsigned short> responsive;  // seconds after which the group is rid of a candidate that hangs
  bool restart = false;                      // stands on, whatever ends CMD or its lead
};

void add_candidacy_options(CLI::App& command, Candidacy& candidacy);

/// Gives CMD's status, or why it did not run to its end.
int stand(const Candidacy& candidacy, const Settings& settings);

}  // namespace gsctl
