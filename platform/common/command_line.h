// How this host's programs read their command lines.
#pragma once

#include <CLI/CLI.hpp>
#include <cmath>
#include <iostream>

#include "common/settings.h"

namespace platform {

/// A check of an option: a number from `least` to `most`, which NaN is not.
inline CLI::Validator between(double least, double most) {
  const CLI::Range range(least, most);
  const auto check = [range](std::string& text) {
    const std::string error = range(text);
    return error.empty() && std::isnan(std::stod(text)) ? text + " is no number" : error;
  };
  return CLI::Validator(check, range.get_description());
}

/// False when help or the version was asked for, which is answered then. Throws SettingError for wrong use.
inline bool parse_command_line(CLI::App& app, int argc, const char* const* argv) {
  try {
    app.parse(argc, argv);
    return true;
  } catch (const CLI::Success& asked) {
    app.exit(asked, std::cout, std::cerr);
    return false;
  } catch (const CLI::ParseError& error) {
    throw SettingError(first_line(error.what()));
  }
}

}  // namespace platform
