// KPLDriver: the stop code under signals and threads, and drivers that were really started.
#include <errno.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/ipc.h>
#include <sys/wait.h>

#include <atomic>
#include <thread>

#include "gscl/KPLDriver.h"
#include "started.h"

namespace {

using testing::ElementsAre;
using testing::Pair;

const std::string kProbe = "driver_probe";

class Driver : public zelt_gscl_V1::KPLDriver {
 public:
  Driver() {
    struct sigaction action = {};
    action.sa_handler = stub_stopCancel;
    sigaction(SIGTERM, &action, &before_);
  }
  ~Driver() override { sigaction(SIGTERM, &before_, nullptr); }

  void stopCancel(int) override {
    if (cancel_code != 0) setStopCode(cancel_code, cancel_text.c_str());
  }

  std::string msg() {
    const char* text = getStopMsg();
    return text != nullptr ? text : "(null)";
  }

  using KPLDriver::_stopLocker;
  using KPLDriver::stub_longStatus;
  using KPLDriver::stub_otherReq;
  using KPLDriver::stub_stopForced;
  using KPLDriver::stub_stopNormal;

  int cancel_code = 0;
  std::string cancel_text;

 private:
  struct sigaction before_;
};

TEST(DriverStopCode, The_first_one_stays_until_it_is_cleared) {
  Driver driver;
  EXPECT_EQ(zelt_gscl_V1::KPLDriver::theKPLDriver(), &driver);
  EXPECT_EQ(driver.getKPLDescriptor(), -1);
  EXPECT_EQ(driver.getStopCode(), 0);
  EXPECT_EQ(driver.msg(), "");
  driver.setStopCode(0, "zero");
  EXPECT_EQ(driver.getStopCode(), 1);
  driver.setStopCode(5, "later");
  EXPECT_EQ(driver.getStopCode(), 1);
  EXPECT_EQ(driver.msg(), "zero");
  driver.clearStopCode();
  EXPECT_EQ(driver.getStopCode(), 0);
  EXPECT_EQ(driver.msg(), "(null)");
  driver.setStopCode(5, nullptr);
  EXPECT_EQ(driver.getStopCode(), 5);
  EXPECT_EQ(driver.msg(), "(null)");
}

TEST(DriverStopCode, Stop_requests_record_their_kind_unless_the_handler_did) {
  Driver driver;
  Driver::stub_stopNormal();
  EXPECT_EQ(driver.getStopCode(), -1);
  EXPECT_EQ(driver.msg(), "stopNormal");
  driver.clearStopCode();
  Driver::stub_stopForced();
  EXPECT_EQ(driver.getStopCode(), -2);
  EXPECT_EQ(driver.msg(), "stopForced");
  driver.clearStopCode();
  driver.cancel_code = 7;
  driver.cancel_text = std::string(300, 't');
  raise(SIGTERM);
  EXPECT_EQ(driver.getStopCode(), 7);
  EXPECT_EQ(driver.msg(), std::string(127, 't'));
  EXPECT_EQ(Driver::stub_otherReq(300, 0, 0, nullptr, 0), 0);
}

TEST(DriverStopCode, A_SIGTERM_under_the_stop_lock_is_neither_stuck_nor_lost) {
  Driver driver;
  driver._stopLocker.WriteLock(nullptr);
  errno = EDOM;
  raise(SIGTERM);
  EXPECT_EQ(errno, EDOM);
  EXPECT_EQ(driver.getStopCode(), -3);  // at once
  driver._stopLocker.WriteUnlock();
  EXPECT_EQ(driver.msg(), "stopCancel");
  EXPECT_EQ(driver.msg(), "stopCancel");
  driver.clearStopCode();

  raise(SIGTERM);
  driver.clearStopCode();  // before anybody read the text
  EXPECT_EQ(driver.getStopCode(), 0);
  EXPECT_EQ(driver.msg(), "(null)");
  driver.setStopCode(5, "five");
  raise(SIGTERM);
  EXPECT_EQ(driver.msg(), "five");
}

TEST(DriverStopCode, Code_and_text_belong_together_whatever_the_threads_do) {
  Driver driver;
  for (int round = 0; round < 300; ++round) {
    std::atomic<int> ready = 0;
    const auto together = [&](auto action) {
      return std::thread([&ready, action] {
        for (++ready; ready < 3;) std::this_thread::yield();
        action();
      });
    };
    std::thread setter = together([&] { driver.setStopCode(5, "five"); });
    std::thread cancelled = together([] { pthread_kill(pthread_self(), SIGTERM); });
    std::thread cleaner = together([&] {
      driver.getStopMsg();
      driver.clearStopCode();
    });
    for (std::thread* thread : {&setter, &cancelled, &cleaner}) thread->join();
    const int code = driver.getStopCode();
    ASSERT_EQ(driver.msg(), code == 5 ? "five" : code == -3 ? "stopCancel" : "(null)") << "code " << code;
    driver.clearStopCode();
    ASSERT_EQ(driver.msg(), "(null)");
  }
}

TEST(DriverFromShell, Has_no_channel_and_stops_by_SIGTERM) {
  Started daemon;
  EXPECT_EQ(daemon.from_shell(program(kProbe), {"plain"}), 0);
  EXPECT_EQ(daemon.start["code"], "0") << daemon.start["error"];
  EXPECT_EQ(daemon.start["fd"], "-1");
  EXPECT_EQ(daemon.start["error"], "dae_init inited fd=-1, sema_key=ffffffff\n");
  EXPECT_FALSE(daemon.descriptors().contains(50));
  kill(daemon.pid(), SIGTERM);
  EXPECT_EQ(daemon.report(), "stop -3 stopCancel");
  daemon.command("again");
  const auto again = daemon.report_fields();
  EXPECT_EQ(again.at("code"), "1001");
  EXPECT_EQ(again.at("error"), "dae_init failed with sema_key=ffffffff\nDAE_EM_NOTAGAIN");
}

TEST(DriverFromInetd, Is_refused) {
  Started daemon;
  EXPECT_EQ(WEXITSTATUS(daemon.from_inetd(program(kProbe), {"plain"})), 3);
  EXPECT_EQ(daemon.start["code"], "1003");
}

class DriverUnderMaster : public testing::Test {
 protected:
  bool begin(const Started::Arguments& arguments) {
    if (!daemon.from_master("master", program(kProbe), arguments)) return false;
    EXPECT_EQ(daemon.start["code"], "0") << daemon.start["error"];
    return true;
  }

