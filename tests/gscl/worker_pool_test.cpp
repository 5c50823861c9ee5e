// The example program: hands out jobs until SIGINT and then ends cleanly, with every job done.
#include <signal.h>
#include <stdio.h>
#include <sys/wait.h>

#include <string>

namespace {

/// The program's last line, after it was interrupted or, given a number of jobs, ended by itself.
void expectAllDone(const char* arguments, bool interrupt, int atLeast) {
  FILE* pipe = popen(("echo $$; exec " WORKER_POOL " " + std::string(arguments)).c_str(), "r");
  ASSERT_NE(pipe, nullptr);
  int pid = 0, handedOut = 0, done = -1;
  char text[256] = "";
  EXPECT_EQ(fscanf(pipe, "%d ", &pid), 1);
  EXPECT_NE(std::string(fgets(text, sizeof text, pipe)).find("workers"), std::string::npos) << text;
  if (interrupt) {
    EXPECT_EQ(kill(pid, SIGINT), 0);
  }
  EXPECT_EQ(fscanf(pipe, "stopped: %d jobs handed out, %d done", &handedOut, &done), 2);
  EXPECT_EQ(done, handedOut);
  EXPECT_GE(handedOut, atLeast);
  EXPECT_EQ(pclose(pipe), 0);
}

TEST(WorkerPool, endsWithEveryJobDone) {
  expectAllDone("", true, 0);
  expectAllDone("20", false, 20);
}

}  // namespace
