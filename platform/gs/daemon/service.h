// gsd as a daemon that the KPL master, a service manager or a shell starts.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "daemon/options.h"
#include "daemon/server.h"
#include "gscl/KPLDriver.h"

namespace gs::daemon {

/// Serves the master's requests on the server's loop: long status, trace on and off (requests and their answers in
/// the log, with the long trace the notifications as well), refresh (the configuration is read again) and stop.
/// SIGTERM stops the server whoever started it.
class Service : public zelt_gscl_V1::KPLDriver {
 public:
  /// `reread`: the options anew, as command line and configuration file have them now. It may throw OptionError.
  explicit Service(std::function<Options()> reread) : reread_(std::move(reread)) {}

  /// Makes the process a daemon; from a shell it is another one afterwards. Throws std::runtime_error with the
  /// failing step.
  void detach();
  /// Serves requests until the server stops. `options` are those in force. Both outlive the requests.
  void attach(Server& server, Options& options);

 private:
  void traceBegin(int dae_long) override;
  void traceEnd() override;
  void refresh() override;
  void longStatus() override;
  void on_request();

  const std::function<Options()> reread_;
  Server* server_ = nullptr;
  Options* options_ = nullptr;
  bool tracing_ = false;
};

}  // namespace gs::daemon
