#include "common/log.h"

#include <spdlog/sinks/stdout_sinks.h>
#include <spdlog/spdlog.h>

namespace platform {

std::optional<spdlog::level::level_enum> log_level(const std::string& name) {
  static constexpr struct {
    const char* name;
    spdlog::level::level_enum level;
  } kLevels[] = {{"error", spdlog::level::err},
                 {"warning", spdlog::level::warn},
                 {"info", spdlog::level::info},
                 {"debug", spdlog::level::debug}};
  for (const auto& known : kLevels) {
    if (name == known.name) return known.level;
  }
  return std::nullopt;
}

std::shared_ptr<spdlog::logger> make_log(const std::string& name, spdlog::level::level_enum level) {
  auto log = spdlog::stderr_logger_st(name);
  log->set_pattern("%Y-%m-%dT%H:%M:%S.%e%z %l %v");
  log->set_level(level);
  return log;
}

}  // namespace platform
