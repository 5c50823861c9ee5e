// A small daemon for the tests: starts as its options say, reports to the test's socket what came of it, then does
// what the test's commands say. Usage: daemon_probe REPORT-ADDRESS [OPTION...]
//
// Options: mask=N  sock[=FD]  block  msq=KEY,TYPE  term  nohandlers  keep=MASK  excl=PATH  psalloc=N  zombies
// Commands: serve, again, fork, reap, name, exit, crash
#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/wait.h>

#include <map>
#include <optional>
#include <sstream>

#include "dae/dae.h"
#include "datagram.h"

namespace {

std::string report_to;
int request_fd = -1;
int status_lines = 0;
volatile sig_atomic_t cancelled = 0;

/// One socket for reports, made anew because start-up closes descriptors.
void report(const std::string& text) { Datagram().send(report_to, text); }

std::string number(const std::string& label, long value) { return label + std::to_string(value); }

int other_req(short request, short parm1, short parm2, const void* data, int data_len) {
  if (request == 300) status_lines = parm1;
  std::string text =
      data != nullptr ? std::string(static_cast<const char*>(data), static_cast<size_t>(data_len)) : "-";
  dae_inform_printf("%d %d %d %s", request, parm1, parm2, text.c_str());
  if (request == 257) dae_error_puts("dropped");
  if (request == 258) dae_error_printf("only %d%% done", parm1);
  return request == 257 ? 1 : 0;
}

void long_status() {
  dae_margin_puts(8, "lines");
  dae_status_printf("%d\n", status_lines);
  for (int i = 1; i < status_lines; ++i) dae_status_printf("line %d\n", i);
  if (status_lines == 0) dae_error_puts("no lines");
}

const dae_req_sock_t kRoutines = {
    [] { report("stop_normal"); },
    [] { report("stop_forced"); },
    [](int) { cancelled = 1; },
    [](int is_long) { report(number("trace_begin ", is_long)); },
    [] { report("trace_end"); },
    [] { report("refresh"); },
    long_status,
    other_req,
};

using Options = std::map<std::string, std::string>;

Options read_options(int argc, char** argv) {
  Options options;
  for (int i = 2; i < argc; ++i) {
    const std::string text = argv[i];
    const size_t equals = text.find('=');
    options[text.substr(0, equals)] = equals == std::string::npos ? "" : text.substr(equals + 1);
  }
  return options;
}

int number_in(const Options& options, const std::string& name, int otherwise) {
  const auto found = options.find(name);
  return found == options.end() || found->second.empty() ? otherwise : std::stoi(found->second);
}

void apply(const Options& options) {
  static const std::string excl_path = options.contains("excl") ? options.at("excl") : "";
  const dae_req_sock_t* routines = options.contains("nohandlers") ? nullptr : &kRoutines;
  if (options.contains("sock")) {
    request_fd = number_in(options, "sock", -1);
    dae_init_KPL_sock(&request_fd, routines, 1);
  }
  if (options.contains("block")) dae_init_KPL_sock_block();
  if (options.contains("msq")) {
    const std::string& place = options.at("msq");
    dae_init_KPL_msq(&request_fd, std::stoi(place), std::stoi(place.substr(place.find(',') + 1)), routines, 1);
  }
  if (options.contains("term")) dae_init_term_sig(kRoutines.dae_stop_cancel, 0);
  if (options.contains("keep")) dae_init_keep_files_open(number_in(options, "keep", 7));
  if (options.contains("zombies")) dae_init_prevent_zombies(7, 1);
  if (options.contains("psalloc")) {
    dae_init_psalloc(7, static_cast<dae_psalloc_t>(number_in(options, "psalloc", 0)), "x", nullptr);
  }
  if (!excl_path.empty()) dae_init_exclusive(7, excl_path.c_str(), 'p');
}

/// Starts, and reports under `label`; the socket for commands is opened afterwards, since start-up closes
/// descriptors.
int start(dae_parent_t mask, const std::string& label, std::optional<Datagram>* commands) {
  dae_error_detail_t detail;
  dae_parent_t parent = mask;
  errno = EDOM;
  const int code = dae_init(&parent, &detail);
  const bool kept = errno == EDOM;
  if (!commands->has_value()) commands->emplace();
  std::ostringstream text;
  text << label << " code=" << code << " parent=" << parent << " errno=" << (kept ? "kept" : "changed")
       << " fd=" << request_fd << " daemon=" << dae_process_is_the_daemon() << " ppid=" << getppid()
       << " commands=" << (*commands)->name() << " error=" << detail.dae_error_string;
  report(text.str());
  return code;
}

void run_child() {
  const pid_t child = fork();
  if (child == 0) {
    report(number("child daemon=", dae_process_is_the_daemon()));
    exit(0);
  }
  while (waitpid(child, nullptr, 0) == -1 && errno == EINTR) {
  }
  report("forked");
}

/// Whether SIGCHLD's handler takes children that end.
void await_reaper() {
  const pid_t child = fork();
  if (child == 0) _exit(0);
  while (kill(child, 0) == 0) usleep(1000);
  report("reaped");
}

int serve_commands(std::optional<Datagram>* commands, dae_parent_t mask) {
  // SIGTERM arrives only inside ppoll, so that none is overlooked.
  sigset_t term;
  sigset_t none;
  sigemptyset(&none);
  sigemptyset(&term);
  sigaddset(&term, SIGTERM);
  sigprocmask(SIG_BLOCK, &term, nullptr);
  for (;;) {
    pollfd entry = {(*commands)->fd(), POLLIN, 0};
    if (ppoll(&entry, 1, nullptr, &none) < 0) {
      if (cancelled != 0) report("cancelled");
      cancelled = 0;
      continue;
    }
    const std::string command = (*commands)->receive();
    if (command == "serve") {
      errno = EDOM;
      dae_KPL_req();
      report(errno == EDOM ? "served" : "served, errno changed");
    } else if (command == "again") {
      dae_init_prevent_zombies(7, 1);
      start(mask, "again", commands);
    } else if (command == "fork") {
      run_child();
    } else if (command == "reap") {
      await_reaper();
    } else if (command == "name") {
      char* name = dae_subsysname();
      report(name != nullptr ? name : "(null)");
      free(name);
    } else if (command == "exit") {
      exit(0);
    } else if (command == "crash") {
      kill(getpid(), SIGKILL);
    }
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) return 2;
  report_to = argv[1];
  const Options options = read_options(argc, argv);
  apply(options);
  const dae_parent_t mask = number_in(options, "mask", 7);
  std::optional<Datagram> commands;
  const int code = start(mask, "init", &commands);
  return code != 0 ? code : serve_commands(&commands, mask);
}
