// gsctl groups: what groups there are.
#include "tools/gsctl/listing.h"
#include "tools/gsctl/reports.h"

namespace gsctl {
namespace {

platform::Row row_of(const inspect::GroupT& group) {
  return {group.name,
          std::to_string(group.members.size()),
          std::to_string(group.subscribers),
          std::to_string(group.waiting),
          size_text(group.state_size),
          std::to_string(group.event_number),
          duration_text(group.age_ms),
          to_text(group.running),
          group.running ? to_text(group.running->missing) : "-"};
}

void groups(gs::inspect::Inspector& inspector, Listing& listing) {
  listing.rows = {{"Group", "Members", "Subscribers", "Waiting", "State", "Event", "Age", "Runs", "Waits for"}};
  for (const auto& group : listing.for_scripts ? inspector.groups() : inspector.groups_in_brief())
    listing.add([&] { return row_of(*group); }, [&] { return to_json(*group); });
}

}  // namespace

Run add_groups(CLI::App& command) {
  auto repetition = std::make_shared<Repetition>();
  add_repetition(command, *repetition);
  return [repetition](const Settings& settings) { return print_listing(settings, *repetition, groups); };
}

}  // namespace gsctl
