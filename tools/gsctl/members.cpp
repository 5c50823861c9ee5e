// gsctl members: who is in a group.
#include "tools/gsctl/listing.h"
#include "tools/gsctl/member.h"
#include "tools/gsctl/reports.h"

namespace gsctl {
namespace {

struct Options {
  std::string group;
  Repetition repetition;
};

using Voters = std::vector<std::unique_ptr<inspect::VoterT>>;

bool has(const Voters& voters, const std::unique_ptr<inspect::Id>& id) {
  const auto is_it = [&](const auto& voter) { return voter->id && id && same(*voter->id, *id); };
  return std::any_of(voters.begin(), voters.end(), is_it);
}

/// In the protocol that runs: "voted" or "missing"; "-": it is not asked.
std::string vote_of(const inspect::GroupT& group, const inspect::MemberT& member) {
  if (!group.running) return "-";
  if (has(group.running->missing, member.id)) return "missing";
  return has(group.running->voted, member.id) ? "voted" : "-";
}

void add(Listing& listing, const inspect::GroupT& group, const inspect::MemberT& member) {
  const std::string vote = vote_of(group, member);
  const inspect::ProcessT* process = member.process.get();
  const auto row = [&]() -> platform::Row {
    return {to_text(member.id),
            member.name.empty() ? "-" : member.name,
            member.state,
            process ? process->program : "-",
            process ? std::to_string(process->pid) : "-",
            process ? user_text(process->uid) : "-",
            duration_text(member.age_ms),
            vote,
            member.responsive ? "yes" : "no"};
  };
  listing.add(row, [&] {
    Json object = to_json(member);
    object["vote"] = vote == "-" ? Json(nullptr) : Json(vote);
    return object;
  });
}

void members(gs::inspect::Inspector& inspector, const std::string& name, Listing& listing) {
  const auto group = inspector.groups({name});
  if (group.empty()) {
    throw Error(kRefused, "there is no group '" + name + "': gsctl groups lists those that there are");
  }
  listing.rows = {{"Member", "Name", "State", "Program", "PID", "User", "Age", "Vote", "Responsive"}};
  for (const auto& member : inspector.members(name)) add(listing, *group.front(), *member);
}

}  // namespace

Run add_members(CLI::App& command) {
  auto options = std::make_shared<Options>();
  command.add_option("GROUP", options->group, "Its name")->type_name("")->required();
  add_repetition(command, options->repetition);
  return [options](const Settings& settings) {
    check_group(options->group);
    return print_listing(settings, options->repetition, [&](gs::inspect::Inspector& inspector, Listing& listing) {
      members(inspector, options->group, listing);
    });
  };
}

}  // namespace gsctl
