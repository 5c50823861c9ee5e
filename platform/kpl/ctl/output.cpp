#include "ctl/output.h"

#include <algorithm>
#include <cstdint>

namespace kpl::ctl {
namespace {

using nlohmann::json;
using Row = std::vector<std::string>;

std::string padded(const std::string& text, std::size_t width) {
  return text + std::string(width > text.size() ? width - text.size() : 0, ' ');
}

std::string table(const std::vector<Row>& rows) {
  std::vector<std::size_t> widths(rows.front().size());
  for (const Row& row : rows) {
    for (std::size_t i = 0; i < row.size(); ++i) widths[i] = std::max(widths[i], row[i].size());
  }
  std::string text;
  for (const Row& row : rows) {
    std::string line;
    for (std::size_t i = 0; i < row.size(); ++i) line += padded(row[i], widths[i] + 2);
    text += line.erase(line.find_last_not_of(' ') + 1) + "\n";
  }
  return text;
}

/// "-" for what is not there.
std::string text_of(const json& entry, const char* name) {
  const auto found = entry.find(name);
  if (found == entry.end()) return "-";
  if (found->is_boolean()) return found->get<bool>() ? "yes" : "no";
  if (!found->is_string()) return found->dump();
  const auto text = found->get<std::string>();
  return text.empty() ? "-" : text;
}

std::string duration_of(const json& entry) {
  const auto found = entry.find("seconds");
  if (found == entry.end() || !found->is_number()) return "-";
  const auto seconds = static_cast<std::int64_t>(found->get<double>());
  const auto two = [](std::int64_t number) {
    return std::string(number < 10 ? "0" : "") + std::to_string(number);
  };
  const std::string clock = two(seconds / 3600 % 24) + ":" + two(seconds / 60 % 60) + ":" + two(seconds % 60);
  return seconds < 86'400 ? clock : std::to_string(seconds / 86'400) + "d " + clock;
}

std::string command_of(const json& entry) {
  std::string text = text_of(entry, "program");
  const json arguments = entry.value("arguments", json::array());
  for (const json& argument : arguments) {
    if (argument.is_string()) text += " " + argument.get<std::string>();
  }
  return text;
}

}  // namespace

std::string status_table(const std::vector<json>& entries) {
  std::vector<Row> rows = {{"Subsystem", "Group", "PID", "State", "Time", "Restarts", "Last end"}};
  for (const json& entry : entries) {
    rows.push_back({text_of(entry, "name"), text_of(entry, "group"), text_of(entry, "pid"),
                    text_of(entry, "state"), duration_of(entry), text_of(entry, "restarts"),
                    text_of(entry, "last_end")});
  }
  return table(rows);
}

std::string definition_table(const std::vector<json>& entries) {
  std::vector<Row> rows = {{"Subsystem", "Group", "User", "Transport", "Autostart", "Restart", "Command"}};
  for (const json& entry : entries) {
    rows.push_back({text_of(entry, "name"), text_of(entry, "group"), text_of(entry, "user"),
                    text_of(entry, "transport"), text_of(entry, "autostart"), text_of(entry, "restart"),
                    command_of(entry)});
  }
  return table(rows);
}

std::string long_status(const std::vector<control::Line>& lines) {
  std::size_t width = 0;
  for (const control::Line& line : lines) width = std::max(width, line.margin.size());
  std::string text;
  for (const control::Line& line : lines) text += padded(line.margin, width) + line.body + "\n";
  return text;
}

json to_json(const Outcome& outcome) {
  json lines = json::array();
  for (const control::Line& line : outcome.lines) lines.push_back({{"margin", line.margin}, {"body", line.body}});
  return {{"subsystem", outcome.subsystem}, {"result", control::name_of(outcome.end.result)},
          {"code", outcome.end.code},       {"text", outcome.end.text},
          {"messages", outcome.messages},   {"lines", std::move(lines)}};
}

}  // namespace kpl::ctl
