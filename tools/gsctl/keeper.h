// Runs CMD in the place of a candidate, from a process of its own, so that CMD never outlives the candidate's
// right to run it: whatever becomes of the candidate (killed, stopped, hung), the keeper is there to kill CMD.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "common/descriptor.h"

namespace gsctl {

/// A moment of CLOCK_BOOTTIME: it goes on while the host sleeps, as the other hosts do.
using BootTime = std::chrono::milliseconds;
BootTime boot_time();

/// What the keeper tells.
struct KeeperNews {
  enum Kind : int {
    kStarted,  // value: CMD's process
    kNotRun,   // value: errno
    kEnded,    // value: the status as shells have it; nothing that CMD started runs any more
    kOverdue,  // the same; the keeper killed it because the deadline passed
    kGone,     // the keeper itself was killed
  } kind;
  int value;
};

/// Processes: the keeper is a child of this one, the leader of nothing but its own group, and takes in all that
/// CMD leaves behind. CMD leads a process group. It is killed, with everything that it has started, when this
/// process ends in whatever way, and when a deadline passes; when the keeper is killed itself, CMD alone is.
class Keeper {
 public:
  struct Plan {
    std::vector<std::string> command;
    std::chrono::duration<double> grace;  // from SIGTERM to SIGKILL
    bool give_terminal = false;           // CMD gets the terminal that this process is in the foreground of
  };

  /// Forks: to be called before there is a thread, a loop or a session. Throws Error.
  explicit Keeper(const Plan& plan);
  ~Keeper() { end(); }
  Keeper(const Keeper&) = delete;
  Keeper& operator=(const Keeper&) = delete;

  /// Only when no CMD runs. `environment` is "NAME=VALUE"s more. The deadline as below.
  void start(const std::vector<std::string>& environment, std::optional<BootTime> deadline);
  /// CMD may run until then; none: for good.
  void extend(BootTime deadline);
  /// SIGTERM, and SIGKILL after the grace; kEnded comes when it is done.
  void stop();

  /// Kills CMD, waits until nothing of it is left, and keeps nothing any more.
  void end();

  /// Readable when there is news.
  int descriptor() const { return socket_.get(); }
  std::optional<KeeperNews> news();

 private:
  platform::Descriptor socket_;
  pid_t process_ = -1;
  pid_t command_ = -1;  // its group, while it runs
};

}  // namespace gsctl
