// Daemons that were really started, by each kind of parent: their state as /proc shows it, and their requests.
#include <errno.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/ipc.h>
#include <sys/msg.h>
#include <sys/resource.h>
#include <sys/sem.h>
#include <sys/wait.h>

#include <random>

#include "started.h"

namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::Pair;

const std::string kProbe = "daemon_probe";
constexpr int kTerminalSignals[] = {SIGHUP, SIGINT, SIGQUIT, SIGTSTP, SIGTTIN, SIGTTOU};

/// What every daemon has, whoever started it.
void expect_daemon(const Started& daemon) {
  const auto stat = daemon.stat();  // state, ppid, pgrp, session, terminal
  ASSERT_GT(stat.size(), 5u);
  EXPECT_EQ(stat[2], std::to_string(daemon.pid()));
  EXPECT_EQ(stat[3], std::to_string(daemon.pid()));
  EXPECT_EQ(stat[4], "0");
  EXPECT_EQ(daemon.cwd(), "/");
  EXPECT_EQ(daemon.status_line("Umask"), "0000");
  for (const int signo : kTerminalSignals) EXPECT_TRUE(daemon.has_signal("SigIgn", signo)) << signo;
  EXPECT_TRUE(daemon.has_signal("SigIgn", SIGPIPE));
}

TEST(DaemonFromShell, Detaches_and_drops_what_it_inherited) {
  Started daemon;
  EXPECT_EQ(daemon.from_shell(program(kProbe), {"mask=4", "term", "zombies"}), 0);  // the caller ended with 0
  ASSERT_EQ(daemon.start["code"], "0") << daemon.start["error"];
  EXPECT_EQ(daemon.start["parent"], "4");
  EXPECT_EQ(daemon.start["errno"], "kept");
  EXPECT_EQ(daemon.start["daemon"], "1");
  EXPECT_EQ(daemon.start["ppid"], std::to_string(getpid()));  // this process adopts: the wait ended all the same
  expect_daemon(daemon);

  const auto descriptors = daemon.descriptors();
  for (const int fd : {0, 1, 2}) EXPECT_EQ(descriptors.at(fd), "/dev/null");
  EXPECT_FALSE(descriptors.contains(50));
  rlimit limit;
  getrlimit(RLIMIT_NOFILE, &limit);
  EXPECT_EQ(descriptors.contains(2005), limit.rlim_cur > 2005);  // closed up to 1999 only

  daemon.command("reap");
  EXPECT_EQ(daemon.report(), "reaped");
  kill(daemon.pid(), SIGTERM);
  EXPECT_EQ(daemon.report(), "cancelled");
  EXPECT_TRUE(daemon.is_alive());
}

TEST(DaemonFromShell, Keeps_descriptors_on_request_and_has_no_channel) {
  Started daemon;
  daemon.from_shell(program(kProbe), {"mask=7", "sock", "keep=4"});
  ASSERT_EQ(daemon.start["code"], "0") << daemon.start["error"];
  EXPECT_EQ(daemon.start["fd"], "-1");
  EXPECT_EQ(daemon.descriptors().at(50), "/dev/zero");
  daemon.command("serve");
  EXPECT_EQ(daemon.report(), "served");
  daemon.command("name");
  EXPECT_EQ(daemon.report(), "(null)");  // no master to ask
  daemon.command("again");
  const auto again = daemon.report_fields();
  EXPECT_EQ(again.at("code"), "1");
  EXPECT_EQ(again.at("error"), "DAE_EM_NOTAGAIN");
  EXPECT_EQ(again.at("parent"), "7");
  EXPECT_EQ(again.at("daemon"), "1");
}

