// kplctl: asks the KPL master.
#include <cstdio>

#include "common/printable.h"
#include "ctl/client.h"
#include "ctl/options.h"
#include "ctl/output.h"

namespace {

using kpl::control::Action;
using kpl::control::Result;
using kpl::ctl::Client;
using kpl::ctl::Options;
using kpl::ctl::Outcome;
using nlohmann::json;

constexpr int kExitFailure = 1;
constexpr int kExitBadOption = 2;

/// What subsystems say may come from their clients, and must not steer a terminal; nor must what claims to be the
/// master.
void print(FILE* to, const std::string& text) {
  const std::string shown = platform::printable(text, "\n\t");
  fwrite(shown.data(), 1, shown.size(), to);
}

Outcome ask(Client& client, const kpl::control::Request& request) {
  Outcome outcome;
  outcome.subsystem = request.subsystem;
  outcome.end = client.ask(request, [&](const kpl::control::Answer& answer) { outcome.add(answer); });
  return outcome;
}

void print_for_people(const Outcome& outcome) {
  for (const std::string& message : outcome.messages) print(stdout, message + "\n");
  print(stdout, kpl::ctl::long_status(outcome.lines));
  if (outcome.end.text.empty()) return;
  const bool good = outcome.end.result == Result::kOk;
  print(good ? stdout : stderr, (good ? "" : "kplctl: ") + outcome.end.text + "\n");
}

kpl::control::End no_such_group(const std::string& group) {
  return {Result::kWrongState, 0, "there is no subsystem in group '" + group + "'"};
}

/// `list`, and `status` without --long: the master's own knowledge.
int tell_subsystems(Client& client, const Options& options) {
  Outcome outcome = ask(client, options.request);
  const auto in_other_group = [&](const json& entry) {
    return !options.group.empty() && kpl::ctl::name_of(entry, "group") != options.group;
  };
  std::erase_if(outcome.entries, in_other_group);
  if (!options.group.empty() && outcome.entries.empty() && outcome.end.result == Result::kOk) {
    outcome.end = no_such_group(options.group);
  }
  const bool list = options.request.action == Action::kList;
  if (options.json) {
    json answer = kpl::ctl::to_json(outcome);
    answer["subsystems"] = outcome.entries;
    for (const char* unused : {"subsystem", "code"}) answer.erase(unused);
    print(stdout, kpl::ctl::json_text(answer));
  } else if (outcome.end.result == Result::kOk) {
    print(stdout, list ? kpl::ctl::definition_table(outcome.entries) : kpl::ctl::status_table(outcome.entries));
  }
  if (options.json) return static_cast<int>(outcome.end.result);
  for (const std::string& message : outcome.messages) print(stderr, "kplctl: " + message + "\n");
  if (!outcome.end.text.empty()) print(stderr, "kplctl: " + outcome.end.text + "\n");
  return static_cast<int>(outcome.end.result);
}

/// The subsystems that are meant, by name.
std::vector<std::string> names_of(Client& client, const Options& options, kpl::control::End* end) {
  if (options.group.empty()) return {options.request.subsystem};
  kpl::control::Request list;
  const Outcome all = ask(client, list);
  std::vector<std::string> names;
  for (const json& entry : all.entries) {
    if (kpl::ctl::name_of(entry, "group") == options.group) names.push_back(kpl::ctl::name_of(entry, "name"));
  }
  *end = all.end;
  if (names.empty() && end->result == Result::kOk) {
    *end = no_such_group(options.group);
  }
  return names;
}

/// A stop and a start. One that does not run is just started; one that cannot be stopped is left alone.
Outcome restart(Client& client, kpl::control::Request request) {
  const Outcome stopped = ask(client, request);
  if (stopped.end.result != Result::kOk && stopped.end.result != Result::kWrongState) {
    Outcome failed = stopped;
    failed.end.text = "not stopped, so not started: " + failed.end.text;
    return failed;
  }
  request.action = Action::kStart;
  Outcome started = ask(client, request);
  if (stopped.end.result == Result::kOk) started.messages.insert(started.messages.begin(), stopped.end.text);
  if (started.end.result == Result::kOk) return started;
  started.end.text = "not started: " + started.end.text;
  return started;
}

Outcome ask_one(Client& client, const Options& options, const std::string& name) {
  kpl::control::Request request = options.request;
  request.subsystem = name;
  if (options.restart) return restart(client, request);
  Outcome outcome = ask(client, request);
  outcome.long_form = request.action == Action::kStatus;
  if (!outcome.long_form || !options.json) return outcome;
  request.long_form = false;
  outcome.entries = ask(client, request).entries;
  return outcome;
}

/// Asks one after the other; the first failure is the exit status.
int ask_subsystems(Client& client, const Options& options) {
  kpl::control::End end;
  const std::vector<std::string> names = names_of(client, options, &end);
  std::vector<Outcome> outcomes;
  for (const std::string& name : names) {
    outcomes.push_back(ask_one(client, options, name));
    if (end.result == Result::kOk) end.result = outcomes.back().end.result;
    if (!options.group.empty() && !options.json) print(stdout, name + ":\n");
    if (!options.json) print_for_people(outcomes.back());
  }
  if (names.empty()) {
    outcomes.push_back({options.group, end, {}, {}, {}, false});
    if (!options.json) print_for_people(outcomes.back());
  }
  if (!options.json) return static_cast<int>(end.result);
  json results = json::array();
  for (const Outcome& outcome : outcomes) results.push_back(kpl::ctl::to_json(outcome));
  print(stdout, kpl::ctl::json_text({{"results", std::move(results)}}));
  return static_cast<int>(end.result);
}

}  // namespace

int main(int argc, char** argv) {
  try {
    const auto options = kpl::ctl::parse_options(argc, argv);
    if (!options) return 0;
    Client client(options->socket_path);
    const Action action = options->request.action;
    if (action == Action::kList || (action == Action::kStatus && !options->request.long_form)) {
      return tell_subsystems(client, *options);
    }
    return ask_subsystems(client, *options);
  } catch (const platform::SettingError& error) {
    fprintf(stderr, "kplctl: %s\n", error.what());
    return kExitBadOption;
  } catch (const std::exception& error) {
    fprintf(stderr, "kplctl: %s\n", error.what());
    return kExitFailure;
  }
}
