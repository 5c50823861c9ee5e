// What command lines and configuration files have in common: numbers, groups, and how a mistake is told.
#pragma once

#include <cstdint>
#include <optional>
#include <stdexcept>
#include <string>

namespace platform {

/// One line that says where (option, or file and line) and what.
class SettingError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

/// What is wrong with a setting's text; empty: nothing.
using Problem = std::string;

/// `value` becomes the whole number that `text` is; unchanged when the result names a problem.
Problem set_number(const std::string& text, std::uint64_t min, std::uint64_t max, std::uint64_t* value);

/// The id of a unix group, given by name or number; nothing for an empty text. Throws SettingError: no such group.
std::optional<std::uint32_t> group_id(const std::string& group);

/// Up to the line's end: the parsers' errors have drawings under it.
std::string first_line(const std::string& text);

}  // namespace platform
