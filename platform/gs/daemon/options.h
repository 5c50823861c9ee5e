// What the daemon is told by its command line and its configuration file. The defaults are defined here and
// nowhere else.
#pragma once

#include <spdlog/common.h>

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "common/settings.h"
#include "engine/limits.h"
#include "wire/endpoint.h"

namespace gs::daemon {

struct Options {
  std::string socket_path = wire::kDefaultSocketPath;
  std::string access_group;                // name or number of a unix group; empty: the owner alone
  std::uint32_t node_number = 1;           // 0 to 32767, of a host alone
  bool corosync = false;                   // orders events, for several hosts
  bool safe = true;                        // what is told has been received by all hosts
  std::chrono::seconds member_timeout{5};  // before the others go on without a host that hangs
  bool require_quorum = true;
  std::size_t queue_bound = 16 * 1024 * 1024;        // bytes that may wait for each channel of a client
  std::chrono::seconds drain_time{10};               // that more may wait for it
  std::size_t user_queue_bound = 256 * 1024 * 1024;  // bytes that may wait for all clients of a user but root
  std::size_t total_queue_bound =
      1024 * 1024 * 1024;  // bytes that may wait for all clients, one eighth for root's
  std::size_t max_sessions = 4096;
  std::size_t user_sessions = 0;   // of a user but root; 0: a quarter of max_sessions
  std::size_t root_sessions = 16;  // of max_sessions, for root alone
  Limits engine;
  spdlog::level::level_enum log_level = spdlog::level::info;
  std::string log_file;  // empty: standard error
  bool daemon = false;
  int ready_fd = -1;  // told "ready" once clients can connect; -1: nobody
};

using OptionError = platform::SettingError;

/// The options of this command line, over those of the configuration file that it names. Nothing: --help or
/// --version was asked for and is answered on standard output. Throws OptionError.
std::optional<Options> parse_options(int argc, const char* const* argv);

/// For people: what it serves, and as what.
std::string serves(const Options& options);

/// As in `options`, with what the configuration file says put in its place. Throws OptionError.
Options read_config(const std::string& path, Options options);

}  // namespace gs::daemon
