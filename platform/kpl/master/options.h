// The command line of kplmstr. The defaults are defined here and nowhere else.
#pragma once

#include <spdlog/common.h>

#include <optional>
#include <string>

#include "common/settings.h"
#include "control/control.h"

namespace kpl::master {

struct Options {
  std::string definitions = "/etc/kplmstr";  // folder
  std::string socket_path = control::kDefaultSocketPath;
  std::string access_group;  // name or number of a unix group; empty: root alone
  std::string log_file;      // empty: standard error
  spdlog::level::level_enum log_level = spdlog::level::info;
  bool daemon = false;
  bool check = false;

  /// Of the socket that answers kplstat: beside the control socket.
  std::string status_socket_path() const;
};

/// Nothing: --help or --version was asked for and is answered on standard output. Throws platform::SettingError.
std::optional<Options> parse_options(int argc, const char* const* argv);

}  // namespace kpl::master
