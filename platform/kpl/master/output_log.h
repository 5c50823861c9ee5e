// What a subsystem without a file of its own writes: it comes through a pipe, and goes into the log line by line.
// So the log is nobody's to write but the master's.
#pragma once

#include <spdlog/logger.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <utility>

#include "common/descriptor.h"
#include "master/loop.h"

namespace kpl::master {

/// Long lines are broken, control characters replaced. Of many lines in a short time some are left out, and
/// counted; the subsystem is never held up by that.
class OutputLog {
 public:
  /// `ended`: nobody can write there any more; it may destroy this object. Throws std::system_error.
  OutputLog(const Loop& loop, spdlog::logger& log, std::string name, std::function<void()> ended);
  ~OutputLog();
  OutputLog(const OutputLog&) = delete;
  OutputLog& operator=(const OutputLog&) = delete;

  /// What becomes descriptors 1 and 2 of the subsystem. Once the master is dead, writing there fails (EPIPE) and
  /// holds up nobody; so that it does not kill either, the subsystem starts with SIGPIPE ignored.
  platform::Descriptor take_subsystem_end() { return std::move(subsystem_end_); }
  bool is_over() const { return over_; }

 private:
  void on_readable();
  /// False: there is nothing, for now or ever.
  bool read_some();
  void take(const char* bytes, std::size_t count);
  void end_line();
  void tell_left_out();

  spdlog::logger& log_;
  const std::string name_;
  const std::function<void()> ended_;
  platform::Descriptor subsystem_end_;
  platform::Descriptor own_end_;
  std::optional<Event> readable_;
  Event second_over_;
  bool over_ = false;
  std::string line_;
  int lines_ = 0;  // in this second
  std::uint64_t left_out_ = 0;
};

}  // namespace kpl::master
