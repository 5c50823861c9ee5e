#include "common/log.h"

#include <fcntl.h>
#include <spdlog/sinks/stdout_sinks.h>
#include <spdlog/spdlog.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>

#include "common/descriptor.h"

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

void log_to_file(const std::string& path) {
  const Descriptor file(open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOCTTY, 0640));
  if (!file) throw std::system_error(errno, std::generic_category(), path);
  dup2(file.get(), STDOUT_FILENO);
  dup2(file.get(), STDERR_FILENO);
}

std::shared_ptr<spdlog::logger> make_log(const std::string& name, spdlog::level::level_enum level) {
  auto log = spdlog::stderr_logger_st(name);
  log->set_pattern("%Y-%m-%dT%H:%M:%S.%e%z %l %v");
  log->set_level(level);
  return log;
}

}  // namespace platform
