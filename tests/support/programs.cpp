#include "support/programs.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <stdexcept>
#include <thread>

#include "support/temp_dir.h"

extern char** environ;

namespace test_support {

constexpr std::chrono::seconds kHangLimit{60};

bool wait_until(const std::function<bool()>& done) {
  const auto give_up = std::chrono::steady_clock::now() + kHangLimit;
  while (!done()) {
    if (std::chrono::steady_clock::now() > give_up) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return true;
}

pid_t spawn(std::vector<std::string> command, const std::string& out, const std::string& err, int given, int as) {
  std::vector<char*> argv;
  for (std::string& word : command) argv.push_back(word.data());
  argv.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDWR, 0);
  posix_spawn_file_actions_addopen(&actions, 1, out.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  posix_spawn_file_actions_addopen(&actions, 2, err.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  if (given >= 0) posix_spawn_file_actions_adddup2(&actions, given, as);
  pid_t pid = -1;
  const int error = posix_spawnp(&pid, argv[0], &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  if (error != 0) throw std::runtime_error("cannot start " + command[0]);
  return pid;
}

int wait_for_exit(pid_t pid) {
  int status = 0;
  if (!wait_until([&] { return waitpid(pid, &status, WNOHANG) != 0; })) {
    kill(pid, SIGKILL);
    waitpid(pid, &status, 0);
  }
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

Outcome run(const std::vector<std::string>& command) {
  const TempDir dir;
  const int status = wait_for_exit(spawn(command, dir / "out", dir / "err"));
  return {status, content_of(dir / "out"), content_of(dir / "err")};
}

}  // namespace test_support
