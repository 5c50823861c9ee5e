#include "master/parent.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <system_error>

namespace kpl::master {
namespace {

using platform::Descriptor;

constexpr int kExitFailure = 1;
constexpr useconds_t kAdoptionPause = 1'000;
constexpr int kAdoptionTries = 10'000;

pid_t checked_fork() {
  const pid_t pid = fork();
  if (pid < 0) throw std::system_error(errno, std::generic_category(), "fork");
  return pid;
}

[[noreturn]] void wait_for_ready(pid_t between, int told) {
  int status = 0;
  while (waitpid(between, &status, 0) < 0 && errno == EINTR) {
  }
  char byte = 0;
  ssize_t got = 0;
  do {
    got = read(told, &byte, 1);
  } while (got < 0 && errno == EINTR);
  _exit(got == 1 ? 0 : kExitFailure);
}

}  // namespace

Detached::Detached() {
  std::array<int, 2> ends{};
  if (pipe2(ends.data(), O_CLOEXEC) != 0) throw std::system_error(errno, std::generic_category(), "pipe");
  Descriptor told(ends[0]);
  tell_ = Descriptor(ends[1]);
  if (const pid_t between = checked_fork(); between != 0) {
    tell_ = Descriptor();
    wait_for_ready(between, told.get());
  }
  const pid_t between = getpid();
  if (checked_fork() != 0) _exit(0);
  setsid();
  for (int i = 0; getppid() == between && i < kAdoptionTries; ++i) usleep(kAdoptionPause);
}

void Detached::ready() {
  const char byte = 'r';
  if (write(tell_.get(), &byte, 1) == 1) tell_ = Descriptor();
}

std::string parent_problem() {
  if (getuid() != 0) return "it must be started by root";
  if (getppid() != 1) return "its parent must be process 1: use --daemon, or a service manager that is process 1";
  if (getsid(0) != getpid() || getpgrp() != getpid()) return "it must lead its session: use --daemon";
  const Descriptor terminal(open("/dev/tty", O_RDWR | O_NOCTTY | O_CLOEXEC));
  if (terminal) return "it must have no terminal: use --daemon";
  return {};
}

}  // namespace kpl::master
