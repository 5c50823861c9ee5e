// What has changed in a group: as a line, as an object, and as a program's environment.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "tools/gsctl/shell.h"
#include "tools/gsctl/text.h"

namespace gsctl {

struct Change {
  std::string group;
  std::string what;                    // "now", "joined", "state", "approved" ...: see docs/gsctl.md
  std::optional<std::uint64_t> event;  // its number
  Members who;
  std::string why;
  std::optional<Members> members;    // after it
  std::optional<std::string> bytes;  // a state value, or a message
  WallTime time = std::chrono::system_clock::now();
};

Json to_json(const Change& change);
/// With the time of day.
std::string to_line(const Change& change);
/// GS_GROUP, GS_CHANGE, GS_EVENT, GS_WHO, GS_WHY, GS_MEMBERS; the bytes are its standard input.
Job job_of(const Change& change, const std::string& command);

/// On standard output.
void print(const Change& change, bool as_json);

}  // namespace gsctl
