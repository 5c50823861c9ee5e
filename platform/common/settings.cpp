#include "common/settings.h"

#include <grp.h>

#include <charconv>

namespace platform {

Problem set_number(const std::string& text, std::uint64_t min, std::uint64_t max, std::uint64_t* value) {
  std::uint64_t number = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (error != std::errc() || end != text.data() + text.size() || number < min || number > max) {
    return "must be a whole number from " + std::to_string(min) + " to " + std::to_string(max) + ", not '" + text +
           "'";
  }
  *value = number;
  return {};
}

std::optional<std::uint32_t> group_id(const std::string& group) {
  if (group.empty()) return std::nullopt;
  std::uint64_t number = 0;
  if (set_number(group, 0, UINT32_MAX - 1, &number).empty()) return static_cast<std::uint32_t>(number);
  const struct group* found = getgrnam(group.c_str());
  if (found == nullptr) throw SettingError("there is no group '" + group + "'");
  return found->gr_gid;
}

std::string first_line(const std::string& text) { return text.substr(0, text.find('\n')); }

}  // namespace platform
