// Daemons that were really started, by each kind of parent: their state as /proc shows it, and how they end.
#include <sys/ipc.h>
#include <sys/resource.h>
#include <sys/sem.h>

#include "kpl/private_master.h"
#include "started.h"

namespace {

using testing::AllOf;
using testing::EndsWith;
using testing::StartsWith;

/// What every daemon has, whoever started it.
void expect_daemon(const Started& daemon) {
  const auto state = daemon.state();
  EXPECT_EQ(state.at("group"), daemon.pid());
  EXPECT_EQ(state.at("session"), daemon.pid());
  EXPECT_EQ(state.at("terminal"), "0");
  EXPECT_EQ(state.at("directory"), "/");
  EXPECT_EQ(state.at("Umask"), "0000");
  const auto ignored = std::stoull(state.at("SigIgn"), nullptr, 16);
  for (const int signo : {SIGHUP, SIGINT, SIGQUIT, SIGTSTP, SIGTTIN, SIGTTOU, SIGPIPE}) {
    EXPECT_NE(ignored >> (signo - 1) & 1, 0u) << signo;
  }
}

/// A file to lock by; the set that a failed test leaves goes with it.
class DaemonLock {
 public:
  DaemonLock() { std::ofstream(path_) << ""; }
  ~DaemonLock() { semctl(set(), 0, IPC_RMID); }
  std::string option() const { return "excl=" + path_; }
  bool exists() const { return set() != -1; }

 private:
  int set() const { return semget(ftok(path_.c_str(), 'p'), 1, 0); }

