#include "ctl/output.h"

#include <algorithm>
#include <cstdint>

#include "common/table.h"

namespace kpl::ctl {
namespace {

using nlohmann::json;
using platform::Row;

constexpr double kMaxShownSeconds = 1e12;
constexpr std::size_t kFullBody = 64;  // a body that fills its record goes on in the next one

/// "-" for what is not there.
std::string text_of(const json& entry, const char* name) {
  const auto found = entry.find(name);
  if (found == entry.end()) return "-";
  if (found->is_boolean()) return found->get<bool>() ? "yes" : "no";
  if (!found->is_string()) return found->dump(-1, ' ', true, json::error_handler_t::replace);
  const auto text = found->get<std::string>();
  return text.empty() ? "-" : text;
}

std::string duration_of(const json& entry) {
  const auto found = entry.find("seconds");
  if (found == entry.end() || !found->is_number()) return "-";
  const auto seconds = static_cast<std::int64_t>(std::clamp(found->get<double>(), 0.0, kMaxShownSeconds));
  const auto two = [](std::int64_t number) {
    return std::string(number < 10 ? "0" : "") + std::to_string(number);
  };
  const std::string clock = two(seconds / 3600 % 24) + ":" + two(seconds / 60 % 60) + ":" + two(seconds % 60);
  return seconds < 86'400 ? clock : std::to_string(seconds / 86'400) + "d " + clock;
}

std::string command_of(const json& entry) {
  std::string text = text_of(entry, "program");
  const auto arguments = entry.find("arguments");
  if (arguments == entry.end() || !arguments->is_array()) return text;
  for (const json& argument : *arguments) {
    if (argument.is_string()) text += " " + argument.get<std::string>();
  }
  return text;
}

std::string trimmed(const std::string& text) {
  const std::size_t first = text.find_first_not_of(' ');
  return first == std::string::npos ? "" : text.substr(first, text.find_last_not_of(' ') - first + 1);
}

/// Lines without a margin belong to the field before them, and indented margins to the one that is not.
json fields_of(const std::vector<control::Line>& lines) {
  json fields = json::array();
  json* last = nullptr;
  bool full = false;
  for (const control::Line& line : lines) {
    const std::string name = trimmed(line.margin);
    if (last != nullptr && name.empty()) {
      (*last)["value"].get_ref<std::string&>() += (full ? "" : "\n") + line.body;
    } else {
      const bool inner = line.margin.starts_with(' ') && !fields.empty() && !name.empty();
      json& list = inner ? fields.back()["fields"] : fields;
      list.push_back({{"name", name}, {"value", line.body}});
      last = &list.back();
    }
    full = line.body.size() == kFullBody;
  }
  return fields;
}

}  // namespace

void Outcome::add(const control::Answer& answer) {
  if (const auto* message = std::get_if<control::Message>(&answer)) messages.push_back(message->text);
  if (const auto* entry = std::get_if<control::Entry>(&answer)) entries.push_back(entry->subsystem);
  const auto* more = std::get_if<control::Lines>(&answer);
  if (more != nullptr) lines.insert(lines.end(), more->lines.begin(), more->lines.end());
}

std::string name_of(const json& entry, const char* member) {
  const auto found = entry.find(member);
  return found != entry.end() && found->is_string() ? found->get<std::string>() : "";
}

std::string status_table(const std::vector<json>& entries) {
  std::vector<Row> rows = {{"Subsystem", "Group", "PID", "State", "Time", "Restarts", "Last end"}};
  for (const json& entry : entries) {
    rows.push_back({text_of(entry, "name"), text_of(entry, "group"), text_of(entry, "pid"),
                    text_of(entry, "state"), duration_of(entry), text_of(entry, "restarts"),
                    text_of(entry, "last_end")});
  }
  return platform::table(rows);
}

std::string definition_table(const std::vector<json>& entries) {
  std::vector<Row> rows = {{"Subsystem", "Group", "User", "Transport", "Autostart", "Restart", "Command"}};
  for (const json& entry : entries) {
    rows.push_back({text_of(entry, "name"), text_of(entry, "group"), text_of(entry, "user"),
                    text_of(entry, "transport"), text_of(entry, "autostart"), text_of(entry, "restart"),
                    command_of(entry)});
  }
  return platform::table(rows);
}

std::string long_status(const std::vector<control::Line>& lines) {
  std::size_t width = 0;
  for (const control::Line& line : lines) width = std::max(width, line.margin.size());
  std::string text;
  for (const control::Line& line : lines) text += platform::padded(line.margin, width) + line.body + "\n";
  return text;
}

json to_json(const Outcome& outcome) {
  json result = {{"subsystem", outcome.subsystem},
                 {"result", control::name_of(outcome.end.result)},
                 {"code", outcome.end.code},
                 {"text", outcome.end.text},
                 {"messages", outcome.messages}};
  if (!outcome.long_form) return result;
  result["fields"] = fields_of(outcome.lines);
  if (!outcome.entries.empty()) result["entry"] = outcome.entries.front();
  return result;
}

std::string json_text(const json& value) {
  return value.dump(2, ' ', true, json::error_handler_t::replace) + "\n";
}

}  // namespace kpl::ctl
