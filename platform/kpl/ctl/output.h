// What kplctl prints: columns for people, JSON for scripts.
#pragma once

#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "control/control.h"

namespace kpl::ctl {

/// Everything that came for one request.
struct Outcome {
  std::string subsystem;
  control::End end;
  std::vector<std::string> messages;
  std::vector<control::Line> lines;
  std::vector<nlohmann::json> entries;
};

/// Of `status` without --long: one line a subsystem.
std::string status_table(const std::vector<nlohmann::json>& entries);
/// Of `list`.
std::string definition_table(const std::vector<nlohmann::json>& entries);
/// Lines that a subsystem has written, their bodies under one another.
std::string long_status(const std::vector<control::Line>& lines);

nlohmann::json to_json(const Outcome& outcome);

}  // namespace kpl::ctl