TEST(DaemonFromShell, Failures_are_reported_where_they_happen) {
  Started refused;
  EXPECT_EQ(WEXITSTATUS(refused.from_shell(program(kProbe), {"mask=3"})), 3);  // before it detached
  EXPECT_EQ(refused.start["error"], "DAE_EM_PWRONG_OTHER");
  EXPECT_EQ(refused.start["parent"], "0");
  EXPECT_EQ(refused.start["errno"], "kept");
  Started broken;
  EXPECT_EQ(broken.from_shell(program(kProbe), {"mask=4", "psalloc=4"}), 0);  // in the child
  EXPECT_EQ(broken.start["code"], "12");
  EXPECT_EQ(broken.start["error"], "DAE_EM_NOPSALLOC");
  EXPECT_EQ(broken.start["parent"], "4");
  EXPECT_EQ(broken.start["daemon"], "0");
  EXPECT_TRUE(broken.has_ended());
}

TEST(DaemonFromShell, One_instance_runs_and_the_next_start_after_a_crash_succeeds) {
  char path[] = "/tmp/dae_instance_XXXXXX";
  close(mkstemp(path));
  const Started::Arguments arguments = {"mask=4", std::string("excl=") + path};
  {
    Started first;
    first.from_shell(program(kProbe), arguments);
    ASSERT_EQ(first.start["code"], "0") << first.start["error"];
    Started second;
    second.from_shell(program(kProbe), arguments);
    EXPECT_EQ(second.start["code"], "17");
    EXPECT_EQ(second.start["error"], "DAE_EM_EXCLBUSY");
    EXPECT_TRUE(second.has_ended());
    first.command("crash");
    EXPECT_TRUE(first.has_ended());
  }
  Started third;
  third.from_shell(program(kProbe), arguments);
  EXPECT_EQ(third.start["code"], "0") << third.start["error"];
  const key_t key = ftok(path, 'p');
  third.command("fork");
  EXPECT_EQ(third.report(), "child daemon=0");
  EXPECT_EQ(third.report(), "forked");
  EXPECT_NE(semget(key, 1, 0), -1);  // a child that exits leaves the lock alone
  third.command("exit");
  EXPECT_TRUE(third.has_ended());
  EXPECT_EQ(semget(key, 1, 0), -1);
  unlink(path);
}

TEST(DaemonFromShell, Process_1_adopts_it_in_a_namespace) {
  Started daemon;
  if (!daemon.from_master("shell", program(kProbe), {"mask=4"})) GTEST_SKIP() << "needs root and PID namespaces";
  EXPECT_EQ(daemon.start["code"], "0") << daemon.start["error"];
  EXPECT_EQ(daemon.start["ppid"], "1");
  expect_daemon(daemon);
}

TEST(DaemonFromInetd, Keeps_its_sockets_and_its_process) {
  Started daemon;
  daemon.from_inetd(program(kProbe), {"mask=2"});
  ASSERT_EQ(daemon.start["code"], "0") << daemon.start["error"];
  EXPECT_EQ(daemon.start["parent"], "2");
  EXPECT_EQ(daemon.start["ppid"], std::to_string(getpid()));
  expect_daemon(daemon);
  const auto descriptors = daemon.descriptors();
  for (const int fd : {0, 1, 2}) EXPECT_TRUE(descriptors.at(fd).starts_with("socket:")) << descriptors.at(fd);
  EXPECT_FALSE(descriptors.contains(50));
  Started refused;
  EXPECT_EQ(WEXITSTATUS(refused.from_inetd(program(kProbe), {"mask=5"})), 3);
  EXPECT_EQ(refused.start["error"], "DAE_EM_PWRONG_INETD");
}

/// A daemon under a master in a PID namespace.
class DaemonUnderMaster : public testing::Test {
 protected:
  bool begin(Started::Arguments arguments, const std::string& how = "master") {
    if (!daemon.from_master(how, program(kProbe), std::move(arguments))) return false;
    EXPECT_EQ(daemon.start["errno"], "kept");
    return true;
  }

  /// Has the daemon serve what was sent, and waits until it did.
  void serve(const std::string& request) {
    send(daemon.channel(), request.data(), request.size(), 0);
    daemon.command("serve");
  }

  Started daemon;
  Requester requester;
};