  test_support::TempDir dir_;
  std::string path_ = dir_ / "lock";
};

TEST(DaemonFromShell, Detaches_and_drops_what_it_inherited) {
  const test_support::TempDir dir;
  const std::string trace = dir / "trace";
  Started daemon;
  EXPECT_EQ(daemon.from_shell({"mask=4", "term", "zombies", "limit=256", "trace=" + trace}),
            0);  // the caller ended with 0
  ASSERT_EQ(daemon.start, "0 parent=4 fd=-1 daemon=1 TERM=cancel CHLD=other,restart,ended error=");
  expect_daemon(daemon);
  EXPECT_EQ(daemon.state().at("PPid"),
            std::to_string(getpid()));  // this process adopts: the wait ended all the same
  const auto descriptors = daemon.descriptors();
  for (const int fd : {0, 1, 2}) EXPECT_EQ(descriptors.at(fd), "/dev/null");
  EXPECT_FALSE(descriptors.contains(50));
  rlimit limit;
  getrlimit(RLIMIT_NOFILE, &limit);
  // The debug file stays open, above the range that is closed, and another one takes its place.
  const auto first_line = [](const std::string& path) {
    std::ifstream file(path);
    std::string line;
    return std::getline(file, line) ? line : "";
  };
  const auto trace_is_open = [&](const auto& entry) { return entry.second == trace; };
  EXPECT_THAT(first_line(trace), EndsWith("TRC_GSCL started"));
  EXPECT_TRUE(std::any_of(descriptors.lower_bound(256), descriptors.end(), trace_is_open));
  EXPECT_EQ(descriptors.contains(2005), limit.rlim_cur > 2005);  // closed up to the limit only
  daemon.command("trace elsewhere");
  EXPECT_EQ(daemon.report(), "traced");
  EXPECT_THAT(first_line(trace + ".elsewhere"), EndsWith("TRC_GSCL elsewhere"));
  const auto later = daemon.descriptors();
  EXPECT_TRUE(std::none_of(later.begin(), later.end(), trace_is_open));
  daemon.command("reap");
  EXPECT_EQ(daemon.report(), "reaped");
}

TEST(DaemonFromShell, Keeps_descriptors_on_request_and_starts_once) {
  Started daemon;
  daemon.from_shell({"mask=7", "sock", "keep=4"});
  ASSERT_EQ(daemon.start, "0 parent=4 fd=-1 daemon=1 TERM=cancel,restart CHLD=default error=");
  EXPECT_EQ(daemon.descriptors().at(50), "/dev/zero");
  daemon.command("again");
  EXPECT_EQ(daemon.report(), "1 parent=7 fd=-1 daemon=1 TERM=cancel,restart CHLD=default error=DAE_EM_NOTAGAIN");
}

TEST(DaemonFromShell, Failures_are_reported_where_they_happen) {
  Started refused;
  EXPECT_EQ(refused.from_shell({"mask=3"}), 3);  // before it detached
  EXPECT_EQ(refused.start, "3 parent=0 fd=-1 daemon=0 TERM=default CHLD=default error=DAE_EM_PWRONG_OTHER");
  Started broken;
  EXPECT_EQ(broken.from_shell({"mask=4", "psalloc=4"}), 0);  // in the child
  EXPECT_EQ(broken.start, "12 parent=4 fd=-1 daemon=0 TERM=default CHLD=default error=DAE_EM_NOPSALLOC");
  EXPECT_TRUE(broken.has_ended());
}

TEST(DaemonFromShell, One_instance_runs_and_the_next_start_after_a_crash_succeeds) {
  const DaemonLock lock;
  Started first, second, third;
  first.from_shell({"mask=4", lock.option()});
  ASSERT_THAT(first.start, StartsWith("0 "));
  second.from_shell({"mask=4", lock.option()});
  EXPECT_THAT(second.start, AllOf(StartsWith("17 "), EndsWith("=DAE_EM_EXCLBUSY")));
  EXPECT_TRUE(second.has_ended());
  EXPECT_TRUE(lock.exists());
  first.command("crash");
  EXPECT_TRUE(first.has_ended());
  third.from_shell({"mask=4", lock.option()});
  ASSERT_THAT(third.start, StartsWith("0 "));
  third.command("fork");
  EXPECT_EQ(third.report(), "exit of a child");
  EXPECT_EQ(third.report(), "forked");
  EXPECT_TRUE(lock.exists());  // a child that exits leaves the lock alone
  third.command("exit");
  EXPECT_EQ(third.report(), "exit");
  EXPECT_TRUE(third.has_ended());
  EXPECT_FALSE(lock.exists());
}

TEST(DaemonFromInetd, Keeps_its_sockets_and_its_process) {
  Started daemon;
  daemon.from_inetd({"mask=2", "sock"});
  ASSERT_EQ(daemon.start, "0 parent=2 fd=-1 daemon=1 TERM=cancel,restart CHLD=default error=");
  expect_daemon(daemon);
  EXPECT_EQ(daemon.state().at("PPid"), std::to_string(getpid()));
  const auto descriptors = daemon.descriptors();
  for (const int fd : {0, 1, 2}) EXPECT_THAT(descriptors.at(fd), StartsWith("socket:"));
  EXPECT_FALSE(descriptors.contains(50));
  Started refused;
  EXPECT_EQ(refused.from_inetd({"mask=5"}), 3);
  EXPECT_THAT(refused.start, EndsWith("=DAE_EM_PWRONG_INETD"));
}

TEST(DaemonUnderMaster, Is_recognised_and_ends_with_its_exit_handlers_when_it_is_asked_to) {
  const std::string obstacle = zn::namespaces_obstacle();
  if (!obstacle.empty()) GTEST_SKIP() << obstacle;
  for (const bool keeps : {false, true}) {
    Started daemon;
    const auto words = daemon.command_line(
        {keeps ? "mask=1" : "mask=5", keeps ? "sock=20" : "sock", keeps ? "keep=1" : "keep=6"});
    std::string arguments;
    for (size_t i = 1; i < words.size(); ++i) arguments += "\"" + words[i] + "\", ";
    kpl_test::PrivateMaster master;
    master.define("d", "program = \"" + words[0] + "\"\narguments = [" + arguments + "]\n");
    master.start();
    ASSERT_EQ(master.ctl({"start", "d"}).status, 0) << master.log("master");
    daemon.wait_for_start();
    const int fd = keeps ? 20 : 3;
    ASSERT_EQ(daemon.start,
              "0 parent=1 fd=" + std::to_string(fd) + " daemon=1 TERM=cancel,restart CHLD=default error=");
    expect_daemon(daemon);
    const auto descriptors = daemon.descriptors();
    EXPECT_EQ(descriptors.at(0), "/dev/null");  // where the socket was
    EXPECT_THAT(descriptors.at(fd), StartsWith("socket:"));
    EXPECT_FALSE(descriptors.contains(50));  // a master hands on nothing but 0 to 2
    EXPECT_EQ(master.ctl({"stop", "d"}).out, "d ended: exit status 0\n");
    EXPECT_EQ(daemon.report(), "exit");
  }
}

}  // namespace
