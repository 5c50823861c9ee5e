// A kplmstr for a test, with namespaces of its own for processes, mounts and message queues: its parent is process
// 1 there, and nothing outlives it.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/types.h>

#include <string>
#include <vector>

#include "support/programs.h"
#include "support/temp_dir.h"

namespace kpl_test {

using test_support::Outcome;
using test_support::wait_until;

std::string program_path(const std::string& program);
/// A program built with the tests ("kplctl", "kplmstr"), run to its end.
Outcome run(const std::string& program, const std::vector<std::string>& arguments);

class PrivateMaster {
 public:
  ~PrivateMaster();

  /// Writes NAME.toml with the name and `rest`, ahead of `start` or of SIGHUP.
  void define(const std::string& name, const std::string& rest) const;
  /// For subsystem_probe, with the log log(NAME).
  void define_probe(const std::string& name, const std::string& transport, const std::string& more = "",
                    const std::string& mode = "") const;
  /// Comes back when the master answers.
  void start(const std::vector<std::string>& options = {});
  /// For a shell, process 1 in there; $master is the master's process id, start "$@" starts it again.
  void tell_shell(const std::string& line) const;
  bool is_started() const { return shell_ > 0; }
  /// SIGTERM; its exit status.
  int stop();

  /// kplctl. `as`: a command that runs it as somebody else.
  Outcome ctl(const std::vector<std::string>& arguments, std::vector<std::string> as = {}) const;
  /// Wait until `status` prints the text, the subsystem or the master has written it.
  bool wait_for_status(const std::string& text) const;
  bool wait_for_log(const std::string& name, const std::string& text) const;
  std::string log(const std::string& name) const { return test_support::content_of(log_path(name)); }

  std::string path(const std::string& name) const { return dir_ / name; }
  std::string log_path(const std::string& name) const { return dir_ / name + ".log"; }
  std::string socket_path() const { return dir_ / "control"; }

 private:
  test_support::TempDir dir_;
  pid_t shell_ = -1;   // holds the namespaces
  int commands_ = -1;  // to the shell; its end stops the master
};

/// Skips where there are no namespaces. Whatever a test does to the master, it ends well.
class WithMaster : public testing::Test {
 protected:
  void SetUp() override {
    const std::string obstacle = zn::namespaces_obstacle();
    if (!obstacle.empty()) GTEST_SKIP() << obstacle;
  }
  void TearDown() override {
    if (!master.is_started()) return;
    EXPECT_EQ(master.stop(), 0) << master.log("master");
  }
  Outcome ctl(const std::vector<std::string>& arguments) const { return master.ctl(arguments); }

  PrivateMaster master;
};

}  // namespace kpl_test
