#include "tools/gsctl/all_changes.h"

#include <algorithm>
#include <utility>

#include "tools/gsctl/reports.h"

namespace gsctl {
namespace {

constexpr char kAll[] = "*";                             // in the place of a group: what is about all of them
constexpr auto kPause = std::chrono::milliseconds(200);  // until a daemon is looked for again
constexpr auto kPatience = std::chrono::seconds(1);      // of connecting

/// As leave_reason says it of the library's codes.
std::string reason_of(const std::vector<std::string>& codes) {
  constexpr std::pair<const char*, const char*> kReasons[] = {{"expelled", "expelled"},
                                                              {"goodbye", "said_goodbye"},
                                                              {"host", "host_failed"},
                                                              {"died", "failed"},
                                                              {"voluntary", "left"}};
  for (const auto& [code, reason] : kReasons) {
    if (std::find(codes.begin(), codes.end(), code) != codes.end()) return reason;
  }
  return "gone";
}

}  // namespace

AllChanges::AllChanges(Loop& loop, Say say) : loop_(loop), say_(std::move(say)) { connect(); }

void AllChanges::connect() {
  tap_.emplace(daemon_path(), kPatience);
  tap_->tap({}, true);
  readable_ = loop_.on_readable(tap_->fd(), [this] { receive(); });
}

void AllChanges::receive() {
  try {
    while (const auto report = tap_->next()) take(*report);
  } catch (const gs::inspect::InspectError& error) {
    readable_.reset();
    tap_.reset();
    say_({kAll, "lost", {}, {}, "the daemon is gone", {}, {}});
    come_back();
  }
}

void AllChanges::come_back() {
  time_ = loop_.after(kPause, [this] {
    try {
      connect();
      say_({kAll, "found", {}, {}, "the daemon is back", {}, {}});
    } catch (const gs::inspect::InspectError&) {
      come_back();
    }
  });
}

void AllChanges::take(const gs::inspect::ReportT& report) {
  if (report.missed > 0) say_({kAll, "missed", {}, {}, std::to_string(report.missed) + " happenings", {}, {}});
  for (const auto& happening : report.happenings) take(*happening);
}

void AllChanges::take(const inspect::HappeningT& h) {
  if (h.kind != inspect::Kind::Approved) return;
  Change change{h.group, "", h.event_number, members_of(h.changing), "", {}, {}};
  if (h.protocol == "join") {
    change.what = "joined";
    say_(change);
  } else if (is_departure(h.protocol)) {
    change.what = "left";
    change.why = reason_of(h.codes);
    say_(change);
  }
  const bool ended = is_departure(h.protocol) && h.members == 0;
  if (h.state_changed && !ended) {
    Change state{h.group, "state", h.event_number, {}, "", {}, {}};
    if (h.who) state.who = {provider_of(*h.who)};
    if (h.state.size() == h.state_size) state.bytes = h.state;  // else it is not for this user
    say_(state);
  }
  if (ended) say_({h.group, "ended", h.event_number, {}, "", {}, {}});
}

}  // namespace gsctl
