// The daemons' log: lines on standard error, which never hold up who logs.
#pragma once

#include <spdlog/logger.h>

#include <memory>
#include <optional>
#include <string>

#include "common/descriptor.h"

namespace platform {

/// "error", "warning", "info" or "debug"; nothing for any other text.
std::optional<spdlog::level::level_enum> log_level(const std::string& name);

/// Opened for appending, made where there is none. Throws std::runtime_error, whose text begins with the path: it
/// cannot be opened, is a link or a pipe that nobody reads, or lies where somebody other than root and this
/// process's user could have put it. The folders on the way to its own are the operator's to choose.
Descriptor open_log_file(const std::string& path);

/// Standard output and error are appended to the file from here on. Throws as open_log_file does.
void log_to_file(const std::string& path);

/// For one thread. Another one writes, so a standard error that takes nothing costs lines, which are counted, and
/// no time; the last lines are waited for, for a moment, when the last owner goes. `name` is the logger's, not
/// printed.
std::shared_ptr<spdlog::logger> make_log(const std::string& name, spdlog::level::level_enum level);

}  // namespace platform
