// gsctl: looks at groups, changes them, and runs programs by what they decide.
#include <fcntl.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>

#include "common/command_line.h"
#include "tools/gsctl/command.h"
#include "tools/gsctl/inspection.h"
#include "tools/gsctl/output.h"

namespace {

using gsctl::Error;
using gsctl::Settings;

constexpr char kFooter[] =
    "Exit status: 0 done, 1 refused or rejected, 2 wrong use, 3 no daemon, 4 time is over,\n"
    "5 connection lost; lead and lock: that of CMD, 126 it cannot be run, 127 it was not found";

constexpr double kMaxTimeout = 1e6;  // seconds

void add_common(CLI::App& app, Settings& settings) {
  app.add_flag("--json", settings.json, "One JSON object a line, for scripts");
  app.add_option("--endpoint", settings.endpoint, "The daemon: a socket's path, or as GSD_ENDPOINT has it")
      ->type_name("PATH");
  app.add_option("--timeout", settings.timeout, "Give up after so long, with status 4")
      ->type_name("SECONDS")
      ->check(platform::between(0.001, kMaxTimeout));
}

/// Programs that gsctl runs inherit it, and so reach the same daemon.
void choose_daemon(const std::string& endpoint) {
  if (endpoint.empty()) return;
  const std::string value = endpoint.front() == '/' ? "unix:" + endpoint : endpoint;
  if (value != "embedded:" && !value.starts_with("unix:/")) {
    throw Error(gsctl::kWrongUse, "--endpoint " + endpoint + ": give an absolute path, or unix:/PATH");
  }
  setenv("GSD_ENDPOINT", value.c_str(), 1);
}

int run(int argc, char** argv) {
  Settings settings;
  gsctl::Run chosen;
  CLI::App app("Looks at groups, changes them, and runs programs by what they decide.", "gsctl");
  app.set_version_flag("--version", "gsctl " GSCTL_VERSION);
  app.fallthrough();
  app.require_subcommand(0, 1);  // checked below: a wrong one is to be named
  app.footer(kFooter);
  add_common(app, settings);
  for (const gsctl::Command& command : gsctl::commands()) {
    CLI::App* added = app.add_subcommand(command.name, command.help);
    added->callback([&chosen, action = command.add(*added)] { chosen = action; });
  }
  if (!platform::parse_command_line(app, argc, argv)) return gsctl::kDone;
  if (!chosen) throw Error(gsctl::kWrongUse, "a COMMAND is needed: see gsctl --help");
  choose_daemon(settings.endpoint);
  return chosen(settings);
}

/// What is opened later must not be taken for standard input or output: a closed one reads as empty and refuses
/// what is written.
void occupy_standard_descriptors() {
  while (true) {
    const int number = open("/dev/null", O_RDONLY);
    if (number < 0) return;
    if (number > STDERR_FILENO) return void(close(number));
  }
}

}  // namespace

int main(int argc, char** argv) {
  occupy_standard_descriptors();
  signal(SIGPIPE, SIG_IGN);
  try {
    return run(argc, argv);
  } catch (const gsctl::OutputGone&) {
    return gsctl::kDone;  // who reads has seen enough
  } catch (const platform::SettingError& error) {
    gsctl::complain(error.what());
    return gsctl::kWrongUse;
  } catch (const Error& error) {
    gsctl::complain(error.what());
    return error.status();
  } catch (const gs::inspect::InspectError& lost) {
    const Error error = gsctl::explained(lost);
    gsctl::complain(error.what());
    return error.status();
  } catch (const std::exception& error) {
    gsctl::complain(error.what());
    return gsctl::kRefused;
  }
}
