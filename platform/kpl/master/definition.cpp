#include "master/definition.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cstring>
#include <filesystem>
#include <iterator>
#include <system_error>

#include "common/place.h"
#include "common/toml_file.h"
#include "kpl.h"

namespace kpl::master {
namespace {

using platform::place_of;
using platform::Problem;
using platform::SettingError;

constexpr std::size_t kMaxName = sizeof(subreq::objname) - 1;
constexpr double kMinSeconds = 0.001;
constexpr double kMaxSeconds = 86'400;
constexpr int kMaxSignal = 30;

Problem set_text(const toml::value& value, std::string* text) {
  if (!value.is_string()) return "must be a text in quotes";
  *text = value.as_string().str;
  if (text->find('\0') != std::string::npos) return "may hold no NUL";
  return {};
}

/// Names go into status lines and log lines, and into records of fixed size.
Problem set_name(const toml::value& value, std::string* name) {
  Problem problem = set_text(value, name);
  if (!problem.empty()) return problem;
  const auto allowed = [](unsigned char c) { return std::isalnum(c) || strchr("._-", c) != nullptr; };
  if (!name->empty() && name->size() <= kMaxName && std::all_of(name->begin(), name->end(), allowed)) return {};
  return "must be 1 to " + std::to_string(kMaxName) + " letters, digits, '.', '_' or '-'";
}

Problem set_path(const toml::value& value, std::string* path) {
  Problem problem = set_text(value, path);
  if (problem.empty() && !path->starts_with('/')) problem = "must be a path that begins with '/'";
  return problem;
}

Problem set_number(const toml::value& value, int min, int max, int* number) {
  if (value.is_integer() && value.as_integer() >= min && value.as_integer() <= max) {
    *number = static_cast<int>(value.as_integer());
    return {};
  }
  return "must be a whole number from " + std::to_string(min) + " to " + std::to_string(max);
}

Problem set_truth(const toml::value& value, bool* truth) {
  if (!value.is_boolean()) return "must be true or false";
  *truth = value.as_boolean();
  return {};
}

Problem set_seconds(const toml::value& value, Duration* time) {
  double seconds = 0;
  if (value.is_integer()) seconds = static_cast<double>(value.as_integer());
  if (value.is_floating()) seconds = value.as_floating();
  if (!(seconds >= kMinSeconds && seconds <= kMaxSeconds)) return "must be 0.001 to 86400 seconds";
  *time = std::chrono::duration_cast<Duration>(std::chrono::duration<double>(seconds));
  return {};
}

Problem set_signal(const toml::value& value, int* signal) {
  std::string name;
  Problem problem = set_text(value, &name);
  if (!problem.empty()) return problem;
  if (name.starts_with("SIG")) name.erase(0, 3);
  for (int number = 1; number <= kMaxSignal; ++number) {
    const char* known = sigabbrev_np(number);
    if (known == nullptr || name != known) continue;
    *signal = number;
    return {};
  }
  return "must be the name of a signal, such as \"SIGUSR1\"";
}

Problem set_texts(const toml::value& value, std::vector<std::string>* texts) {
  if (!value.is_array()) return "must be a list of texts in quotes";
  for (const toml::value& one : value.as_array()) {
    Problem problem = set_text(one, &texts->emplace_back());
    if (!problem.empty()) return "each " + problem;
  }
  return {};
}

/// KPL's own say what the subsystem is to the next master, and where it asks this one.
Problem variable_problem(const std::string& name) {
  const auto allowed = [](unsigned char c) { return std::isalnum(c) || c == '_'; };
  const bool fine = !name.empty() && !std::isdigit(static_cast<unsigned char>(name[0])) &&
                    std::all_of(name.begin(), name.end(), allowed);
  if (!fine) return "names are made of letters, digits and '_'";
  return name.starts_with("KPL_") ? "'" + name + "' is set by kplmstr" : "";
}

Problem set_environment(const toml::value& value, std::map<std::string, std::string>* environment) {
  if (!value.is_table()) return "must be a table of names and texts in quotes";
  for (const auto& [name, text] : value.as_table()) {
    Problem problem = variable_problem(name);
    if (problem.empty()) problem = set_text(text, &(*environment)[name]);
    if (!problem.empty()) return problem;
  }
  return {};
}

Problem set_pass_environment(const toml::value& value, std::vector<std::string>* names) {
  Problem problem = set_texts(value, names);
  for (auto name = names->begin(); problem.empty() && name != names->end(); ++name) {
    problem = variable_problem(*name);
  }
  return problem;
}

Problem set_transport(const toml::value& value, Transport* transport) {
  std::string name;
  Problem problem = set_text(value, &name);
  if (!problem.empty()) return problem;
  for (const Transport known : {Transport::kSocket, Transport::kQueue, Transport::kSignals}) {
    if (name != name_of(known)) continue;
    *transport = known;
    return {};
  }
  return "must be \"socket\", \"queue\" or \"signals\"";
}

using Value = const toml::value&;

struct Setting {
  const char* name;
  Problem (*set)(Definition&, Value);
};
constexpr Setting kSettings[] = {
    {"name", [](Definition& d, Value v) { return set_name(v, &d.name); }},
    {"group", [](Definition& d, Value v) { return set_name(v, &d.group); }},
    {"program", [](Definition& d, Value v) { return set_path(v, &d.program); }},
    {"arguments", [](Definition& d, Value v) { return set_texts(v, &d.arguments); }},
    {"user", [](Definition& d, Value v) { return set_text(v, &d.user); }},
    {"output", [](Definition& d, Value v) { return set_path(v, &d.output); }},
    {"environment", [](Definition& d, Value v) { return set_environment(v, &d.environment); }},
    {"pass-environment", [](Definition& d, Value v) { return set_pass_environment(v, &d.pass_environment); }},
    {"autostart", [](Definition& d, Value v) { return set_truth(v, &d.autostart); }},
    {"restart", [](Definition& d, Value v) { return set_truth(v, &d.restart); }},
    {"transport", [](Definition& d, Value v) { return set_transport(v, &d.transport); }},
    {"queue-key", [](Definition& d, Value v) { return set_number(v, 1, INT32_MAX, &d.queue_key); }},
    {"queue-type", [](Definition& d, Value v) { return set_number(v, 1, INT32_MAX, &d.queue_type); }},
    {"normal-signal", [](Definition& d, Value v) { return set_signal(v, &d.normal_signal); }},
    {"forced-signal", [](Definition& d, Value v) { return set_signal(v, &d.forced_signal); }},
    {"request-time", [](Definition& d, Value v) { return set_seconds(v, &d.request_time); }},
    {"stop-time", [](Definition& d, Value v) { return set_seconds(v, &d.stop_time); }},
    {"restart-delay", [](Definition& d, Value v) { return set_seconds(v, &d.restart_delay); }},
    {"restart-delay-max", [](Definition& d, Value v) { return set_seconds(v, &d.restart_delay_max); }},
    {"ping-interval", [](Definition& d, Value v) { return set_seconds(v, &d.ping_interval.emplace()); }},
    {"ping-limit", [](Definition& d, Value v) { return set_seconds(v, &d.ping_limit); }},
};

void apply(const std::string& name, const toml::value& value, Definition& definition) {
  const auto* setting =
      std::find_if(std::begin(kSettings), std::end(kSettings), [&](const Setting& s) { return name == s.name; });
  if (setting == std::end(kSettings)) throw SettingError(place_of(value) + ": unknown setting '" + name + "'");
  const Problem problem = setting->set(definition, value);
  if (!problem.empty()) throw SettingError(place_of(value) + ": " + name + ": " + problem);
}

/// Settings that say nothing without another one are mistakes.
void check(const toml::value& file, const Definition& definition) {
  for (const char* needed : {"name", "program"}) {
    if (!file.contains(needed)) throw SettingError(definition.file + ": '" + needed + "' is missing");
  }
  const bool queue = definition.transport == Transport::kQueue;
  if (queue && definition.queue_key == 0) {
    throw SettingError(place_of(file.at("transport")) + ": transport: a queue needs a 'queue-key' too");
  }
  const auto refuse = [&](const char* name, const char* transport) {
    if (!file.contains(name)) return;
    throw SettingError(place_of(file.at(name)) + ": " + name + ": is for transport = \"" + transport + "\" only");
  };
  if (!queue) {
    refuse("queue-key", "queue");
    refuse("queue-type", "queue");
  }
  if (definition.transport != Transport::kSignals) {
    refuse("normal-signal", "signals");
    refuse("forced-signal", "signals");
  }
  if (!definition.ping_interval && file.contains("ping-limit")) {
    throw SettingError(place_of(file.at("ping-limit")) + ": ping-limit: needs a 'ping-interval' too");
  }
  if (definition.ping_interval && definition.transport == Transport::kSignals) {
    throw SettingError(place_of(file.at("ping-interval")) + ": ping-interval: signals carry no pings");
  }
}

/// What no two subsystems may have: each makes its queue anew when it starts.
void check_shared(const Definition& definition, const Definition& other) {
  const auto refuse = [&](const std::string& what) {
    throw SettingError(definition.file + ": " + what + " is taken by " + other.file);
  };
  if (definition.name == other.name) refuse("name: '" + definition.name + "'");
  if (definition.queue_key != 0 && definition.queue_key == other.queue_key) {
    refuse("queue-key: " + std::to_string(definition.queue_key));
  }
}

Definition definition_of(const toml::value& content, const std::string& file) {
  Definition definition;
  definition.file = file;
  for (const auto& [name, value] : content.as_table()) apply(name, value, definition);
  check(content, definition);
  return definition;
}

/// What others could change would run as root at their word.
void check_owner(const struct stat& found, const std::string& path) {
  const bool trusted = found.st_uid == 0 || found.st_uid == geteuid();
  if (!trusted) throw SettingError(path + ": belongs to user " + std::to_string(found.st_uid) + ", not to root");
  if ((found.st_mode & (S_IWGRP | S_IWOTH)) == 0) return;
  throw SettingError(path + ": can be written by others than root (chmod go-w)");
}

/// Of the file whose owner was looked at, and of no other: by then the name may lead elsewhere.
std::string content_of_roots_own(const std::string& path) {
  const auto unreadable = [&] { return SettingError(path + ": cannot be read: " + strerror(errno)); };
  const platform::Descriptor file(open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY));
  if (!file) throw unreadable();
  const auto found = platform::file_of(file.get());
  if (!found) throw unreadable();
  if (!S_ISREG(found->st_mode)) throw SettingError(path + ": is no regular file");
  check_owner(*found, path);
  std::string content(platform::kMaxTomlFile + 1, '\0');  // one more, so that a longer one shows
  std::size_t length = 0;
  while (length < content.size()) {
    const ssize_t got = read(file.get(), content.data() + length, content.size() - length);
    if (got < 0) throw unreadable();
    if (got == 0) break;
    length += static_cast<std::size_t>(got);
  }
  content.resize(length);
  return content;
}

std::vector<std::string> toml_files(const std::string& folder) {
  std::error_code error;
  std::vector<std::string> files;
  std::filesystem::directory_iterator entries(folder, error);
  for (; !error && entries != std::filesystem::directory_iterator(); entries.increment(error)) {
    if (entries->path().extension() == ".toml") files.push_back(entries->path());
  }
  if (error) throw SettingError(folder + ": cannot be read: " + error.message());
  std::sort(files.begin(), files.end());
  return files;
}

}  // namespace

const char* name_of(Transport transport) {
  switch (transport) {
    case Transport::kSocket:
      return "socket";
    case Transport::kQueue:
      return "queue";
    case Transport::kSignals:
      return "signals";
  }
  return "unknown";
}

Definition read_definition(const std::string& file) { return parse_definition(content_of_roots_own(file), file); }

Definition parse_definition(const std::string& content, const std::string& file) {
  return definition_of(platform::parse_toml(content, file), file);
}

Folder read_folder(const std::string& folder) {
  Folder result;
  struct stat found {};
  if (stat(folder.c_str(), &found) == 0) check_owner(found, folder);  // else told where it is read
  for (const std::string& file : toml_files(folder)) {
    try {
      Definition definition = read_definition(file);
      for (const Definition& other : result.definitions) check_shared(definition, other);
      result.definitions.push_back(std::move(definition));
    } catch (const SettingError& error) {
      result.skipped.push_back({file, error.what()});
    }
  }
  return result;
}

}  // namespace kpl::master
