// What the master knows of a subsystem before it is started: a TOML file for each, in one folder. The settings are
// described in kplmstr(8).
#pragma once

#include <chrono>
#include <csignal>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "common/settings.h"

namespace kpl::master {

using Duration = std::chrono::milliseconds;

inline double in_seconds(Duration time) { return static_cast<double>(time.count()) / 1000; }

enum class Transport { kSocket, kQueue, kSignals };

const char* name_of(Transport transport);

struct Definition {
  std::string file;
  std::string name;   // 1 to 29 characters
  std::string group;  // of subsystems; may be empty
  std::string program;
  std::vector<std::string> arguments;
  std::string user = "root";  // name or number
  std::string output;         // file for what it writes; empty: the master's log
  std::map<std::string, std::string> environment;
  std::vector<std::string> pass_environment;  // names; the values are the master's
  bool autostart = false;
  bool restart = false;  // after an end that nobody asked for
  Transport transport = Transport::kSocket;
  int queue_key = 0;  // with Transport::kQueue
  int queue_type = 1;
  int normal_signal = SIGTERM;  // with Transport::kSignals
  int forced_signal = SIGTERM;
  Duration request_time{10'000};  // for an answer
  Duration stop_time{20'000};     // for the end after a stop request
  Duration restart_delay{1'000};  // before the first restart; doubles with each crash
  Duration restart_delay_max{60'000};
  std::optional<Duration> ping_interval;  // nothing: no pings
  Duration ping_limit{10'000};            // for its answer; after that it counts as hung
};

/// Throws platform::SettingError: "FILE:LINE: what", or "FILE: what".
Definition read_definition(const std::string& file);
/// The same of a file's content.
Definition parse_definition(const std::string& content, const std::string& file);

struct Folder {
  struct Skipped {
    std::string file;
    std::string problem;  // one line, with the file
  };
  std::vector<Definition> definitions;  // sorted by file name
  std::vector<Skipped> skipped;
};

/// All files *.toml of the folder. A broken one, or one whose name or queue was taken before it, is skipped.
/// Throws platform::SettingError: the folder cannot be read. Folder and files are to be root's, or this user's,
/// alone.
Folder read_folder(const std::string& folder);

}  // namespace kpl::master
