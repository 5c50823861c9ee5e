// gsctl groups: what groups there are.
#include "tools/gsctl/listing.h"
#include "tools/gsctl/reports.h"

namespace gsctl {
namespace {

Listing groups(gs::inspect::Inspector& inspector) {
  Listing listing;
  listing.rows = {{"Group", "Members", "Subscribers", "Waiting", "State", "Event", "Age", "Runs", "Waits for"}};
  for (const auto& group : inspector.groups()) {
    listing.rows.push_back({group->name, std::to_string(group->members.size()), std::to_string(group->subscribers),
                            std::to_string(group->waiting), size_text(group->state_size),
                            std::to_string(group->event_number), duration_text(group->age_ms),
                            to_text(group->running), group->running ? to_text(group->running->missing) : "-"});
    listing.objects.push_back(to_json(*group));
  }
  return listing;
}

}  // namespace

Run add_groups(CLI::App& command) {
  auto repetition = std::make_shared<Repetition>();
  add_repetition(command, *repetition);
  return [repetition](const Settings& settings) { return print_listing(settings, *repetition, groups); };
}

}  // namespace gsctl
