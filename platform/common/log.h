// The daemons' log: lines on standard error.
#pragma once

#include <spdlog/logger.h>

#include <memory>
#include <optional>
#include <string>

namespace platform {

/// "error", "warning", "info" or "debug"; nothing for any other text.
std::optional<spdlog::level::level_enum> log_level(const std::string& name);

/// Standard output and error are appended to the file from here on. Throws std::system_error.
void log_to_file(const std::string& path);

/// For one thread. `name` is the logger's, not printed.
std::shared_ptr<spdlog::logger> make_log(const std::string& name, spdlog::level::level_enum level);

}  // namespace platform
