// A kplmstr for a test, with namespaces of its own for processes, mounts and message queues: its parent is process
// 1 there, and nothing outlives it.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

#include "support/temp_dir.h"

namespace kpl_test {

inline constexpr int kHangLimitMs = 60'000;

/// How a program went.
struct Outcome {
  int status = -1;  // exit status; -1: killed
  std::string out;
  std::string err;
};
struct User {
  uid_t uid = 0;
  gid_t gid = 0;
};
/// Runs a program built with the tests ("kplctl", "kplmstr") to its end.
Outcome run(const std::string& program, const std::vector<std::string>& arguments,
            const std::optional<User>& user = std::nullopt);

std::string program_path(const std::string& program);

class PrivateMaster {
 public:
  /// Why there can be no namespaces here; empty: there can.
  static std::string obstacle();

  ~PrivateMaster();

  /// Writes a definition file, ahead of `start` or of SIGHUP.
  void define(const std::string& file, const std::string& content) const;
  /// The same for subsystem_probe under the file's name, with the log log(NAME).
  void define_probe(const std::string& name, const std::string& transport, const std::string& more = "",
                    const std::string& mode = "") const;
  /// Comes back when the master answers.
  void start(const std::vector<std::string>& options = {});

  Outcome ctl(std::vector<std::string> arguments, const std::optional<User>& user = std::nullopt) const;
  /// Waits until `status` prints the text; the last print otherwise.
  bool wait_for_status(const std::string& text) const;
  /// Waits until the subsystem has written the text.
  bool wait_for_log(const std::string& name, const std::string& text) const;
  std::string log(const std::string& name) const;
  std::string master_log() const;
  bool wait_for_master_log(const std::string& text) const;

  void signal(const std::string& name);
  bool is_started() const { return shell_ > 0; }
  /// SIGTERM; its exit status.
  int stop();

  std::string path(const std::string& name) const { return dir_ / name; }
  std::string log_path(const std::string& name) const;
  std::string socket_path() const { return dir_ / "control"; }

 private:
  test_support::TempDir dir_;
  pid_t shell_ = -1;   // holds the namespaces
  int commands_ = -1;  // to the shell: names of signals; its end stops the master
};

}  // namespace kpl_test
