// A recording of what happened in groups: a file of JSON lines, the first of which is its header.
#pragma once

#include <istream>
#include <map>

#include "tools/gsctl/reports.h"

namespace gsctl {

/// A line of the tap. Fields that a happening has no use for are left out.
Json to_json(const inspect::HappeningT& happening);

/// So many happenings were left out before `time_us`, since they were not read in time.
Json missed_json(std::uint64_t count, std::int64_t time_us);

/// The last line.
Json end_json(std::int64_t time_us);

struct KnownMember {
  inspect::Id id;
  std::string name;
};

struct Recording {
  std::int64_t started_us = 0;
  std::int64_t ended_us = 0;  // 0: nobody said; its last line is its end
  /// Who was there when it began, oldest first.
  std::map<std::string, std::vector<KnownMember>> groups;
  std::vector<inspect::HappeningT> happenings;
  struct Gap {
    std::uint64_t count;
    std::int64_t time_us;
  };
  std::vector<Gap> missed;
  /// The last line has no end, and is left out.
  bool cut = false;
};

Json header_json(const Recording& recording);

/// Throws Error: what it reads is no recording, or one of a version that it does not know. `name` is the file's.
Recording read_recording(std::istream& file, const std::string& name);

}  // namespace gsctl
