// The master: definitions, subsystems, and those who ask.
#pragma once

#include <spdlog/logger.h>

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "master/control_server.h"
#include "master/loop.h"
#include "master/options.h"
#include "master/status_server.h"
#include "master/subsystem.h"

namespace kpl::master {

class Master {
 public:
  /// Reads the definitions and listens. Throws platform::SettingError and platform::ListenError.
  Master(const Options& options, std::shared_ptr<spdlog::logger> log);

  /// Starts the subsystems that are to start with the master.
  void start_subsystems();
  /// Serves until SIGTERM or SIGINT, then ends all subsystems. SIGHUP reads the definitions again.
  void run() { loop_.run(); }

 private:
  void read_definitions();
  void on_children();
  void on_terminate();
  void stop_when_all_ended();

  void on_request(const control::Request& request, const Reply& reply);
  void on_subsystem_request(Subsystem& subsystem, const control::Request& request, const Reply& reply);
  void tell_subsystems(const control::Request& request, const Reply& reply);
  std::optional<std::vector<control::Line>> short_status(const std::string& name, int pid) const;

  std::shared_ptr<spdlog::logger> log_;
  const std::string folder_;
  const std::string status_socket_;
  Loop loop_;
  std::map<std::string, Subsystem> subsystems_;
  std::vector<std::string> problems_;  // files that are skipped
  bool stopping_ = false;
  ControlServer control_;  // first: its lock tells that this is the only master
  StatusServer status_;
  Event children_;
  Event hangup_;
  Event terminated_;
  Event interrupted_;
};

}  // namespace kpl::master
