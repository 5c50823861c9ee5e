// What a program needs to run others of this project around itself: a folder that goes away again, child processes
// that never outlive it, and a daemon of its own. Shared by the demo and the benchmarks.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace zn {

using Clock = std::chrono::steady_clock;

/// Makes SIGINT and SIGTERM end the wait functions below by an exception instead of ending the process, so that
/// everything is cleaned up. Call it first, before any thread or child.
void catch_interrupts();

/// A wait was over its deadline, a child could not be started, or the user interrupted. The text says which.
struct Failure {
  std::string text;
};

/// A new folder under the system's folder for temporary files; removed with everything in it.
class TempFolder {
 public:
  TempFolder();
  ~TempFolder();
  TempFolder(const TempFolder&) = delete;
  TempFolder& operator=(const TempFolder&) = delete;
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

/// The path of a program of this project: beside the running one, or one folder up.
std::string program(const std::string& name);

/// The command with PID, mount and IPC namespaces around it, in which it is process 1 and root. All of it ends
/// when the caller's child does.
std::vector<std::string> in_namespaces(std::vector<std::string> command);

/// Why there can be no such namespaces here; empty: there can.
std::string namespaces_obstacle();

/// The content of a file; empty when it cannot be read.
std::string content_of(const std::string& path);

/// A child process: lines to its standard input, lines from its standard output. It is killed, if it still runs,
/// and reaped with the object, and killed by the kernel should this process die.
class Process {
 public:
  using Environment = std::vector<std::pair<std::string, std::string>>;

  /// `stderr_file` empty: the child shares this process's standard error.
  Process(const std::vector<std::string>& command, const Environment& environment,
          const std::string& stderr_file = "");
  ~Process();
  Process(const Process&) = delete;
  Process& operator=(const Process&) = delete;

  pid_t pid() const { return pid_; }
  /// Readable when there is output, or at its end.
  int output() const { return out_; }

  void write_line(const std::string& line);
  void close_input();
  void signal(int number);

  /// Takes what is there; false at the end of the output.
  bool read_some();
  std::optional<std::string> next_line();
  /// Waits for a whole line. Throws Failure at the deadline, at the end of the output and on an interrupt.
  std::string wait_line(Clock::time_point deadline);
  /// Waits for the end and gives the status as waitpid does. Throws Failure at the deadline and on an interrupt.
  int wait_end(Clock::time_point deadline);

 private:
  pid_t pid_ = -1;
  int in_ = -1;
  int out_ = -1;
  std::string text_;
};

/// Waits until one of the descriptors is readable; true for those in the result. Throws like Process::wait_line.
std::vector<bool> wait_readable(const std::vector<int>& descriptors, Clock::time_point deadline);

/// Stands still. Throws Failure on an interrupt.
void pause_for(std::chrono::milliseconds time);

/// A daemon on a socket in a folder of its own.
class PrivateDaemon {
 public:
  /// Comes back when the daemon accepts clients. Throws Failure, with what the daemon wrote, when it does not.
  explicit PrivateDaemon(const std::vector<std::string>& options = {});

  const std::string& folder() const { return folder_.path(); }
  /// For the environment of its clients.
  Process::Environment environment() const { return {{"GSD_ENDPOINT", "unix:" + socket_}}; }
  pid_t pid() const { return process_->pid(); }
  /// What it has written to standard error so far.
  std::string log() const;
  /// Asks it to stop; true when it ends with status 0 within the deadline.
  bool stop(Clock::time_point deadline);

 private:
  TempFolder folder_;
  std::string socket_;
  std::unique_ptr<Process> process_;
};

}  // namespace zn
