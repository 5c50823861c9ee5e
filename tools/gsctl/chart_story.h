// What a recording tells of one group, in the terms of a chart: lanes, protocols, their phases and votes.
#pragma once

#include <optional>

#include "tools/gsctl/recording.h"

namespace gsctl {

using Microseconds = std::int64_t;  // since 1970

struct Stay {
  Microseconds from = 0;
  Microseconds to = 0;
  bool member = false;  // else it is still joining
};

struct Mark {
  enum class Shape { kRequest, kRefused, kApprove, kReject, kContinue, kDefault, kFailure, kNote };
  Shape shape = Shape::kNote;
  Microseconds time = 0;
  std::string label;
};

/// A member's.
struct Lane {
  inspect::Id id;
  std::string name;
  std::vector<Stay> stays;
  std::vector<Mark> marks;
};

/// A voter's time without a vote in a phase.
struct Wait {
  std::size_t lane = 0;
  Microseconds from = 0;
  Microseconds to = 0;
  bool voted = true;         // else the end of the recording, or of its protocol, came first
  std::string default_vote;  // counted in place of its own
};

struct Phase {
  std::uint32_t number = 0;
  Microseconds from = 0;
  Microseconds to = 0;
  std::vector<Wait> waits;
};

struct Protocol {
  enum class End { kOpen, kApproved, kRejected };
  std::string kind;
  std::uint64_t number = 0;
  std::string by;
  Microseconds from = 0;
  Microseconds to = 0;
  std::vector<inspect::Id> changing;
  std::vector<Phase> phases;
  End end = End::kOpen;
  std::uint64_t event_number = 0;
};

struct Story {
  std::string group;
  std::vector<Lane> lanes;
  std::vector<Protocol> protocols;
  std::vector<Mark> marks;  // of no lane
};

/// Of a group in the recording, all of it.
Story story_of(const Recording& recording, const std::string& group);

/// All groups that the recording tells something of, by name.
std::vector<std::string> groups_of(const Recording& recording);

/// When it ended, as far as it says so.
Microseconds end_of(const Recording& recording);

}  // namespace gsctl
