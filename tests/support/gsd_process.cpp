#include "support/gsd_process.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <unistd.h>

#include <stdexcept>

namespace test_support {

constexpr int kHangLimitMs = 60'000;

GsdRun run_gsd(std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), GSD_PROGRAM);
  return run(arguments);
}

GsdProcess::GsdProcess(const std::vector<std::string>& arguments) : arguments_(arguments) { start(); }

GsdProcess::~GsdProcess() {
  if (pid_ < 0) return;
  ::kill(pid_, SIGKILL);
  wait();
}

void GsdProcess::start() {
  int ready[2];
  if (pipe2(ready, O_CLOEXEC) != 0) throw std::runtime_error("pipe2");
  std::vector<std::string> all = {GSD_PROGRAM, "--socket-path", socket_path(), "--ready-fd", "3"};
  all.insert(all.end(), arguments_.begin(), arguments_.end());
  pid_ = spawn(all, dir_ / "out", dir_ / "err", ready[1], 3);
  close(ready[1]);
  char answer = 0;
  pollfd wanted{ready[0], POLLIN, 0};
  const bool up = poll(&wanted, 1, kHangLimitMs) == 1 && read(ready[0], &answer, 1) == 1;
  close(ready[0]);
  if (up) return;
  ::kill(pid_, SIGKILL);
  wait();
  throw std::runtime_error("gsd did not come up: " + log());
}

void GsdProcess::restart() {
  if (pid_ >= 0) {
    kill(SIGTERM);
    wait();
  }
  start();
}

std::string GsdProcess::log() const { return content_of(dir_ / "err"); }

bool GsdProcess::wait_for_log(const std::string& text) const {
  return wait_until([&] { return log().find(text) != std::string::npos; });
}

void GsdProcess::kill(int signal) const { ::kill(pid_, signal); }

int GsdProcess::wait() {
  const int status = wait_for_exit(pid_);
  pid_ = -1;
  return status;
}

}  // namespace test_support
