// gsctl watch: a line, and if wanted a program, for each change of groups.
#include "tools/gsctl/command.h"
#include "tools/gsctl/group_changes.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/session.h"

namespace gsctl {
namespace {

struct Options {
  std::vector<std::string> groups;
  std::string command;
};

/// Until interrupted.
int watch(const Options& options, const Settings& settings) {
  check_groups(options.groups, "or none, for all");
  Loop loop;
  JobQueue jobs(loop);
  GroupChanges changes(loop, options.groups, [&](const Change& change) {
    print(change, settings.json);
    if (!options.command.empty()) jobs.add(job_of(change, options.command));
  });
  const auto reader = when_unread(loop, [] { throw OutputGone(); });
  const auto interrupts = on_interrupt(loop, [&](int) { loop.stop(); });
  const auto limit = end_in_time(loop, settings, "watched for as long as --timeout says");
  changes.begin();
  loop.run();
  return kDone;
}

}  // namespace

Run add_watch(CLI::App& command) {
  auto options = std::make_shared<Options>();
  command.add_option("GROUP", options->groups, "Their names; they need not be there yet. None: all there are")
      ->type_name("");
  command.add_option("--exec", options->command, "Run this by the shell for each change, one after the other")
      ->type_name("CMD");
  return [options](const Settings& settings) { return watch(*options, settings); };
}

}  // namespace gsctl
