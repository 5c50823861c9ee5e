#include "master/options.h"

#include <unistd.h>

#include <filesystem>

#include "common/command_line.h"
#include "common/log.h"
#include "kpl.h"

namespace kpl::master {
namespace {

/// The master works in "/".
void make_absolute(std::string* path) {
  if (!path->empty()) *path = std::filesystem::absolute(*path);
}

}  // namespace

std::string Options::status_socket_path() const {
  if (socket_path == control::kDefaultSocketPath) return KPL_MASTER_DEFAULT;
  return socket_path + ".status";
}

std::optional<Options> parse_options(int argc, const char* const* argv) {
  Options options;
  CLI::App app("KPL master: starts, watches and asks the subsystems of this host.", "kplmstr");
  app.set_version_flag("--version", "kplmstr " KPL_PROGRAM_VERSION);
  std::string level = "info";
  app.add_option("--definitions", options.definitions, "Folder of the subsystems' definitions, *.toml")
      ->capture_default_str()
      ->type_name("FOLDER");
  app.add_option("--socket-path", options.socket_path, "Socket to listen on for kplctl")
      ->capture_default_str()
      ->type_name("PATH");
  app.add_option("--access-group", options.access_group, "Unix group whose members may use it (none: root alone)")
      ->type_name("GROUP");
  app.add_option("--log-file", options.log_file, "File to append the log to (none: standard error)")
      ->type_name("FILE");
  app.add_option("--log-level", level, "error, warning, info or debug")->capture_default_str()->type_name("LEVEL");
  app.add_flag("--daemon", options.daemon, "Detach from the terminal; return once subsystems can be started");
  app.add_flag("--check", options.check,
               "Only tell what is wrong with the definitions; exit status 1 if anything is");
  if (!platform::parse_command_line(app, argc, argv)) return std::nullopt;
  const auto known = platform::log_level(level);
  if (!known)
    throw platform::SettingError("--log-level: must be error, warning, info or debug, not '" + level + "'");
  options.log_level = *known;
  make_absolute(&options.definitions);
  make_absolute(&options.socket_path);
  make_absolute(&options.log_file);
  return options;
}

}  // namespace kpl::master
