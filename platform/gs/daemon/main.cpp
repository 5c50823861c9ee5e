// gsd: the group-services daemon, in the foreground or as a daemon.
#include <sys/resource.h>
#include <syslog.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <exception>
#include <functional>
#include <optional>

#include "common/held_signals.h"
#include "common/log.h"
#include "common/service_manager.h"
#include "daemon/options.h"
#include "daemon/server.h"
#include "daemon/service.h"

namespace {

constexpr int kExitFailure = 1;
constexpr int kExitBadOption = 2;

/// Every client needs three descriptors.
void raise_descriptor_limit() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
  limit.rlim_cur = limit.rlim_max;
  setrlimit(RLIMIT_NOFILE, &limit);
}

void tell_ready(int fd) {
  if (fd < 0) return;
  constexpr char kReady[] = "ready\n";
  if (write(fd, kReady, sizeof kReady - 1) < 0) perror("gsd: --ready-fd");
  close(fd);
}

void serve(gs::daemon::Options options, std::function<gs::daemon::Options()> reread) {
  // Never destroyed: SIGTERM may find it until the process ends.
  static auto* const service = new gs::daemon::Service(std::move(reread));
  if (options.daemon) service->detach();
  std::optional<platform::HeldSignals> held(std::in_place);
  const platform::ServiceManager manager;  // a daemon has closed all descriptors when it comes here
  raise_descriptor_limit();
  if (!options.log_file.empty()) platform::log_to_file(options.log_file);
  const auto log = platform::make_log("gsd", options.log_level);
  gs::daemon::Server server(options, log);
  service->attach(server, options, manager);
  held.reset();
  log->info("gsd " GSD_VERSION " {}", gs::daemon::serves(options));
  tell_ready(options.ready_fd);
  service->tell_ready();
  server.run();
  log->info("stopped");
}

/// A daemon's standard error may lead nowhere; whoever starts one looks into the system's log then.
int fail(const char* problem, int status, bool daemon) {
  fprintf(stderr, "gsd: %s\n", problem);
  if (!daemon) return status;
  openlog("gsd", LOG_PID, LOG_DAEMON);
  syslog(LOG_ERR, "%s", problem);
  return status;
}

}  // namespace

int main(int argc, char** argv) {
  bool daemon = false;
  signal(SIGPIPE, SIG_IGN);
  try {
    const auto options = gs::daemon::parse_options(argc, argv);
    if (!options) return 0;
    daemon = options->daemon;
    serve(*options, [=] { return *gs::daemon::parse_options(argc, argv); });
    return 0;
  } catch (const gs::daemon::OptionError& error) {
    return fail(error.what(), kExitBadOption, daemon);
  } catch (const std::exception& error) {
    return fail(error.what(), kExitFailure, daemon);
  }
}
