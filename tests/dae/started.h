// Daemons that are really started: by a shell on a terminal, with three inet sockets, or by a master in a PID
// namespace; what they report, and what /proc shows of them.
#pragma once

#include <sys/types.h>

#include <map>
#include <string>
#include <vector>

#include "datagram.h"
#include "kpl.h"

/// Path of a program that was built beside the tests.
std::string program(const std::string& name);

/// A started daemon. It ends with the object, and so does everything that started it.
class Started {
 public:
  using Arguments = std::vector<std::string>;
  using Fields = std::map<std::string, std::string>;

  Started();
  ~Started();
  Started(const Started&) = delete;
  Started& operator=(const Started&) = delete;

  /// Each runs PROGRAM REPORT-ADDRESS ARGUMENTS...; the first two return the status of what they ran, as waitpid
  /// gives it. Descriptor 50 and, when the limit allows, 2005 are open and inherited.
  int from_shell(const std::string& program, const Arguments& arguments);
  int from_inetd(const std::string& program, const Arguments& arguments);
  /// `how` as fake_master takes it. False when there can be no namespace.
  bool from_master(const std::string& how, const std::string& program, const Arguments& arguments);

  /// What was reported of the start: its key=value fields.
  Fields start;
  /// The next report; empty when none comes.
  std::string report();
  /// The same for reports of fields; `word` is the first word.
  Fields report_fields();

  /// Tells the daemon a command.
  void command(const std::string& text);

  pid_t pid() const { return pid_; }
  bool is_alive() const;
  /// Waits for the end of the daemon.
  bool has_ended() const;

  /// What /proc shows: a line of `status`, the fields of `stat` behind the name, the working directory, and where
  /// the descriptors lead.
  std::string status_line(const std::string& label) const;
  std::vector<std::string> stat() const;
  std::string cwd() const;
  std::map<int, std::string> descriptors() const;
  /// Whether a signal is in the set that `label` names (SigIgn, SigCgt).
  bool has_signal(const std::string& label, int signo) const;

  /// The master's end of the request socket.
  int channel() const { return channel_; }

 private:
  void take_first_report();

  Datagram reports_;
  int channel_ = -1;  // our end
  int daemon_end_ = -1;
  int inherited_[2] = {-1, -1};
  pid_t starter_ = 0;  // fake_master, while it runs
  pid_t pid_ = 0;
  int pidfd_ = -1;
};

/// Asks a daemon: builds requests with its own return address and collects what comes back.
class Requester {
 public:
  std::string request(short action, short parm1 = 0, short parm2 = 0, const std::string& data = "",
                      short object = 17) const;

  struct Answer {
    int code = 1;  // nothing that a daemon gives
    std::string message;
    std::vector<std::string> interim;
    std::vector<std::pair<std::string, std::string>> lines;  // margin and body
    std::vector<size_t> packets;                             // lines in each status packet
  };
  Answer answer() const;
  bool is_silent() const { return socket_.receive(nullptr, 0).empty(); }

 private:
  Datagram socket_;
};
