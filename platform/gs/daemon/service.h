// gsd as a daemon that the KPL master, a service manager or a shell starts.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "common/service_manager.h"
#include "daemon/options.h"
#include "daemon/server.h"
#include "gscl/KPLDriver.h"

namespace gs::daemon {

/// Serves the master's requests on the server's loop: long status, trace on and off (requests and their answers in
/// the log, with the long trace the notifications as well), refresh (the configuration is read again) and stop.
/// Whoever started it, SIGTERM stops the server and SIGHUP is a refresh.
class Service : public zelt_gscl_V1::KPLDriver {
 public:
  /// `reread`: the options anew, as command line and configuration file have them now. It may throw OptionError.
  explicit Service(std::function<Options()> reread) : reread_(std::move(reread)) {}

  /// Makes the process a daemon; from a shell it is another one afterwards. Throws std::runtime_error with the
  /// failing step.
  void detach();
  /// Serves requests until the server stops. `options` are those in force. All outlive the requests.
  void attach(Server& server, Options& options, const platform::ServiceManager& manager);
  /// The service manager may take the daemon for started.
  void tell_ready() const;

 private:
  void traceBegin(int dae_long) override;
  void traceEnd() override;
  void refresh() override;
  void longStatus() override;
  void on_request();
  void on_hangup();
  /// What has to wait for the next start, a line each. Throws what is wrong; nothing has changed then.
  std::vector<std::string> read_again();

  const std::function<Options()> reread_;
  Server* server_ = nullptr;
  Options* options_ = nullptr;
  const platform::ServiceManager* manager_ = nullptr;
  bool tracing_ = false;
};

}  // namespace gs::daemon
