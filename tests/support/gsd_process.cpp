#include "support/gsd_process.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <thread>

extern char** environ;

namespace test_support {
namespace {

constexpr int kHangLimitMs = 60'000;

std::string content_of(const std::string& path) {
  std::ifstream file(path);
  return {std::istreambuf_iterator<char>(file), {}};
}

/// `ready_fd` becomes descriptor 3 of the child; -1: none.
pid_t spawn_gsd(std::vector<std::string> arguments, const std::string& out, const std::string& err, int ready_fd) {
  arguments.insert(arguments.begin(), GSD_PROGRAM);
  std::vector<char*> argv;
  for (std::string& argument : arguments) argv.push_back(argument.data());
  argv.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 1, out.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  posix_spawn_file_actions_addopen(&actions, 2, err.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  if (ready_fd >= 0) posix_spawn_file_actions_adddup2(&actions, ready_fd, 3);
  pid_t pid = -1;
  const int error = posix_spawn(&pid, GSD_PROGRAM, &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  if (error != 0) throw std::runtime_error("cannot start " GSD_PROGRAM);
  return pid;
}

bool readable(int fd) {
  pollfd wanted{fd, POLLIN, 0};
  return poll(&wanted, 1, kHangLimitMs) == 1;
}

int wait_for(pid_t pid) {
  const int handle = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
  if (handle >= 0 && !readable(handle)) ::kill(pid, SIGKILL);
  if (handle >= 0) close(handle);
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace

GsdRun run_gsd(const std::vector<std::string>& arguments) {
  TempDir dir;
  const pid_t pid = spawn_gsd(arguments, dir / "out", dir / "err", -1);
  const int status = wait_for(pid);
  return {status, content_of(dir / "out"), content_of(dir / "err")};
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
  std::vector<std::string> all = {"--socket-path", socket_path(), "--ready-fd", "3"};
  all.insert(all.end(), arguments_.begin(), arguments_.end());
  pid_ = spawn_gsd(all, dir_ / "out", dir_ / "err", ready[1]);
  close(ready[1]);
  char answer = 0;
  const bool up = readable(ready[0]) && read(ready[0], &answer, 1) == 1;
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
  const auto give_up = std::chrono::steady_clock::now() + std::chrono::milliseconds(kHangLimitMs);
  while (log().find(text) == std::string::npos) {
    if (std::chrono::steady_clock::now() > give_up) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return true;
}

void GsdProcess::kill(int signal) const { ::kill(pid_, signal); }

int GsdProcess::wait() {
  const int status = wait_for(pid_);
  pid_ = -1;
  return status;
}

}  // namespace test_support
