// Programs that gsctl runs for what happens in a group: one line for the shell each.
#pragma once

#include <sys/types.h>

#include <deque>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "common/descriptor.h"
#include "tools/gsctl/loop.h"

namespace gsctl {

struct Job {
  std::string command;                   // for /bin/sh -c
  std::vector<std::string> environment;  // "NAME=VALUE"s more
  std::string input;                     // its standard input
};

/// A running job, in a process group of its own. It gets SIGTERM when this ends before it.
class Shell {
 public:
  /// The status as shells have it, and what was written to standard output when `captured`: its first `captured`
  /// bytes. 0: it goes to this process's own.
  using Ended = std::function<void(int status, const std::string& output)>;

  /// Throws Error: no process can be had.
  Shell(Loop& loop, const Job& job, std::size_t captured, Ended ended);
  ~Shell();
  Shell(const Shell&) = delete;
  Shell& operator=(const Shell&) = delete;

 private:
  void read_output();
  void look();

  const std::size_t captured_;
  const Ended ended_;
  pid_t process_ = -1;
  platform::Descriptor out_;
  std::string output_;
  Loop::Handle child_;
  Loop::Handle readable_;
};

/// Runs jobs one after the other, in order. When too many wait, new ones are left out, and it says how many.
class JobQueue {
 public:
  explicit JobQueue(Loop& loop) : loop_(loop) {}
  void add(Job job);

 private:
  void next();

  Loop& loop_;
  std::deque<Job> waiting_;
  std::size_t left_out_ = 0;
  std::unique_ptr<Shell> running_;
  Loop::Handle next_;
};

}  // namespace gsctl