TEST_F(DaemonUnderMaster, Is_recognised_and_serves_over_the_socket) {
  if (!begin({"mask=5", "sock"})) GTEST_SKIP() << "needs root and PID namespaces";
  ASSERT_EQ(daemon.start["code"], "0") << daemon.start["error"];
  EXPECT_EQ(daemon.start["parent"], "1");
  EXPECT_EQ(daemon.start["fd"], "3");
  expect_daemon(daemon);
  const auto descriptors = daemon.descriptors();
  EXPECT_EQ(descriptors.at(0), "/dev/null");  // where the socket was
  EXPECT_TRUE(descriptors.at(3).starts_with("socket:"));
  EXPECT_FALSE(descriptors.contains(50));

  const struct {
    short action, parm1, parm2;
    std::string report;
  } cases[] = {{4, 1, 1, "trace_begin 1"}, {4, 0, 1, "trace_begin 0"}, {4, 0, 0, "trace_end"},
               {5, 0, 0, "refresh"},       {1, 0, 0, "stop_normal"},   {1, 1, 0, "stop_forced"}};
  for (const auto& c : cases) {
    serve(requester.request(c.action, c.parm1, c.parm2));
    EXPECT_EQ(daemon.report(), c.report);
    EXPECT_EQ(daemon.report(), "served");
    EXPECT_EQ(requester.answer().code, 0);
  }
  serve(requester.request(300, 200, 7, "some data"));
  Requester::Answer answer = requester.answer();
  EXPECT_EQ(answer.code, 0);
  EXPECT_THAT(answer.interim, ElementsAre("300 200 7 some data"));
  daemon.report();
  serve(requester.request(2, 1));
  answer = requester.answer();
  EXPECT_EQ(answer.code, 0);
  ASSERT_EQ(answer.lines.size(), 200u);
  EXPECT_THAT(answer.lines.front(), Pair("lines   ", "200"));
  EXPECT_THAT(answer.lines.back(), Pair("        ", "line 199"));
  EXPECT_THAT(answer.packets, ElementsAre(80, 80, 40));
}

TEST_F(DaemonUnderMaster, Answers_errors_refusals_and_bad_requests) {
  if (!begin({"mask=1", "sock=20", "keep=1"})) GTEST_SKIP() << "needs root and PID namespaces";
  ASSERT_EQ(daemon.start["code"], "0") << daemon.start["error"];
  EXPECT_EQ(daemon.start["fd"], "20");
  EXPECT_EQ(daemon.descriptors().at(50), "/dev/zero");

  serve(requester.request(258, 30));
  Requester::Answer answer = requester.answer();
  EXPECT_EQ(answer.code, -1);
  EXPECT_EQ(answer.message, "only 30%% done\n");
  serve(requester.request(257));
  answer = requester.answer();
  EXPECT_EQ(answer.code, -9129);
  EXPECT_EQ(answer.message, "");
  EXPECT_THAT(answer.interim, ElementsAre("257 0 0 -"));
  serve(requester.request(2, 1));
  answer = requester.answer();
  EXPECT_EQ(answer.code, -1);
  EXPECT_EQ(answer.message, "no lines\n");
  serve(requester.request(77));
  EXPECT_EQ(requester.answer().code, -9087);

  for (int i = 0; i < 4; ++i) EXPECT_EQ(daemon.report(), "served");
  serve(requester.request(5).substr(0, 155));
  EXPECT_EQ(daemon.report(), "served");
  EXPECT_TRUE(requester.is_silent());
  {
    Requester gone;
    const std::string request = gone.request(5);
    send(daemon.channel(), request.data(), request.size(), 0);
  }
  daemon.command("serve");
  EXPECT_EQ(daemon.report(), "refresh");  // nobody waits for the reply: it is served all the same
  EXPECT_EQ(daemon.report(), "served");
  kill(daemon.pid(), SIGTERM);
  EXPECT_EQ(daemon.report(), "cancelled");
}

