#include "ctl/options.h"

#include "common/command_line.h"

namespace kpl::ctl {
namespace {

using control::Action;
using control::StopKind;

constexpr int kMinParameter = -32768;
constexpr int kMaxParameter = 32767;

constexpr char kFooter[] =
    "Exit status: 0 done, 1 the subsystem or the master reported an error, 2 wrong use,\n"
    "3 the master cannot be reached, 4 no such subsystem or not in the state for it,\n"
    "5 no answer within its time, 6 not supported by the subsystem";

CLI::App* add_command(CLI::App& app, Options& options, const char* name, const char* help, Action action) {
  CLI::App* command = app.add_subcommand(name, help);
  command->callback([&options, action] { options.request.action = action; });
  return command;
}

void add_subsystem(CLI::App* command, Options& options) {
  CLI::Option* name = command->add_option("SUBSYSTEM", options.request.subsystem, "Its name")->type_name("");
  command->add_option("-g,--group", options.group, "All subsystems of this group instead")
      ->type_name("GROUP")
      ->excludes(name);
}

CLI::App* add_stop(CLI::App& app, Options& options, const char* name, const char* help) {
  CLI::App* stop = add_command(app, options, name, help, Action::kStop);
  CLI::Option* forced = stop->add_flag_callback(
      "--forced", [&options] { options.request.stop = StopKind::kForced; }, "Without its usual care");
  stop->add_flag_callback(
          "--cancel", [&options] { options.request.stop = StopKind::kCancel; }, "By SIGTERM, then SIGKILL")
      ->excludes(forced);
  add_subsystem(stop, options);
  return stop;
}

void add_trace(CLI::App& app, Options& options) {
  CLI::App* trace = add_command(app, options, "trace", "Switch a subsystem's trace", Action::kTrace);
  trace
      ->add_option_function<std::string>(
          "SWITCH", [&options](const std::string& text) { options.request.on = text == "on"; }, "on or off")
      ->type_name("")
      ->required()
      ->check(CLI::IsMember({"on", "off"}));
  trace->add_flag("--long", options.request.long_form, "A long trace");
  add_subsystem(trace, options);
}

void add_request(CLI::App& app, Options& options) {
  control::Request& request = options.request;
  CLI::App* own = add_command(app, options, "request", "Send a subsystem a request of its own", Action::kRequest);
  own->add_option("SUBSYSTEM", request.subsystem, "Its name")->type_name("")->required();
  own->add_option("CODE", request.code, "256 to 32767, as the subsystem documents it")
      ->type_name("")
      ->required()
      ->check(CLI::Range(256, kMaxParameter));
  own->add_option("DATA", request.data, "Text that goes with it")->type_name("");
  own->add_option("--parm1", request.parm1, "First parameter")->check(CLI::Range(kMinParameter, kMaxParameter));
  own->add_option("--parm2", request.parm2, "Second parameter")->check(CLI::Range(kMinParameter, kMaxParameter));
}

bool needs_subsystem(const control::Request& request) {
  return request.action != Action::kList && (request.action != Action::kStatus || request.long_form);
}

void check(const Options& options) {
  if (needs_subsystem(options.request) && options.request.subsystem.empty() && options.group.empty()) {
    throw platform::SettingError("a SUBSYSTEM or --group is needed");
  }
  if (options.request.data.size() > control::kMaxData) {
    throw platform::SettingError("DATA: at most " + std::to_string(control::kMaxData) + " bytes");
  }
  try {
    control::encode(options.request);
  } catch (const control::Malformed& error) {
    throw platform::SettingError(error.what());
  }
}

}  // namespace

std::optional<Options> parse_options(int argc, const char* const* argv) {
  Options options;
  CLI::App app("Asks kplmstr, the KPL master: starts, stops and examines subsystems.", "kplctl");
  app.set_version_flag("--version", "kplctl " KPL_PROGRAM_VERSION);
  app.add_option("--socket-path", options.socket_path, "The master's socket")
      ->capture_default_str()
      ->type_name("PATH");
  app.add_flag("--json", options.json, "Answer in JSON, for scripts");
  app.require_subcommand(0, 1);  // checked below: a wrong one is to be named
  app.fallthrough();
  app.footer(kFooter);
  add_subsystem(add_command(app, options, "start", "Start a subsystem", Action::kStart), options);
  add_stop(app, options, "stop", "Stop a subsystem and wait for its end");
  add_stop(app, options, "restart", "Stop a subsystem if it runs, and start it")
      ->parse_complete_callback([&options] { options.restart = true; });
  CLI::App* status =
      add_command(app, options, "status", "Tell the state of all subsystems, or of one", Action::kStatus);
  status->add_flag("--long", options.request.long_form, "What the subsystem itself tells");
  add_subsystem(status, options);
  add_trace(app, options);
  add_subsystem(
      add_command(app, options, "refresh", "Have a subsystem read its configuration again", Action::kRefresh),
      options);
  add_request(app, options);
  add_command(app, options, "list", "Tell how subsystems are defined", Action::kList);
  if (!platform::parse_command_line(app, argc, argv)) return std::nullopt;
  if (app.get_subcommands().empty()) throw platform::SettingError("a COMMAND is needed, see --help");
  check(options);
  return options;
}

}  // namespace kpl::ctl
