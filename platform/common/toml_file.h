// TOML files whose mistakes are told with file and line.
#pragma once

#include <string>
#include <toml.hpp>

#include "common/settings.h"

namespace platform {

constexpr std::size_t kMaxTomlFile = 32 * 1024;  // bytes

/// Throws SettingError, "FILE:LINE: what", or "FILE: what" when it cannot be read.
toml::value parse_toml_file(const std::string& path);
/// The same of a file's content.
toml::value parse_toml(const std::string& text, const std::string& path);

/// "FILE:LINE" of a value.
std::string place_of(const toml::value& value);

}  // namespace platform
