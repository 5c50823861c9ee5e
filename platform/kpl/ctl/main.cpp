// kplctl: asks the KPL master.
#include <algorithm>
#include <cstdio>

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

void print(FILE* to, const std::string& text) { fwrite(text.data(), 1, text.size(), to); }
void print_json(const json& value) {
  print(stdout, value.dump(2, ' ', false, json::error_handler_t::replace) + "\n");
}

Outcome ask(Client& client, const kpl::control::Request& request) {
  Outcome outcome;
  outcome.subsystem = request.subsystem;
  outcome.end = client.ask(request, [&](const kpl::control::Answer& answer) {
    if (const auto* message = std::get_if<kpl::control::Message>(&answer))
      outcome.messages.push_back(message->text);
    if (const auto* entry = std::get_if<kpl::control::Entry>(&answer)) outcome.entries.push_back(entry->subsystem);
    const auto* lines = std::get_if<kpl::control::Lines>(&answer);
    if (lines != nullptr) outcome.lines.insert(outcome.lines.end(), lines->lines.begin(), lines->lines.end());
  });
  return outcome;
}

/// What subsystems say may come from their clients and must not steer a terminal.
void print_text(FILE* to, std::string text) {
  std::replace_if(
      text.begin(), text.end(), [](unsigned char c) { return (c < 0x20 && c != '\n' && c != '\t') || c == 0x7f; },
      '?');
  print(to, text);
}

void print_for_people(const Outcome& outcome) {
  for (const std::string& message : outcome.messages) print_text(stdout, message + "\n");
  print_text(stdout, kpl::ctl::long_status(outcome.lines));
  if (outcome.end.text.empty()) return;
  const bool good = outcome.end.result == Result::kOk;
  print_text(good ? stdout : stderr, (good ? "" : "kplctl: ") + outcome.end.text + "\n");
}

kpl::control::End no_such_group(const std::string& group) {
  return {Result::kWrongState, 0, "there is no subsystem in group '" + group + "'"};
}

/// `list`, and `status` without --long: the master's own knowledge.
int tell_subsystems(Client& client, const Options& options) {
  Outcome outcome = ask(client, options.request);
  const auto in_other_group = [&](const json& entry) {
    return !options.group.empty() && entry.value("group", "") != options.group;
  };
  std::erase_if(outcome.entries, in_other_group);
  if (!options.group.empty() && outcome.entries.empty() && outcome.end.result == Result::kOk) {
    outcome.end = no_such_group(options.group);
  }
  const bool list = options.request.action == Action::kList;
  if (options.json) {
    json answer = kpl::ctl::to_json(outcome);
    answer["subsystems"] = outcome.entries;
    for (const char* unused : {"subsystem", "lines", "code"}) answer.erase(unused);
    print_json(answer);
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
    if (entry.value("group", "") == options.group) names.push_back(entry.value("name", ""));
  }
  *end = all.end;
  if (names.empty() && end->result == Result::kOk) {
    *end = no_such_group(options.group);
  }
  return names;
}

/// Asks one after the other; the first failure is the exit status.
int ask_subsystems(Client& client, const Options& options) {
  kpl::control::End end;
  const std::vector<std::string> names = names_of(client, options, &end);
  std::vector<Outcome> outcomes;
  for (const std::string& name : names) {
    kpl::control::Request request = options.request;
    request.subsystem = name;
    outcomes.push_back(ask(client, request));
    if (end.result == Result::kOk) end.result = outcomes.back().end.result;
    if (!options.group.empty() && !options.json) print(stdout, name + ":\n");
    if (!options.json) print_for_people(outcomes.back());
  }
  if (names.empty()) {
    outcomes.push_back({options.group, end, {}, {}, {}});
    if (!options.json) print_for_people(outcomes.back());
  }
  if (!options.json) return static_cast<int>(end.result);
  json results = json::array();
  for (const Outcome& outcome : outcomes) results.push_back(kpl::ctl::to_json(outcome));
  print_json({{"results", std::move(results)}});
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
