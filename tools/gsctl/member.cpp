#include "tools/gsctl/member.h"

#include <algorithm>
#include <random>

#include "tools/gsctl/group_facts.h"
#include "tools/gsctl/text.h"

namespace gsctl {
namespace {

constexpr int kTries = 100;
constexpr std::size_t kMaxName = 256;  // characters, as the daemon counts them

/// The small numbers are for people who choose one.
short some_instance() {
  static std::random_device source;
  return static_cast<short>(std::uniform_int_distribution<int>(1000, 32767)(source));
}

}  // namespace

Member::Member(Loop& loop, const std::string& group, const std::string& name)
    : GSProvider(group.c_str(), 0, name.c_str()), loop_(loop) {
  if (name.size() > kMaxName)
    throw Error(kWrongUse, "--name: a name has at most " + std::to_string(kMaxName) + " characters");
}

wyx_rc_t Member::try_to_join(std::optional<short> instance) {
  wyx_rc_t rc = WYX_DUPLICATE_INSTANCE_NUMBER;
  for (int i = 0; rc == WYX_DUPLICATE_INSTANCE_NUMBER && i < (instance ? 1 : kTries); ++i) {
    setInstanceNumber(instance ? *instance : some_instance());
    rc = joinGroup();
  }
  return rc == WYX_BAD_GROUP_ATTRIBUTES && take_attributes(*this) ? joinGroup() : rc;
}

void Member::delayedErrorCb(const wyx_delayed_error_notification_t* n) {
  const bool other = n->gs_protocol_type == WYX_JOIN && n->gs_delayed_return_code == WYX_BAD_GROUP_ATTRIBUTES;
  if (other && !took_attributes_ && n->old_group_attributes != nullptr) {
    took_attributes_ = true;
    setGroupAttributes(n->old_group_attributes);
    if (joinGroup() == WYX_OK) return;
  }
  loop_.guard([&] { refused(*n); });
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

void require_group(Loop& loop, const std::string& group) {
  Subscription probe(loop, group, WYX_SUBSCRIBE_STATE, [](const auto&) {});
  const wyx_rc_t rc = probe.subscribeGroup();
  if (rc != WYX_OK) {
    throw Error(rc == WYX_NO_INIT ? kLost : kRefused, "group '" + group + "': " + explain(rc));
  }
}

}  // namespace gsctl
