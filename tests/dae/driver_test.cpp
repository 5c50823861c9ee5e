// KPLDriver: the stop code under signals and threads, and drivers that start as daemons. Under a master it is the
// example daemon that is tested.
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/ipc.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <thread>

#include "dae/dae_internal.h"
#include "gscl/GSDebug.h"
#include "gscl/KPLDriver.h"

namespace {

class Driver : public zelt_gscl_V1::KPLDriver {
 public:
  Driver() {
    struct sigaction action = {};
    action.sa_handler = stub_stopCancel;
    sigaction(SIGTERM, &action, &before_);
  }
  ~Driver() override { sigaction(SIGTERM, &before_, nullptr); }

  void stopCancel(int) override {
    if (*cancel_text != '\0') setStopCode(7, cancel_text);
  }

  /// Code and text.
  std::string stop() {
    const char* text = getStopMsg();
    return std::to_string(getStopCode()) + " " + (text != nullptr ? text : "(null)");
  }

  using KPLDriver::_stopLocker;
  using KPLDriver::err_detail;
  using KPLDriver::stub_stopForced;
  using KPLDriver::stub_stopNormal;

  const char* cancel_text = "";

 private:
  struct sigaction before_;
};

TEST(DriverStopCode, The_first_one_stays_until_it_is_cleared) {
  Driver driver;
  EXPECT_EQ(zelt_gscl_V1::KPLDriver::theKPLDriver(), &driver);
  EXPECT_EQ(driver.getKPLDescriptor(), -1);
  EXPECT_EQ(driver.stop(), "0 ");
  driver.setStopCode(0, "zero");
  driver.setStopCode(5, "later");
  EXPECT_EQ(driver.stop(), "1 zero");
  driver.clearStopCode();
  EXPECT_EQ(driver.stop(), "0 (null)");
  Driver::stub_stopNormal();
  EXPECT_EQ(driver.stop(), "-1 stopNormal");
  driver.clearStopCode();
  Driver::stub_stopForced();
  EXPECT_EQ(driver.stop(), "-2 stopForced");
  driver.clearStopCode();
  const std::string text(300, 't');
  driver.cancel_text = text.c_str();
  raise(SIGTERM);
  EXPECT_EQ(driver.stop(), "7 " + std::string(127, 't'));
}

TEST(DriverStopCode, A_SIGTERM_under_the_stop_lock_is_neither_stuck_nor_lost) {
  Driver driver;
  driver._stopLocker.WriteLock(nullptr);
  errno = EDOM;
  raise(SIGTERM);
  EXPECT_EQ(errno, EDOM);
  EXPECT_EQ(driver.getStopCode(), -3);  // at once
  driver._stopLocker.WriteUnlock();
  driver._stopLocker.ReadLock(nullptr);
  EXPECT_EQ(driver.stop(), "-3 stopCancel") << "with a read lock held";
  driver._stopLocker.ReadUnlock();
  driver.clearStopCode();

  raise(SIGTERM);
  driver.clearStopCode();  // before anybody read the text
  EXPECT_EQ(driver.stop(), "0 (null)");
  driver.setStopCode(5, "five");
  raise(SIGTERM);
  EXPECT_EQ(driver.stop(), "5 five");
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
    ASSERT_THAT(driver.stop(), testing::AnyOf("5 five", "-3 stopCancel", "0 (null)"));
    driver.clearStopCode();
    ASSERT_EQ(driver.stop(), "0 (null)");
  }
}

std::string traced;

/// Starts the driver in this process; the result, what it traced, and the error.
std::string start(Driver* driver, const char* excl_file) {
  traced.clear();
  const int code = driver->InitKPL(1, excl_file, 'd', nullptr);
  return std::to_string(code) + " " + traced + driver->err_detail.dae_error_string + "\n";
}

/// What `routine` reports, which runs in a process of its own, and perhaps becomes a daemon.
template <class Routine>
std::string reports_of(Routine routine) {
  char path[] = "/tmp/driver_XXXXXX";
  close(mkstemp(path));
  prctl(PR_SET_CHILD_SUBREAPER, 1);  // so that the daemon can be waited for
  if (fork() == 0) {
    GSSetDebugLevel(GSCL_TRC_WARNING);
    GSSetTraceRtn([](int, char* text) { traced = text; });
    Driver driver;
    routine(&driver, [path](const std::string& text) { std::ofstream(path, std::ios::app) << text; });
    _exit(0);
  }
  while (waitpid(-1, nullptr, 0) > 0) {
  }
  std::ifstream file(path);
  unlink(path);
  return {std::istreambuf_iterator<char>(file), {}};
}

TEST(DriverFromShell, Has_no_channel_and_stops_by_SIGTERM) {
  EXPECT_EQ(
      reports_of([](Driver* driver, auto report) {
        dup2(2, 50);
        report(start(driver, nullptr));
        report(fcntl(50, F_GETFD) == -1 ? "closed\n" : "inherited\n");
        raise(SIGTERM);
        report(driver->stop() + "\n");
        report(start(driver, nullptr));
        report(dae_prof__INTERNAL__.per_parent[DAE_I_KPL].keep_open_call == 1 ? "kept under KPL" : "not kept");
      }),
      "0 dae_init inited fd=-1, sema_key=ffffffff\n\nclosed\n-3 stopCancel\n"
      "1001 dae_init failed with sema_key=ffffffff\nDAE_EM_NOTAGAIN\nkept under KPL");
}

TEST(DriverFromInetd, Is_refused_with_the_locks_key) {
  char expected[100];
  snprintf(expected, sizeof expected, "1003 dae_init failed with sema_key=%x\nDAE_EM_PWRONG_INETD\n",
           ftok("/", 'd'));
  EXPECT_EQ(reports_of([](Driver* driver, auto report) {
              const int service = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
              for (const int fd : {0, 1, 2}) dup2(service, fd);
              report(start(driver, "/"));
            }),
            expected);
}

}  // namespace
