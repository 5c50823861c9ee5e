// The requests to one run of a subsystem: sent one after the other, answered in their time.
#pragma once

#include <sys/types.h>

#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <string>

#include "control/control.h"
#include "master/channel.h"
#include "master/loop.h"

namespace kpl::master {

/// Told what comes of a request: any number of interim answers, then one End.
using Reply = std::function<void(const control::Answer&)>;

/// What is asked of a subsystem.
struct Question {
  short action = 0;
  short parm1 = 0;
  short parm2 = 0;
  std::string data;
};

class Requests {
 public:
  /// For the process `pid`, the only one whose answers count, known as `name`.
  Requests(const Loop& loop, Channel& channel, std::string name, pid_t pid);
  ~Requests();
  Requests(const Requests&) = delete;
  Requests& operator=(const Requests&) = delete;

  /// `limit`: for the last answer, waiting for other requests included.
  void ask(const Question& question, Duration limit, Reply reply);
  /// Asks for nothing, after the requests that wait. Told the End of the answer; Result::kNoAnswer says why the
  /// subsystem is taken for hung, which it is only when it has had its time. `limit` counts from when the ping is
  /// sent, or the channel first has no room for it: a request before it may take its own time.
  void ping(Duration limit, std::function<void(const control::End&)> told);
  /// Answers all that wait: the subsystem is gone, and nothing is asked any more.
  void end_all();

 private:
  struct Pending;
  struct Late;
  using Place = std::list<std::unique_ptr<Pending>>::iterator;

  Place add(const Question& question, Reply reply, std::function<void(Place)> on_late);
  control::End too_late(Duration limit) const;
  void on_ping_late(Place place, Duration limit);
  void send_first();
  /// Result::kNoAnswer: the subsystem does not take it, kFailed: the master cannot ask.
  control::End send(Pending& first);
  template <class Action>
  void read_packets(int fd, Action action) const;
  void on_readable();
  void on_late_answer(std::list<Late>::iterator which);
  /// True when this was the last packet.
  bool on_packet(const char* packet, std::size_t length);
  void finish(Place which, const control::End& end);
  void drop(Place which, const control::End& end);

  const Loop& loop_;
  Channel& channel_;
  const std::string name_;
  const pid_t pid_;
  bool ended_ = false;
  std::list<std::unique_ptr<Pending>> waiting_;  // only the first one has been sent
  std::list<Late> late_;                         // of requests whose answers may still come, but count no more
  Event send_again_;
};

}  // namespace kpl::master
