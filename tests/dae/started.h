// Daemons that are really started, by a shell, by a super-server or by whoever runs their command line; what they
// report, and what /proc shows of them.
#pragma once

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <pty.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/wait.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include "datagram.h"

/// A started daemon_probe. It ends with the object.
class Started {
 public:
  using Words = std::vector<std::string>;

  Started() {
    prctl(PR_SET_CHILD_SUBREAPER, 1);  // so that a daemon that lost its parent can be waited for
    const int zero = open("/dev/zero", O_RDONLY | O_CLOEXEC);
    dup2(zero, kInherited);
    high_inherited_ = fcntl(zero, F_DUPFD, 2005);
    close(zero);
  }
  ~Started() {
    if (pidfd_ >= 0) syscall(SYS_pidfd_send_signal, pidfd_, SIGKILL, nullptr, 0);
    if (pidfd_ >= 0) has_ended();
    while (waitpid(-1, nullptr, WNOHANG) > 0) {
    }
    for (const int fd : {kInherited, high_inherited_, terminal_, pidfd_}) close(fd);
  }
  Started(const Started&) = delete;
  Started& operator=(const Started&) = delete;

  /// Both start it on a terminal with descriptor 50 and, when the limit allows, 2005 open, and return the exit
  /// status of what they ran: that of the shell, that of a daemon that failed.
  int from_shell(const Words& options) {
    Words words = command_line(options);
    words.insert(words.begin(), {"/bin/sh", "-c", "\"$0\" \"$@\"; exit $?"});
    const pid_t shell = forkpty(&terminal_, nullptr, nullptr, nullptr);
    if (shell == 0) run(words);
    const int status = exit_status_of(shell);
    close(std::exchange(terminal_, -1));  // hangs up
    wait_for_start();
    return status;
  }
  int from_inetd(const Words& options) {
    const int service = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    const pid_t child = forkpty(&terminal_, nullptr, nullptr, nullptr);
    if (child == 0) {
      for (const int fd : {0, 1, 2}) dup2(service, fd);
      run(command_line(options));
    }
    close(service);
    wait_for_start();
    return start.starts_with("0 ") ? 0 : exit_status_of(child);
  }
  /// For others to run; `wait_for_start` then takes the first report.
  Words command_line(const Words& options) const {
    const auto folder = std::filesystem::read_symlink("/proc/self/exe").parent_path();
    Words words = {folder / "daemon_probe", reports_.name()};
    words.insert(words.end(), options.begin(), options.end());
    return words;
  }
  void wait_for_start() {
    start = reports_.receive(&pid_);
    commands_to_ = start.substr(0, start.find(' '));
    start.erase(0, commands_to_.size() + 1);
    if (pid_ > 0) pidfd_ = static_cast<int>(syscall(SYS_pidfd_open, pid_, 0));
  }

  std::string start;  ///< what was reported of the start
  /// The next report; empty when none comes.
  std::string report() { return reports_.receive(); }
  void command(const std::string& text) { EXPECT_TRUE(reports_.send(commands_to_, text)); }
  /// Waits for the end of the daemon.
  bool has_ended() const {
    pollfd entry = {pidfd_, POLLIN, 0};
    return poll(&entry, 1, Datagram::kPatienceMs) == 1;
  }

  std::string pid() const { return std::to_string(pid_); }
  /// What /proc shows: the lines of `status`, and group, session, terminal and directory.
  std::map<std::string, std::string> state() const {
    std::map<std::string, std::string> fields;
    std::ifstream status("/proc/" + pid() + "/status");
    for (std::string label, text; std::getline(status, label, ':') && std::getline(status >> std::ws, text);) {
      fields[label] = text;
    }
    std::ifstream stat("/proc/" + pid() + "/stat");
    std::string word;
    std::getline(stat, word, ')');  // the name
    stat >> word >> word >> fields["group"] >> fields["session"] >> fields["terminal"];
    fields["directory"] = std::filesystem::read_symlink("/proc/" + pid() + "/cwd").string();
    return fields;
  }
  /// Where the descriptors lead. One that it closes meanwhile is left out.
  std::map<int, std::string> descriptors() const {
    std::map<int, std::string> result;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/" + pid() + "/fd")) {
      std::error_code closed;
      const auto leads = std::filesystem::read_symlink(entry.path(), closed);
      if (!closed) result[std::stoi(entry.path().filename().string())] = leads.string();
    }
    return result;
  }

 private:
  static constexpr int kInherited = 50;

  [[noreturn]] static void run(Words words) {
    std::vector<char*> argv;
    for (std::string& word : words) argv.push_back(word.data());
    argv.push_back(nullptr);
    execv(argv[0], argv.data());
    _exit(127);
  }
  static int exit_status_of(pid_t child) {
    int status = -1;
    waitpid(child, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

  Datagram reports_;
  std::string commands_to_;
  int high_inherited_ = -1;
  int terminal_ = -1;
  pid_t pid_ = 0;
  int pidfd_ = -1;
};
