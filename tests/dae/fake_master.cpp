// Starts a program as a child of a process that looks as the KPL master does, in a PID namespace of its own, so
// that the master's parent is process 1. Usage: fake_master HOW REPORT-ADDRESS CHANNEL-FD PROGRAM [ARGUMENT...]
//
// HOW: master; or with one trait missing: othername, nosession; or shell, where the program is started by a shell
// in the namespace. The channel becomes descriptor 0 of the program. How the program ended is reported as "ended
// STATUS". Exits with 77 when there can be no namespace. SIGTERM ends everything in the namespace first.
#include <errno.h>
#include <sched.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/wait.h>

#include <vector>

#include "datagram.h"

namespace {

constexpr int kNoNamespace = 77;

pid_t init = 0;  ///< process 1 of the namespace

[[noreturn]] void become_program(int channel, char** argv) {
  dup2(channel, 0);
  execv(argv[0], argv);
  _exit(127);
}

[[noreturn]] void be_master(const std::string& how, const std::string& report_to, int channel, char** argv) {
  if (how != "nosession") setsid();
  prctl(PR_SET_NAME, how == "othername" ? "kplmaster" : "kplmstr");
  const pid_t program = fork();
  if (program == 0) become_program(channel, argv);
  int status = -1;
  waitpid(program, &status, 0);
  Datagram().send(report_to, "ended " + std::to_string(status));
  _exit(0);
}

[[noreturn]] void be_shell(int channel, char** argv) {
  std::vector<char*> arguments = {const_cast<char*>("sh"), const_cast<char*>("-c"),
                                  const_cast<char*>("\"$0\" \"$@\"; exit $?")};
  for (; *argv != nullptr; ++argv) arguments.push_back(*argv);
  arguments.push_back(nullptr);
  dup2(channel, 0);
  execv("/bin/sh", arguments.data());
  _exit(127);
}

/// Process 1 of the namespace.
[[noreturn]] void be_init(const std::string& how, const std::string& report_to, int channel, char** argv) {
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) _exit(kNoNamespace);
  if (mount("proc", "/proc", "proc", 0, nullptr) != 0) _exit(kNoNamespace);
  if (fork() == 0) {
    if (how == "shell") be_shell(channel, argv);
    be_master(how, report_to, channel, argv);
  }
  while (waitpid(-1, nullptr, 0) > 0) {
  }
  _exit(0);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 5) return 2;
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (unshare(CLONE_NEWPID | CLONE_NEWNS) != 0) return kNoNamespace;
  init = fork();
  if (init == 0) be_init(argv[1], argv[2], atoi(argv[3]), argv + 4);
  signal(SIGTERM, [](int) { kill(init, SIGKILL); });
  int status = -1;
  while (waitpid(init, &status, 0) == -1 && errno == EINTR) {
  }
  _exit(WIFEXITED(status) ? WEXITSTATUS(status) : 1);
}
