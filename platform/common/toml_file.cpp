#include "common/toml_file.h"

#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>

namespace platform {
namespace {

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

}  // namespace

toml::value parse_toml_file(const std::string& path) {
  std::istringstream content(content_of(path));
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
