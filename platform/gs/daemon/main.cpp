// gsd: the group-services daemon, in the foreground.
#include <sys/resource.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <exception>

#include "common/log.h"
#include "daemon/options.h"
#include "daemon/server.h"

namespace {

constexpr int kExitFailure = 1;
constexpr int kExitBadOption = 2;

/// Every client needs two descriptors.
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

void serve(const gs::daemon::Options& options) {
  signal(SIGPIPE, SIG_IGN);
  raise_descriptor_limit();
  const auto log = platform::make_log("gsd", options.log_level);
  gs::daemon::Server server(options, log);
  log->info("gsd " GSD_VERSION " serves {} as node {}", options.socket_path, options.node_number);
  tell_ready(options.ready_fd);
  server.run();
  log->info("stopped");
}

}  // namespace

int main(int argc, char** argv) {
  try {
    const auto options = gs::daemon::parse_options(argc, argv);
    if (options) serve(*options);
    return 0;
  } catch (const gs::daemon::OptionError& error) {
    fprintf(stderr, "gsd: %s\n", error.what());
    return kExitBadOption;
  } catch (const std::exception& error) {
    fprintf(stderr, "gsd: %s\n", error.what());
    return kExitFailure;
  }
}
