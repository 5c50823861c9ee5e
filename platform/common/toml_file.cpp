#include "common/toml_file.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>

#include "common/printable.h"

namespace platform {
namespace {

constexpr int kMaxBrackets = 500;

std::string place(const toml::source_location& where) {
  return where.file_name() + ":" + std::to_string(where.line());
}

/// The parser's own words without its "[error] toml::function: " before and its drawing of the line after.
std::string syntax_problem(const std::string& message) {
  std::string what = first_line(message);
  if (what.starts_with("[error] ")) what.erase(0, what.find(' ') + 1);
  if (what.starts_with("toml::") && what.find(": ") != std::string::npos) what.erase(0, what.find(": ") + 2);
  return what;
}

std::string content_of(const std::string& path) {
  errno = 0;
  std::ostringstream content;
  content << std::ifstream(path, std::ios::binary).rdbuf();  // does not throw, for a folder neither
  if (errno != 0) throw SettingError(path + ": cannot be read: " + strerror(errno));
  return content.str();
}

/// The parser calls itself for each bracket, takes a time that grows with the square of a key's length, and reads
/// outside its text to tell where it is no UTF-8.
void check_bounds(const std::string& path, const std::string& content) {
  if (content.size() > kMaxTomlFile)
    throw SettingError(path + ": is longer than " + std::to_string(kMaxTomlFile) + " bytes");
  const auto brackets = std::count_if(content.begin(), content.end(), [](char c) { return c == '[' || c == '{'; });
  if (brackets > kMaxBrackets)
    throw SettingError(path + ": has more than " + std::to_string(kMaxBrackets) + " brackets");
  const std::size_t good = utf8_length(content);
  if (good == content.size()) return;
  const auto line = 1 + std::count(content.begin(), content.begin() + static_cast<std::ptrdiff_t>(good), '\n');
  throw SettingError(path + ":" + std::to_string(line) + ": is no UTF-8 text");
}

}  // namespace

toml::value parse_toml_file(const std::string& path) { return parse_toml(content_of(path), path); }

toml::value parse_toml(const std::string& text, const std::string& path) {
  check_bounds(path, text);
  std::istringstream content(text);
  try {
    return toml::parse(content, path);
  } catch (const toml::syntax_error& error) {
    throw SettingError(place(error.location()) + ": " + syntax_problem(error.what()));
  } catch (const std::exception& error) {
    throw SettingError(path + ": " + first_line(error.what()));
  }
}

std::string place_of(const toml::value& value) { return place(value.location()); }

}  // namespace platform
