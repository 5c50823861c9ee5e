// The master: definitions, subsystems, and those who ask.
#pragma once

#include <spdlog/logger.h>

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "common/service_manager.h"
#include "master/control_server.h"
#include "master/definition.h"
#include "master/left_behind.h"
#include "master/loop.h"
#include "master/options.h"
#include "master/status_server.h"
#include "master/subsystem.h"

namespace kpl::master {

class Master {
 public:
  /// Listens. Throws platform::SettingError and platform::ListenError.
  Master(const Options& options, std::shared_ptr<spdlog::logger> log, const platform::ServiceManager& manager);

  /// Reads the definitions and starts the subsystems that are to start with the master.
  void start();
  /// Serves until SIGTERM or SIGINT, then ends all subsystems. SIGHUP opens the log file anew and reads the
  /// definitions again.
  void run() { loop_.run(); }

 private:
  void look_at_sockets();
  void on_hangup();
  void tell_ready() const;
  void read_definitions();
  void forget_undefined(const Folder& folder);
  /// Those without a process.
  void erase_undefined();
  bool believes(const Claim& claim) const;
  /// What is said of a process that an earlier master left behind; empty: none of that name runs.
  std::string left_behind(const std::string& name) const;
  void on_children();
  void on_terminate();
  void stop_when_all_ended();

  void on_request(const control::Request& request, const Reply& reply);
  void on_subsystem_request(Subsystem& subsystem, const control::Request& request, const Reply& reply);
  void tell_subsystems(const control::Request& request, const Reply& reply);
  std::optional<std::vector<control::Line>> short_status(const std::string& name, int pid) const;

  std::shared_ptr<spdlog::logger> log_;
  const platform::ServiceManager& manager_;
  const std::string log_file_;
  const std::string folder_;
  const std::string status_socket_;
  Loop loop_;
  std::map<std::string, Subsystem> subsystems_;
  std::vector<Folder::Skipped> skipped_;
  std::map<std::string, pid_t> left_behind_;  // by subsystem, what was found at the start
  bool stopping_ = false;
  ControlServer control_;  // first: its lock tells that this is the only master
  StatusServer status_;
  Event look_again_;
  Event children_;
  Event hangup_;
  Event terminated_;
  Event interrupted_;
  Event alive_;
};

}  // namespace kpl::master
