// The example program: hands out jobs until SIGINT and then ends cleanly, with every job done.
#include <gtest/gtest.h>
#include <signal.h>
#include <spawn.h>
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

extern char** environ;

namespace {

class Program {
 public:
  explicit Program(const char* argument) {
    int ends[2];
    if (pipe(ends) != 0) return;
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, ends[1], STDOUT_FILENO);
    posix_spawn_file_actions_addclose(&actions, ends[0]);
    char* const arguments[] = {const_cast<char*>(WORKER_POOL), const_cast<char*>(argument), nullptr};
    posix_spawn(&_pid, WORKER_POOL, &actions, nullptr, arguments, environ);
    posix_spawn_file_actions_destroy(&actions);
    close(ends[1]);
    _out = fdopen(ends[0], "r");
  }
  ~Program() {
    if (_out != nullptr) fclose(_out);
    if (_pid > 0) kill(_pid, SIGKILL);
    end();
  }
  Program(const Program&) = delete;
  Program& operator=(const Program&) = delete;

  pid_t pid() const { return _pid; }
  std::string line() {
    char text[256];
    return fgets(text, sizeof text, _out) != nullptr ? text : "";
  }
  int end() {
    int status = -1;
    if (_pid > 0) waitpid(_pid, &status, 0);
    _pid = -1;
    return status;
  }

 private:
  pid_t _pid = -1;
  FILE* _out = nullptr;
};

void expectAllDone(const std::string& line, int atLeast) {
  int handedOut = 0, done = -1;
  ASSERT_EQ(sscanf(line.c_str(), "stopped: %d jobs handed out, %d done", &handedOut, &done), 2) << line;
  EXPECT_EQ(done, handedOut);
  EXPECT_GE(handedOut, atLeast);
}

TEST(WorkerPool, interrupt_endsItWithEveryJobDone) {
  Program pool(nullptr);
  EXPECT_NE(pool.line().find("workers"), std::string::npos);
  ASSERT_EQ(kill(pool.pid(), SIGINT), 0);
  expectAllDone(pool.line(), 0);
  EXPECT_EQ(pool.end(), 0);
}

TEST(WorkerPool, givenNumberOfJobs_endsByItself) {
  Program pool("20");
  pool.line();
  expectAllDone(pool.line(), 20);
  EXPECT_EQ(pool.end(), 0);
}

}  // namespace
