#include "daemon/options.h"

#include <sys/un.h>

#include <algorithm>
#include <filesystem>
#include <iterator>

#include "common/command_line.h"
#include "common/log.h"
#include "common/toml_file.h"

namespace gs::daemon {
namespace {

using platform::first_line;
using platform::place_of;
using platform::Problem;
using platform::set_number;

constexpr std::uint64_t kMaxNode = 32767;
constexpr std::uint64_t kMinQueueBound = 64 * 1024;
constexpr std::uint64_t kMaxQueueBound = std::uint64_t{1} << 40;
constexpr std::uint64_t kMinStateBound = 1024 * 1024;
constexpr std::uint64_t kMaxStateBound = std::uint64_t{1} << 40;
constexpr std::uint64_t kLongestTime = 3600;  // seconds
constexpr std::uint64_t kMaxSessions = 1'000'000;

Problem set_socket_path(Options& options, const std::string& text) {
  constexpr std::size_t kLongest = sizeof(sockaddr_un::sun_path) - 1;
  if (text.empty() || text.size() > kLongest) {
    return "must be a path of 1 to " + std::to_string(kLongest) + " characters";
  }
  options.socket_path = text;
  return {};
}
Problem set_access_group(Options& options, const std::string& text) {
  try {
    platform::group_id(text);
  } catch (const OptionError& error) {
    return error.what();
  }
  options.access_group = text;
  return {};
}
Problem set_node_number(Options& options, const std::string& text) {
  std::uint64_t value = 0;
  Problem problem = set_number(text, 0, kMaxNode, &value);
  if (problem.empty()) options.node_number = static_cast<std::uint32_t>(value);
  return problem;
}
/// A size that is kept in the options as it is given.
template <std::size_t Options::*Member, std::uint64_t kMin, std::uint64_t kMax>
Problem set_size(Options& options, const std::string& text) {
  std::uint64_t value = 0;
  Problem problem = set_number(text, kMin, kMax, &value);
  if (problem.empty()) options.*Member = value;
  return problem;
}
/// One of two words.
template <bool Options::*Member>
Problem set_choice(Options& options, const std::string& text, const char* no, const char* yes) {
  if (text != no && text != yes) return "must be " + std::string(no) + " or " + yes + ", not '" + text + "'";
  options.*Member = text == yes;
  return {};
}
Problem set_ordering(Options& options, const std::string& text) {
  return set_choice<&Options::corosync>(options, text, "local", "corosync");
}
Problem set_delivery(Options& options, const std::string& text) {
  return set_choice<&Options::safe>(options, text, "agreed", "safe");
}
Problem set_require_quorum(Options& options, const std::string& text) {
  return set_choice<&Options::require_quorum>(options, text, "no", "yes");
}
template <std::chrono::seconds Options::*Member>
Problem set_time(Options& options, const std::string& text) {
  std::uint64_t value = 0;
  Problem problem = set_number(text, 1, kLongestTime, &value);
  if (problem.empty()) options.*Member = std::chrono::seconds(value);
  return problem;
}
template <std::size_t Limits::*Bound>
Problem set_state_bound(Options& options, const std::string& text) {
  std::uint64_t value = 0;
  Problem problem = set_number(text, kMinStateBound, kMaxStateBound, &value);
  if (problem.empty()) options.engine.*Bound = value;
  return problem;
}
Problem set_max_phase_time(Options& options, const std::string& text) {
  std::uint64_t value = 0;
  Problem problem = set_number(text, 0, UINT16_MAX, &value);
  if (problem.empty()) options.engine.max_phase_time = static_cast<std::uint16_t>(value);
  return problem;
}
Problem set_log_level(Options& options, const std::string& text) {
  const auto level = platform::log_level(text);
  if (!level) return "must be error, warning, info or debug, not '" + text + "'";
  options.log_level = *level;
  return {};
}

Problem set_log_file(Options& options, const std::string& text) {
  options.log_file = text;
  return {};
}

/// One setting, of the same name on the command line (with -- before it) and in the configuration file.
struct Setting {
  const char* name;
  const char* value;  // what it takes, for --help
  bool number;        // an integer in the configuration file; else a text
  const char* help;
  Problem (*set)(Options&, const std::string&);
};
constexpr Setting kSettings[] = {
    {"socket-path", "PATH", false, "Socket to listen on", set_socket_path},
    {"access-group", "GROUP", false, "Unix group whose members may be clients (none: the owner alone)",
     set_access_group},
    {"node-number", "N", true, "Number of this node, 0 to 32767", set_node_number},
    {"ordering", "WHO", false, "Who orders events: local (one host) or corosync (several)", set_ordering},
    {"delivery", "HOW", false, "With corosync: safe, or agreed (faster, may be lost with its host)", set_delivery},
    {"member-timeout", "SECONDS", true, "How long the others wait for a host that hangs",
     set_time<&Options::member_timeout>},
    {"require-quorum", "yes|no", false, "Serve only where most hosts are together", set_require_quorum},
    {"queue-bound", "BYTES", true, "Bytes that may wait for a client for any time",
     set_size<&Options::queue_bound, kMinQueueBound, kMaxQueueBound>},
    {"drain-time", "SECONDS", true, "How long more may wait before the client is closed",
     set_time<&Options::drain_time>},
    {"user-queue-bound", "BYTES", true, "Bytes that may wait for all clients of a user",
     set_size<&Options::user_queue_bound, kMinQueueBound, kMaxQueueBound>},
    {"total-queue-bound", "BYTES", true, "Bytes that may wait for all clients",
     set_size<&Options::total_queue_bound, kMinQueueBound, kMaxQueueBound>},
    {"max-sessions", "N", true, "Sessions at a time, as far as descriptors allow",
     set_size<&Options::max_sessions, 1, kMaxSessions>},
    {"user-sessions", "N", true, "Sessions of one user at a time (0: a quarter of all)",
     set_size<&Options::user_sessions, 0, kMaxSessions>},
    {"root-sessions", "N", true, "Sessions of all that are kept for root",
     set_size<&Options::root_sessions, 0, kMaxSessions>},
    {"session-state-bound", "BYTES", true, "Bytes that one client may have in groups",
     set_state_bound<&Limits::session_bytes>},
    {"user-state-bound", "BYTES", true, "Bytes that all clients of a user but root may have in groups",
     set_state_bound<&Limits::user_bytes>},
    {"state-bound", "BYTES", true, "Bytes of all groups, the last eighth for root only",
     set_state_bound<&Limits::total_bytes>},
    {"max-phase-time", "SECONDS", true, "Longest time that a phase waits for votes (0: none)", set_max_phase_time},
    {"log-level", "LEVEL", false, "error, warning, info or debug", set_log_level},
    {"log-file", "FILE", false, "File to append the log to (none: standard error)", set_log_file},
};

void apply(const std::string& name, const toml::value& value, Options& options) {
  const std::string where = place_of(value) + ": " + name + ": ";
  const auto* setting =
      std::find_if(std::begin(kSettings), std::end(kSettings), [&](const Setting& s) { return name == s.name; });
  if (setting == std::end(kSettings)) throw OptionError(place_of(value) + ": unknown setting '" + name + "'");
  if (setting->number ? !value.is_integer() : !value.is_string()) {
    throw OptionError(where + (setting->number ? "must be a whole number" : "must be a text in quotes"));
  }
  const std::string text = setting->number ? std::to_string(value.as_integer()) : value.as_string().str;
  const Problem problem = setting->set(options, text);
  if (!problem.empty()) throw OptionError(where + problem);
}

void parse_ready_fd(const std::string& text, Options& options) {
  std::uint64_t fd = 0;
  const Problem problem = set_number(text, 0, 1 << 20, &fd);
  if (!problem.empty()) throw OptionError("--ready-fd: " + problem);
  options.ready_fd = static_cast<int>(fd);
}

/// A daemon works in "/": relative paths are those of where it was started, also when they are read again.
void make_absolute(std::string* path) {
  static const std::filesystem::path kStart = std::filesystem::current_path();
  if (!path->empty()) *path = kStart / *path;
}

/// One that cannot be looked at is there: reading it tells why.
bool is_missing(const std::string& path) {
  std::error_code error;
  return std::filesystem::status(path, error).type() == std::filesystem::file_type::not_found;
}

}  // namespace

std::string serves(const Options& options) {
  return "serves " + options.socket_path +
         (options.corosync ? " with Corosync" : " as node " + std::to_string(options.node_number));
}

Options read_config(const std::string& path, Options options) {
  const toml::value file = platform::parse_toml_file(path);
  for (const auto& [name, value] : file.as_table()) apply(name, value, options);
  return options;
}

std::optional<Options> parse_options(int argc, const char* const* argv) {
  CLI::App app("Group-services daemon: connects the group providers and subscribers of this host.", "gsd");
  app.set_version_flag("--version", "gsd " GSD_VERSION);
  std::string config;
  std::string ready_fd;
  std::string given[std::size(kSettings)];
  app.add_option("--config", config, "Configuration file (TOML); options override it")->type_name("FILE");
  for (std::size_t i = 0; i < std::size(kSettings); ++i) {
    app.add_option(std::string("--") + kSettings[i].name, given[i], kSettings[i].help)
        ->type_name(kSettings[i].value);
  }
  app.add_option("--config-if-exists", config, "The same, where there is such a file")
      ->type_name("FILE")
      ->excludes("--config");
  bool daemon = false;
  CLI::Option* as_daemon =
      app.add_flag("--daemon", daemon, "Become a daemon, under the KPL master or from a shell");
  app.add_option("--ready-fd", ready_fd, "Descriptor that is told \"ready\" once clients can connect")
      ->type_name("FD")
      ->excludes(as_daemon);  // a daemon closes what it was started with
  if (!platform::parse_command_line(app, argc, argv)) return std::nullopt;

  Options options;
  if (daemon) make_absolute(&config);
  if (app.count("--config") != 0 || (app.count("--config-if-exists") != 0 && !is_missing(config))) {
    options = read_config(config, options);
  }
  for (std::size_t i = 0; i < std::size(kSettings); ++i) {
    const std::string option = std::string("--") + kSettings[i].name;
    if (app.count(option) == 0) continue;
    const Problem problem = kSettings[i].set(options, given[i]);
    if (!problem.empty()) throw OptionError(option + ": " + problem);
  }
  if (app.count("--ready-fd") != 0) parse_ready_fd(ready_fd, options);
  options.daemon = daemon;
  if (daemon) {
    make_absolute(&options.socket_path);
    make_absolute(&options.log_file);
  }
  return options;
}

}  // namespace gs::daemon
