// The daemon as a program, for tests that need the real one.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

#include "support/programs.h"
#include "support/temp_dir.h"

namespace test_support {

using GsdRun = Outcome;
GsdRun run_gsd(std::vector<std::string> arguments);

/// A gsd with a socket in a directory of its own. Stopped, by force if need be, with the object.
class GsdProcess {
 public:
  /// Returns when clients can connect. Throws std::runtime_error with what gsd said when it does not come up.
  explicit GsdProcess(const std::vector<std::string>& arguments = {});
  ~GsdProcess();
  GsdProcess(const GsdProcess&) = delete;
  GsdProcess& operator=(const GsdProcess&) = delete;

  std::string socket_path() const { return dir_ / "gsd.sock"; }
  /// As GSD_ENDPOINT wants it.
  std::string endpoint() const { return "unix:" + socket_path(); }
  pid_t pid() const { return pid_; }
  /// Standard error so far.
  std::string log() const;
  /// True once the log has `text`; false when it still has not after a long time.
  bool wait_for_log(const std::string& text) const;

  void kill(int signal) const;
  /// Waits for its end, after kill() or a failure: its exit status, -1 when a signal ended it.
  int wait();
  /// Stopped again on the same socket path, wherever it was.
  void restart();

 private:
  void start();

  TempDir dir_;
  std::vector<std::string> arguments_;
  pid_t pid_ = -1;
};

}  // namespace test_support
