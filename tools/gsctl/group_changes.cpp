#include "tools/gsctl/group_changes.h"

#include <algorithm>
#include <utility>

namespace gsctl {
namespace {

constexpr auto kPause = std::chrono::milliseconds(200);  // until a daemon is looked for again
constexpr auto kPatience = std::chrono::seconds(1);      // of connecting, and of each answer

Change change_of(const inspect::HappeningT& h, const std::string& what) {
  const WallTime time{std::chrono::microseconds(h.time_us)};
  return {h.group, what, h.event_number, {}, "", std::nullopt, std::nullopt, time};
}

}  // namespace

GroupChanges::GroupChanges(Loop& loop, std::vector<std::string> groups, Say say)
    : loop_(loop), groups_(std::move(groups)), say_(std::move(say)) {}

void GroupChanges::begin() {
  connect();
  catch_up();
}

void GroupChanges::connect() {
  gs::inspect::Inspector inspector(daemon_path(), kPatience);
  if (!inspector.daemon().serving) throw Error(kNoDaemon, "the daemon does not serve: see gsctl status");
  tap_.emplace(daemon_path(), kPatience);
  tap_->tap(groups_, true, {inspect::Kind::Approved});
  readable_ = loop_.on_readable(tap_->fd(), [this] { receive(); });
}

/// What the tap still brings of what is known by then is left out.
void GroupChanges::catch_up() {
  gs::inspect::Inspector inspector(daemon_path(), kPatience);
  auto before = std::exchange(known_, {});
  for (const auto& group : inspector.groups(groups_, true)) {
    before.erase(group->name);
    const Known& known = known_[group->name] = {members_of(group->members), group->event_number};
    Change now{group->name, "now", known.event, {}, "", known.members, std::nullopt};
    if (group->state.size() == group->state_size) now.bytes = group->state;  // else it is not for this user
    say_(now);
  }
  for (const auto& [name, known] : before) say_({name, "ended", {}, {}, "", {}, {}});
}

void GroupChanges::receive() {
  or_lost([this] {
    while (const auto report = tap_->next()) take(*report);
  });
}

void GroupChanges::or_lost(const std::function<void()>& what) {
  try {
    what();
  } catch (const gs::inspect::InspectError&) {
    readable_.reset();
    tap_.reset();
    say_of_daemon("lost", "the daemon is gone");
    come_back();
  }
}

void GroupChanges::come_back() {
  time_ = loop_.after(kPause, [this] {
    try {
      connect();
    } catch (const std::runtime_error&) {  // not there yet, or does not serve yet
      return come_back();
    }
    say_of_daemon("found", "the daemon is back");
    or_lost([this] { catch_up(); });
  });
}

void GroupChanges::say_of_daemon(const std::string& what, const std::string& why) {
  for (const std::string& group : groups_) say_({group, what, {}, {}, why, {}, {}});
  if (groups_.empty()) say_({"*", what, {}, {}, why, {}, {}});
}

void GroupChanges::take(const inspect::ReportT& report) {
  if (report.missed > 0) {
    say_of_daemon("missed", std::to_string(report.missed) + " changes");
    catch_up();
  }
  for (const auto& happening : report.happenings) take(*happening);
}

void GroupChanges::take(const inspect::HappeningT& h) {
  if (h.kind != inspect::Kind::Approved) return;
  Known& known = known_[h.group];
  if (h.event_number <= known.event) return;
  known.event = h.event_number;
  if (h.protocol == "join") {
    Change joined = change_of(h, "joined");
    joined.who = members_of(h.changing);
    known.members.insert(known.members.end(), joined.who.begin(), joined.who.end());
    joined.members = known.members;
    say_(joined);
  } else if (is_departure(h.protocol)) {
    departed(h, known, change_of(h, "left"));
  } else if (h.protocol == "attributes") {
    Change attributes = change_of(h, "attributes");
    if (h.who) attributes.who = {provider_of(*h.who)};
    say_(attributes);
  }
  const bool ended = is_departure(h.protocol) && h.members == 0;
  if (h.state_changed && !ended) {
    Change state = change_of(h, "state");
    if (h.who) state.who = {provider_of(*h.who)};
    if (h.state.size() == h.state_size) state.bytes = h.state;
    say_(state);
  }
  if (!ended) return;
  say_(change_of(h, "ended"));
  known_.erase(h.group);
}

/// A line for each reason.
void GroupChanges::departed(const inspect::HappeningT& h, Known& known, Change change) {
  const Members who = members_of(h.changing);
  std::erase_if(known.members,
                [&](const auto& member) { return std::find(who.begin(), who.end(), member) != who.end(); });
  change.members = known.members;
  for (std::size_t i = 0; i < who.size(); ++i) {
    const std::string why = leave_reason(i < h.leave_codes.size() ? h.leave_codes[i] : 0);
    if (!change.who.empty() && why != change.why) {
      say_(change);
      change.who.clear();
    }
    change.why = why;
    change.who.push_back(who[i]);
  }
  say_(change);
}

}  // namespace gsctl
