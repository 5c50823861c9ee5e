// A group as it stands, for people and tools.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "engine/observer.h"

namespace gs {

struct ProtocolStatus {
  const char* kind = "";  // its name in the table of protocols
  std::uint64_t number = 0;
  ProviderId proposed_by;
  ProtocolTerms terms;
  std::uint32_t phase = 0;
  Moment since = 0;
  Moment phase_since = 0;
  SharedMembership changing;  // null: nobody
  std::vector<MissingVoter> voted;
  std::vector<MissingVoter> missing;
};

struct GroupStatus {
  std::string name;
  std::shared_ptr<const GroupAttributes> attributes;  // null until the first join starts
  SharedMembership members;
  SharedBytes state;
  std::uint64_t seqnum = 0;
  Moment since = 0;  // the last event
  std::size_t subscribers = 0;
  std::size_t waiting = 0;  // joins and leaves
  std::optional<ProtocolStatus> running;
  bool unfinished = false;  // a ContinueEvent goes on with it
};

struct MemberStatus {
  ProviderId id;
  Endpoint to;
  std::string local_name;
  const char* state = "";  // "joining", "member", "leaving" or "gone"
  Moment since = 0;        // it is a member
};

struct SubscriberStatus {
  std::string group;
  std::uint64_t number = 0;
  Endpoint to;
  std::uint32_t control = 0;  // flags of wyx_subscription_ctrl_t
};

struct Totals {
  std::size_t groups = 0;
  std::size_t members = 0;
  std::size_t subscribers = 0;
  std::size_t running = 0;  // protocols
};

}  // namespace gs
