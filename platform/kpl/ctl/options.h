// The command line of kplctl.
#pragma once

#include <optional>
#include <string>

#include "common/settings.h"
#include "control/control.h"

namespace kpl::ctl {

struct Options {
  std::string socket_path = control::kDefaultSocketPath;
  bool json = false;
  control::Request request;
  bool restart = false;  // request is the stop before it
  std::string group;     // of subsystems, in place of request.subsystem
};

/// Nothing: --help or --version was asked for and is answered on standard output. Throws platform::SettingError.
std::optional<Options> parse_options(int argc, const char* const* argv);

}  // namespace kpl::ctl
