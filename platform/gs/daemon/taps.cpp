#include "daemon/taps.h"

#include <algorithm>
#include <chrono>

#include "daemon/inspection.h"
#include "engine/text.h"
#include "gscl/GSUtils.h"

namespace gs::daemon {
namespace {

using Kind = Happening::Kind;

std::string what_of(const Happening& happening) {
  if (happening.kind == Kind::kRequest) return zelt_gscl::gscl_rc_name(happening.rc);
  if (happening.kind != Kind::kVote && happening.kind != Kind::kDefaultVote) return "";
  if (happening.vote == WYX_VOTE_APPROVE) return "approve";
  return happening.vote == WYX_VOTE_REJECT ? "reject" : "continue";
}

/// Each once: those of the summary, then why members leave.
std::vector<std::string> codes_of(const Happening& happening) {
  std::vector<std::string> codes = names_of_summary(happening.summary);
  std::uint32_t leave = happening.leave_code;
  if (happening.leave_codes)
    for (const LeaveCode& code : *happening.leave_codes) leave |= code.voluntary_or_failure;
  for (std::string& name : names_of_leave_code(leave)) codes.push_back(std::move(name));
  return codes;
}

std::uint32_t bit_of(inspect::Kind kind) { return std::uint32_t{1} << static_cast<unsigned>(kind); }

void add_value(const SharedBytes& value, bool contents, std::uint64_t& size, std::string& bytes) {
  if (!value) return;
  size = value->size();
  if (contents) bytes = *value;
}

}  // namespace

void Taps::add(ConnectionId id, const inspect::AskT& wanted) {
  Tap& tap = taps_[id];
  tap.groups.insert(wanted.groups.begin(), wanted.groups.end());
  for (const inspect::Kind kind : wanted.kinds)
    if (kind <= inspect::Kind::MAX) tap.kinds |= bit_of(kind);
  tap.contents = wanted.contents;
}

bool Taps::Tap::wants(const Happening& happening) const {
  if (kinds != 0 && (kinds & bit_of(static_cast<inspect::Kind>(happening.kind))) == 0) return false;
  return groups.empty() || groups.contains(happening.group);
}

Taps::Noted::Noted(const Happening& from) : happening(from), group(from.group), name(from.name) {
  happening.group = happening.name = {};  // the caller's
}

std::unique_ptr<inspect::HappeningT> Taps::told(const Noted& noted, bool contents) {
  const Happening& from = noted.happening;
  auto to = std::make_unique<inspect::HappeningT>();
  to->kind = static_cast<inspect::Kind>(from.kind);
  to->time_us = std::chrono::duration_cast<std::chrono::microseconds>(noted.time.time_since_epoch()).count();
  to->group = noted.group;
  to->protocol = from.protocol;
  to->number = from.number;
  to->phase = from.phase;
  to->n_phase = from.n_phase;
  to->event_number = from.event_number;
  if (from.who) to->who = std::make_unique<inspect::Id>(id_of(*from.who));
  to->name = noted.name;
  to->what = what_of(from);
  to->codes = codes_of(from);
  to->changing = ids_of(from.changing);
  if (from.leave_codes)
    for (const LeaveCode& code : *from.leave_codes) to->leave_codes.push_back(code.voluntary_or_failure);
  if (from.members) to->members = static_cast<std::uint32_t>(from.members->size());
  to->voters = static_cast<std::uint32_t>(from.voters);
  add_value(from.state, contents, to->state_size, to->state);
  add_value(from.message, contents, to->message_size, to->message);
  to->state_changed = from.state_changed;
  to->session = from.session.number;
  to->node = from.session.node;
  return to;
}

void Taps::happened(const Happening& happening) {
  for (auto& [id, tap] : taps_) {
    if (!tap.wants(happening)) continue;
    try {
      if (tap.missing == 0 && tap.noted.size() < kMostNoted) {
        tap.noted.emplace_back(happening);
        continue;
      }
    } catch (const std::bad_alloc&) {  // it is missed
    }
    ++tap.missing;
  }
}

bool Taps::waiting() const {
  return std::ranges::any_of(taps_, [](const auto& tap) {
    return !tap.second.noted.empty() || tap.second.missed + tap.second.missing != 0;
  });
}

std::vector<ConnectionId> Taps::ids() const {
  std::vector<ConnectionId> ids;
  for (const auto& [id, tap] : taps_) ids.push_back(id);
  return ids;
}

inspect::ReportT Taps::take(ConnectionId id) {
  inspect::ReportT report;
  const auto found = taps_.find(id);
  if (found == taps_.end()) return report;
  Tap& tap = found->second;
  report.missed = std::exchange(tap.missed, 0);
  std::size_t bytes = 0;
  auto last = tap.noted.begin();
  for (; last != tap.noted.end() && bytes < kAtOnce; ++last) {
    report.happenings.push_back(told(*last, tap.contents));
    const inspect::HappeningT& happening = *report.happenings.back();
    bytes += sizeof happening + happening.state.size() + happening.message.size();
  }
  tap.noted.erase(tap.noted.begin(), last);
  if (tap.noted.empty()) tap.missed = std::exchange(tap.missing, 0);
  return report;
}

std::uint64_t Taps::drop(ConnectionId id) {
  const auto found = taps_.find(id);
  if (found == taps_.end()) return 0;
  Tap& tap = found->second;
  const std::uint64_t more = tap.noted.size() + std::exchange(tap.missing, 0);
  tap.missed += more;
  tap.noted.clear();
  return more;
}

}  // namespace gs::daemon
