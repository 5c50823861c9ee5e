// kplmstr: the KPL master.
#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <optional>
#include <system_error>

#include "common/held_signals.h"
#include "common/log.h"
#include "common/service_manager.h"
#include "master/definition.h"
#include "master/master.h"
#include "master/options.h"
#include "master/parent.h"

namespace {

using kpl::master::Options;
using platform::Descriptor;

constexpr int kExitFailure = 1;
constexpr int kExitBadOption = 2;

/// Descriptors 0 to 2 are open, and 1 and 2 are the log file where one is wanted.
void set_standard_descriptors(const std::string& log_file) {
  const Descriptor null(open("/dev/null", O_RDWR | O_NOCTTY));
  if (null.get() >= 0 && null.get() <= STDERR_FILENO) return set_standard_descriptors(log_file);
  if (!log_file.empty()) platform::log_to_file(log_file);
}

/// A daemon keeps nothing of what it was started with.
void leave_standard_descriptors(bool keep_log) {
  const Descriptor null(open("/dev/null", O_RDWR | O_CLOEXEC | O_NOCTTY));
  if (!null) throw std::system_error(errno, std::generic_category(), "/dev/null");
  dup2(null.get(), STDIN_FILENO);
  if (keep_log) return;
  dup2(null.get(), STDOUT_FILENO);
  dup2(null.get(), STDERR_FILENO);
}

void tell_skipped(const kpl::master::Folder& folder) {
  for (const auto& skipped : folder.skipped) fprintf(stderr, "kplmstr: %s\n", skipped.problem.c_str());
}

int check(const Options& options) {
  const auto folder = kpl::master::read_folder(options.definitions);
  tell_skipped(folder);
  printf("%zu subsystems defined in %s\n", folder.definitions.size(), options.definitions.c_str());
  return folder.skipped.empty() ? 0 : kExitFailure;
}

/// The log will say it, too; but who starts a daemon looks here.
void tell_mistakes(const std::string& definitions) try {
  tell_skipped(kpl::master::read_folder(definitions));
} catch (const platform::SettingError& error) {
  fprintf(stderr, "kplmstr: %s\n", error.what());
}

/// Throws when subsystems would not take this process for the master: they would detach from it and be lost.
void be_the_parent() {
  setsid();  // fails where this process leads a group already, which parent_problem tells apart
  const std::string problem = kpl::master::parent_problem();
  if (!problem.empty()) throw std::runtime_error("cannot serve subsystems: " + problem);
  prctl(PR_SET_NAME, "kplmstr");  // the name that subsystems look for
}

void serve(const Options& options) {
  set_standard_descriptors("");
  static std::optional<kpl::master::Detached>
      detached;  // until the end: the caller waits for the reason to be told
  if (options.daemon) {
    tell_mistakes(options.definitions);
    close_range(STDERR_FILENO + 1, ~0U, 0);
    detached.emplace();
  }
  std::optional<platform::HeldSignals> held(std::in_place);
  const platform::ServiceManager manager;
  be_the_parent();
  umask(S_IWGRP | S_IWOTH);
  if (chdir("/") != 0) throw std::system_error(errno, std::generic_category(), "chdir");
  if (!options.daemon) set_standard_descriptors(options.log_file);
  const auto log = platform::make_log("kplmstr", options.log_level);
  kpl::master::Master master(options, log, manager);
  if (detached) {
    set_standard_descriptors(options.log_file);
    leave_standard_descriptors(!options.log_file.empty());
  }
  log->info("kplmstr " KPL_PROGRAM_VERSION " serves {}", options.socket_path);
  held.reset();
  master.start();
  if (detached) detached->ready();
  master.run();
  log->info("stopped");
}

}  // namespace

int main(int argc, char** argv) {
  signal(SIGPIPE, SIG_IGN);
  try {
    const auto options = kpl::master::parse_options(argc, argv);
    if (!options) return 0;
    if (options->check) return check(*options);
    serve(*options);
    return 0;
  } catch (const platform::SettingError& error) {
    fprintf(stderr, "kplmstr: %s\n", error.what());
    return kExitBadOption;
  } catch (const std::exception& error) {
    fprintf(stderr, "kplmstr: %s\n", error.what());
    return kExitFailure;
  }
}
