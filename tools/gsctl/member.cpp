#include "tools/gsctl/member.h"

#include <algorithm>
#include <random>

#include "tools/gsctl/text.h"

namespace gsctl {
namespace {

constexpr std::size_t kMaxGroupName = 32;
constexpr int kTries = 100;
constexpr short kMaxInstance = 32767;

short some_instance() {
  static std::random_device source;
  return static_cast<short>(std::uniform_int_distribution<int>(1, kMaxInstance)(source));
}

}  // namespace

wyx_rc_t Member::try_to_join(std::optional<short> instance) {
  wyx_rc_t rc = WYX_DUPLICATE_INSTANCE_NUMBER;
  for (int i = 0; rc == WYX_DUPLICATE_INSTANCE_NUMBER && i < (instance ? 1 : kTries); ++i) {
    setInstanceNumber(instance ? *instance : some_instance());
    rc = joinGroup();
  }
  return rc;
}

void Member::ask_to_join(std::optional<short> instance) {
  const wyx_rc_t rc = try_to_join(instance);
  if (rc == WYX_OK) return;
  throw Error(rc == WYX_NO_INIT ? kLost : kRefused,
              std::string("cannot join group '") + getGroupName() + "': " + explain(rc));
}

bool Member::is_me(const wyx_membership_t* members) {
  return zelt_gscl::gscl_find_membership(members, getId()) >= 0;
}

void Member::asked(const wyx_n_phase_notification_t&) { vote(WYX_VOTE_APPROVE, WYX_NULL_VOTE, nullptr, nullptr); }

void check_group(const std::string& group) {
  if (group.empty()) throw Error(kWrongUse, "GROUP: a name is needed");
  if (group.size() > kMaxGroupName) {
    throw Error(kWrongUse, "GROUP: a name has at most " + std::to_string(kMaxGroupName) + " characters");
  }
}

void require_group(Loop& loop, const std::string& group) {
  Subscription probe(loop, group, WYX_SUBSCRIBE_STATE, [](const auto&) {});
  const wyx_rc_t rc = probe.subscribeGroup();
  if (rc != WYX_OK) {
    throw Error(rc == WYX_NO_INIT ? kLost : kRefused, "group '" + group + "': " + explain(rc));
  }
}

}  // namespace gsctl
