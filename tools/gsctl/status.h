// How gsctl ends, and the one way in which a command says that it cannot go on.
#pragma once

#include <stdexcept>
#include <string>

namespace gsctl {

/// Exit statuses. `lead` and `lock` end with that of their CMD; 128 and more are, as in shells, signals.
enum Status : int {
  kDone = 0,
  kRefused = 1,   // or rejected
  kWrongUse = 2,  // of the command line
  kNoDaemon = 3,
  kTimeOver = 4,
  kLost = 5,         // the connection; what was asked for may have happened or not
  kCannotRun = 126,  // CMD is there and cannot be run
  kNotFound = 127,   // no such CMD
};

/// Ends the command with this status. The text is one line: what is wrong, and what to do.
class Error : public std::runtime_error {
 public:
  Error(Status status, const std::string& what_to_do) : std::runtime_error(what_to_do), status_(status) {}
  Status status() const { return status_; }

 private:
  Status status_;
};

}  // namespace gsctl
