#include "common/log.h"

#include <fcntl.h>
#include <spdlog/pattern_formatter.h>
#include <spdlog/sinks/base_sink.h>
#include <unistd.h>

#include <cerrno>
#include <stdexcept>
#include <system_error>

#include "common/log_writer.h"
#include "common/place.h"

namespace platform {
namespace {

constexpr char kPattern[] = "%Y-%m-%dT%H:%M:%S.%e%z %l %v";

std::string lost_line(std::uint64_t lines) {
  const std::string text = std::to_string(lines) + " lines were lost: the log took none for a while";
  spdlog::memory_buf_t line;
  spdlog::pattern_formatter(kPattern).format({"", spdlog::level::warn, text}, line);
  return {line.data(), line.size()};
}

class Sink : public spdlog::sinks::base_sink<spdlog::details::null_mutex> {
 private:
  void sink_it_(const spdlog::details::log_msg& message) override {
    spdlog::memory_buf_t line;
    formatter_->format(message, line);
    writer_.write({line.data(), line.size()});
  }
  void flush_() override {}

  LogWriter writer_{lost_line};
};

}  // namespace

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

Descriptor open_log_file(const std::string& path) {
  const auto fail = [&](const std::string& why) { throw std::runtime_error(path + ": " + why); };
  Place place = [&] {
    try {
      return Place(path);
    } catch (const std::system_error& error) {
      throw std::runtime_error(path + ": " + error.code().message());
    }
  }();
  // Not blocking: a pipe that nobody reads is refused, not waited for.
  constexpr int kFlags = O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOCTTY | O_NOFOLLOW | O_NONBLOCK;
  Descriptor file(openat(place.folder(), place.name().c_str(), kFlags, 0640));
  if (!file && errno == ELOOP) fail("is a link: name the file itself");
  if (!file) fail(std::generic_category().message(errno));
  const auto opened = file_of(file.get());
  const auto folder = file_of(place.folder());
  if (!opened || !folder) fail("cannot be looked at");
  const std::string danger = place.danger(S_IWOTH);
  if (!danger.empty()) fail(danger);
  const bool ours = (opened->st_uid == 0 || opened->st_uid == geteuid()) && opened->st_nlink == 1;
  if ((folder->st_mode & S_IWOTH) != 0 && !ours) fail("is somebody else's file, in a folder that all can write");
  fcntl(file.get(), F_SETFL, O_APPEND);
  return file;
}

void log_to_file(const std::string& path) {
  const Descriptor file = open_log_file(path);
  dup2(file.get(), STDOUT_FILENO);
  dup2(file.get(), STDERR_FILENO);
}

std::shared_ptr<spdlog::logger> make_log(const std::string& name, spdlog::level::level_enum level) {
  auto log = std::make_shared<spdlog::logger>(name, std::make_shared<Sink>());
  log->set_pattern(kPattern);
  log->set_level(level);
  return log;
}

}  // namespace platform
