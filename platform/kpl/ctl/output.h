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
  bool long_form = false;  // of a long status

  /// An answer before the last one.
  void add(const control::Answer& answer);
};

/// A member of an entry; empty when it is no text.
std::string name_of(const nlohmann::json& entry, const char* member);

/// Of `status` without --long: one line a subsystem.
std::string status_table(const std::vector<nlohmann::json>& entries);
/// Of `list`.
std::string definition_table(const std::vector<nlohmann::json>& entries);
/// Lines that a subsystem has written, their bodies under one another.
std::string long_status(const std::vector<control::Line>& lines);

nlohmann::json to_json(const Outcome& outcome);
/// In ASCII: nothing in it steers a terminal.
std::string json_text(const nlohmann::json& value);

}  // namespace kpl::ctl
