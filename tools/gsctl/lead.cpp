// gsctl lead and gsctl lock: run a program in the one place that leads a group.
#include "tools/gsctl/candidate.h"

namespace gsctl {
namespace {

Run add(CLI::App& command, const std::shared_ptr<Candidacy>& candidacy) {
  add_candidacy_options(command, *candidacy);
  return [candidacy](const Settings& settings) { return stand(*candidacy, settings); };
}

}  // namespace

Run add_lead(CLI::App& command) {
  auto candidacy = std::make_shared<Candidacy>();
  command.add_flag("--restart", candidacy->restart, "Stand on, whatever ended CMD or its lead, and run CMD again");
  return add(command, candidacy);
}

Run add_lock(CLI::App& command) { return add(command, std::make_shared<Candidacy>()); }

}  // namespace gsctl