TEST_F(DaemonUnderMaster, Without_routines_a_stop_ends_it_with_its_exit_handlers) {
  char path[] = "/tmp/dae_stop_XXXXXX";
  close(mkstemp(path));
  if (!begin({"mask=1", "sock", "nohandlers", std::string("excl=") + path})) {
    unlink(path);
    GTEST_SKIP() << "needs root and PID namespaces";
  }
  EXPECT_EQ(daemon.start["code"], "0") << daemon.start["error"];
  const key_t key = ftok(path, 'p');
  EXPECT_NE(semget(key, 1, 0), -1);
  serve(requester.request(5));
  EXPECT_EQ(requester.answer().code, -9129);
  EXPECT_EQ(daemon.report(), "served");
  serve(requester.request(1));
  EXPECT_EQ(requester.answer().code, 0);
  EXPECT_EQ(daemon.report(), "ended 0");
  EXPECT_EQ(semget(key, 1, 0), -1);
  unlink(path);
}

TEST_F(DaemonUnderMaster, A_blocking_socket_waits_for_its_request) {
  if (!begin({"mask=1", "sock", "block"})) GTEST_SKIP() << "needs root and PID namespaces";
  daemon.command("serve");
  const std::string request = requester.request(5);
  EXPECT_EQ(send(daemon.channel(), request.data(), request.size(), 0), static_cast<ssize_t>(request.size()));
  EXPECT_EQ(daemon.report(), "refresh");
  EXPECT_EQ(daemon.report(), "served");
}

TEST_F(DaemonUnderMaster, Serves_over_the_message_queue) {
  std::random_device random;
  const int key = static_cast<int>(random() >> 1 | 1u);
  const int queue = msgget(key, IPC_CREAT | IPC_EXCL | 0660);
  ASSERT_NE(queue, -1);
  const bool begun = begin({"mask=1", "msq=" + std::to_string(key) + ",9"});
  if (begun) {
    EXPECT_EQ(daemon.start["code"], "0") << daemon.start["error"];
    EXPECT_EQ(daemon.start["fd"], std::to_string(queue));
    const auto ask = [&](long type, const std::string& request) {
      const std::string message = std::string(reinterpret_cast<const char*>(&type), sizeof type) + request;
      EXPECT_EQ(msgsnd(queue, message.data(), request.size(), 0), 0);
      daemon.command("serve");
    };
    ask(8, requester.request(5));  // somebody else's
    EXPECT_EQ(daemon.report(), "served");
    EXPECT_TRUE(requester.is_silent());
    ask(9, requester.request(5));
    EXPECT_EQ(daemon.report(), "refresh");
    EXPECT_EQ(daemon.report(), "served");
    EXPECT_EQ(requester.answer().code, 0);
    ask(9, requester.request(301, 1, 2, std::string(3000, 'd')));  // cut to the buffer, as is its message
    const Requester::Answer answer = requester.answer();
    EXPECT_EQ(answer.code, 0);
    EXPECT_GT(answer.interim.size(), 1u);
    EXPECT_EQ(daemon.report(), "served");
  }
  msgctl(queue, IPC_RMID, nullptr);
  if (!begun) GTEST_SKIP() << "needs root and PID namespaces";
}

TEST_F(DaemonUnderMaster, A_queue_that_does_not_exist_fails_the_start) {
  if (!begin({"mask=1", "msq=1886417009,1"})) GTEST_SKIP() << "needs root and PID namespaces";
  EXPECT_EQ(daemon.start["code"], "11");
  EXPECT_EQ(daemon.start["parent"], "1");
  EXPECT_EQ(daemon.start["error"], "msgget failed: No such file or directory");
  EXPECT_EQ(daemon.start["fd"], "-1");
  EXPECT_EQ(daemon.report(), "ended " + std::to_string(11 << 8));
}

TEST_F(DaemonUnderMaster, Half_a_master_is_none) {
  for (const char* how : {"othername", "nosession"}) {
    Started child;
    if (!child.from_master(how, program(kProbe), {"mask=1"})) GTEST_SKIP() << "needs root and PID namespaces";
    EXPECT_EQ(child.start["code"], "3");
    EXPECT_EQ(child.start["error"], "DAE_EM_PWRONG_OTHER");
  }
  if (!begin({"mask=6"})) GTEST_SKIP() << "needs root and PID namespaces";
  EXPECT_EQ(daemon.start["error"], "DAE_EM_PWRONG_KPL");
}

}  // namespace
