// A small daemon for the tests: starts as its options say, reports to the test's socket what came of it, serves
// its requests, and does what the test's commands say. Usage: daemon_probe REPORT-ADDRESS [OPTION...]
//
// Options: mask=N  sock[=FD]  term  keep=MASK  excl=PATH  psalloc=N  zombies  trace=PATH. Commands: again, fork,
// reap, exit, crash
#include <errno.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/resource.h>
#include <sys/wait.h>

#include <map>
#include <sstream>

#include "dae/dae.h"
#include "datagram.h"
#include "gscl/GSDebug.h"

namespace {

std::string report_to;
std::map<std::string, std::string> options;
int request_fd = -1;

void report(const std::string& text) { Datagram().send(report_to, text); }

int number_in(const std::string& option, int otherwise) {
  return options[option].empty() ? otherwise : std::stoi(options[option]);
}

void cancel(int) {}

void apply_options() {
  dae_req_sock_t routines = {};
  routines.dae_stop_cancel = cancel;
  if (options.contains("sock")) {
    request_fd = number_in("sock", -1);
    dae_init_KPL_sock(&request_fd, &routines, 8);
  }
  if (options.contains("term")) dae_init_term_sig(routines.dae_stop_cancel, 0);
  if (options.contains("keep")) dae_init_keep_files_open(number_in("keep", 7));
  if (options.contains("zombies")) dae_init_prevent_zombies(7, 8);
  if (options.contains("psalloc")) {
    dae_init_psalloc(7, static_cast<dae_psalloc_t>(number_in("psalloc", 0)), "x", nullptr);
  }
  if (options.contains("excl")) dae_init_exclusive(7, options["excl"].c_str(), 'p');
}

std::string action_of(int signo) {
  struct sigaction action;
  sigaction(signo, nullptr, &action);
  const std::string handler = action.sa_handler == SIG_DFL  ? "default"
                              : action.sa_handler == cancel ? "cancel"
                                                            : "other";
  return handler + (action.sa_flags & SA_RESTART ? ",restart" : "") +
         (action.sa_flags & SA_NOCLDSTOP ? ",ended" : "");
}

/// Starts, and says what came of it, beginning with the code.
std::string start() {
  dae_error_detail_t detail;
  dae_parent_t parent = number_in("mask", 7);
  errno = EDOM;
  const int code = dae_init(&parent, &detail);
  const char* lost = errno == EDOM ? "" : " errno changed";
  std::ostringstream text;
  text << code << " parent=" << parent << " fd=" << request_fd << " daemon=" << dae_process_is_the_daemon()
       << " TERM=" << action_of(SIGTERM) << " CHLD=" << action_of(SIGCHLD) << " error=" << detail.dae_error_string
       << lost;
  return text.str();
}

void run_child() {
  const pid_t child = fork();
  if (child == 0) exit(0);
  waitpid(child, nullptr, 0);
  report("forked");
}

/// Whether SIGCHLD's handler takes all children that have ended when it comes.
void check_reaper() {
  sigset_t child_signal;
  sigemptyset(&child_signal);
  sigaddset(&child_signal, SIGCHLD);
  sigprocmask(SIG_BLOCK, &child_signal, nullptr);
  for (int i = 0; i < 3; ++i) {
    const pid_t child = fork();
    if (child == 0) _exit(0);
    siginfo_t info;
    waitid(P_PID, static_cast<id_t>(child), &info, WEXITED | WNOWAIT);
  }
  sigprocmask(SIG_UNBLOCK, &child_signal, nullptr);
  report(waitpid(-1, nullptr, WNOHANG) == -1 ? "reaped" : "left");
}

void obey(const std::string& command) {
  if (command == "again") report(start());
  if (command == "fork") run_child();
  if (command == "reap") check_reaper();
  if (command == "trace elsewhere") {
    gscl_set_debug_file((options["trace"] + ".elsewhere").c_str());
    GStracef(0, "elsewhere\n");
    report("traced");
  }
  if (command == "exit") exit(0);
  if (command == "crash") kill(getpid(), SIGKILL);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) return 2;
  report_to = argv[1];
  for (int i = 2; i < argc; ++i) {
    const std::string text = argv[i];
    options[text.substr(0, text.find('='))] = text.find('=') < text.size() ? text.substr(text.find('=') + 1) : "";
  }
  apply_options();
  if (options.contains("trace")) gscl_set_debug_file(options["trace"].c_str());
  if (options.contains("limit")) {
    rlimit limit;
    getrlimit(RLIMIT_NOFILE, &limit);
    limit.rlim_cur = static_cast<rlim_t>(number_in("limit", 0));
    setrlimit(RLIMIT_NOFILE, &limit);
  }
  const std::string result = start();
  const Datagram commands;  // made here, since start-up closes descriptors
  GStracef(0, "started\n");
  report(commands.name() + " " + result);
  if (const int code = std::stoi(result); code != 0) return code;
  atexit([] { report(dae_process_is_the_daemon() ? "exit" : "exit of a child"); });
  for (;;) {
    pollfd entries[] = {{request_fd, POLLIN, 0}, {commands.fd(), POLLIN, 0}};
    const int ready = poll(entries, 2, Datagram::kPatienceMs);
    if (ready == 0) return 1;  // the test is gone
    if (ready < 0) continue;
    if (entries[0].revents != 0) dae_KPL_req();
    if (entries[1].revents != 0) obey(commands.receive());
  }
}