  Requester::Answer ask(const std::string& request) {
    EXPECT_EQ(send(daemon.channel(), request.data(), request.size(), 0), static_cast<ssize_t>(request.size()));
    return requester.answer();
  }

  Started daemon;
  Requester requester;
};

TEST_F(DriverUnderMaster, Without_overrides_everything_succeeds_and_stops_are_recorded) {
  if (!begin({"plain"})) GTEST_SKIP() << "needs root and PID namespaces";
  const auto descriptors = daemon.descriptors();
  EXPECT_TRUE(descriptors.at(std::stoi(daemon.start["fd"])).starts_with("socket:"));
  EXPECT_EQ(descriptors.at(50), "/dev/zero");  // under KPL, what is inherited stays
  for (const auto& request : {requester.request(2, 1), requester.request(4, 0, 1), requester.request(4, 0, 0),
                              requester.request(5), requester.request(256, 1, 1, "data")}) {
    EXPECT_EQ(ask(request).code, 0);
  }
  EXPECT_EQ(ask(requester.request(1, 0)).code, 0);
  EXPECT_EQ(daemon.report(), "stop -1 stopNormal");
  EXPECT_EQ(ask(requester.request(1, 1)).code, 0);
  EXPECT_EQ(daemon.report(), "stop -2 stopForced");
  kill(daemon.pid(), SIGTERM);
  EXPECT_EQ(daemon.report(), "stop -3 stopCancel");
  EXPECT_TRUE(daemon.is_alive());
}

TEST_F(DriverUnderMaster, Overrides_get_their_requests) {
  if (!begin({"own"})) GTEST_SKIP() << "needs root and PID namespaces";
  Requester::Answer answer = ask(requester.request(2, 1));
  EXPECT_EQ(answer.code, 0);
  EXPECT_THAT(answer.lines, ElementsAre(Pair("", "own line")));
  ask(requester.request(4, 1, 1));
  EXPECT_EQ(daemon.report(), "traceBegin 1");
  ask(requester.request(4, 0, 0));
  EXPECT_EQ(daemon.report(), "traceEnd");
  ask(requester.request(5));
  EXPECT_EQ(daemon.report(), "refresh");
  answer = ask(requester.request(400, 1, 0, "abc"));
  EXPECT_EQ(answer.code, -1);
  EXPECT_EQ(answer.message, "refused by me\n");
  EXPECT_THAT(answer.interim, ElementsAre("400 1 0 abc"));
  EXPECT_EQ(ask(requester.request(400, 1, 1, "abc")).code, -9129);
  ask(requester.request(1, 1));
  EXPECT_EQ(daemon.report(), "stop 7 own reason");
  kill(daemon.pid(), SIGTERM);
  EXPECT_EQ(daemon.report(), "stop 15 own cancel");
}

TEST_F(DriverUnderMaster, A_second_instance_is_refused_with_the_locks_key) {
  char path[] = "/tmp/driver_lock_XXXXXX";
  close(mkstemp(path));
  if (!begin({"plain", path})) {
    unlink(path);
    GTEST_SKIP() << "needs root and PID namespaces";
  }
  Started second;
  EXPECT_TRUE(second.from_master("master", program(kProbe), {"plain", path}));
  EXPECT_EQ(second.start["code"], "1017");
  EXPECT_EQ(second.start["key"], std::to_string(ftok(path, 'd')));
  daemon.command("exit");
  EXPECT_EQ(daemon.report(), "ended 0");
  unlink(path);
}

}  // namespace
