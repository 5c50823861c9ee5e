#include "tools/gsctl/group_facts.h"

#include <poll.h>

#include <algorithm>
#include <array>

#include "common/clock.h"
#include "tools/gsctl/inspection.h"

namespace gsctl {
namespace {

using gs::inspect::Inspector;
using platform::Time;

constexpr std::chrono::milliseconds kPatience(500);

wyx_num_phases_t phases_from(const std::string& name) { return name == "n" ? WYX_N_PHASE : WYX_1_PHASE; }

wyx_vote_value_t vote_from(const std::string& name) {
  if (name == "approve") return WYX_VOTE_APPROVE;
  return name == "reject" ? WYX_VOTE_REJECT : WYX_NULL_VOTE;
}

wyx_merge_ctrl_t merge_from(const std::string& name) {
  constexpr std::array<std::string_view, 5> kNames = {"dissolve", "larger", "smaller", "dont-care", "any-order"};
  const auto found = std::find(kNames.begin(), kNames.end(), name);
  return found == kNames.end() ? WYX_DISSOLVE_MERGE : static_cast<wyx_merge_ctrl_t>(found - kNames.begin());
}

bool readable(int fd, Time until) {
  pollfd wanted{fd, POLLIN, 0};
  const auto left = until - platform::now();
  return left.count() > 0 && poll(&wanted, 1, static_cast<int>(left.count())) == 1;
}

}  // namespace

bool take_attributes(zelt_gscl_V1::GSProvider& provider) try {
  const auto groups = Inspector(daemon_path(), kPatience).groups({provider.getGroupName()});
  if (groups.empty() || !groups.front()->attributes) return false;
  const gs::inspect::AttributesT& from = *groups.front()->attributes;
  wyx_group_attributes_t attributes{};
  provider.getGroupAttributes(&attributes);
  attributes.gs_client_version = from.client_version;
  attributes.gs_batch_control = static_cast<wyx_batch_ctrl_t>(from.batch_control);
  attributes.gs_num_phases = phases_from(from.num_phases);
  attributes.gs_source_reflection_num_phases = phases_from(from.source_reflection_num_phases);
  attributes.gs_group_default_vote = vote_from(from.default_vote);
  attributes.gs_merge_control = merge_from(from.merge_control);
  attributes.gs_time_limit = from.time_limit;
  attributes.gs_source_reflection_time_limit = from.source_reflection_time_limit;
  provider.setGroupAttributes(&attributes);
  return true;
} catch (const std::runtime_error&) {
  return false;
}

VoteWatch::VoteWatch(const std::string& group) noexcept {
  try {
    auto tap = std::make_unique<Inspector>(daemon_path(), kPatience);
    tap->tap({group});
    tap_ = std::move(tap);
  } catch (const std::exception&) {
    tap_.reset();  // the outcome can be told without it
  }
}

VoteWatch::~VoteWatch() = default;

std::vector<Rejecter> VoteWatch::rejecters(std::uint64_t event) noexcept try {
  return tap_ ? look_for(event) : std::vector<Rejecter>();
} catch (const std::exception&) {
  return {};
}

std::vector<Rejecter> VoteWatch::look_for(std::uint64_t event) {
  using gs::inspect::Kind;
  std::vector<Rejecter> found;
  const Time until = platform::now() + kPatience;
  for (;;) {
    const auto report = tap_->next();
    if (!report && !readable(tap_->fd(), until)) return {};
    if (!report) continue;
    for (const auto& happening : report->happenings) {
      if (happening->kind == Kind::Begin || happening->kind == Kind::Phase) found.clear();
      if (happening->kind == Kind::Vote && happening->what == "reject" && happening->who) {
        found.push_back({{{happening->who->instance(), happening->who->node()}}, happening->name});
      }
      if (happening->kind == Kind::Rejected && happening->event_number == event) return found;
    }
  }
}

}  // namespace gsctl
