// The requests to one run of a subsystem: sent one after the other, answered in their time.
#pragma once

#include <sys/types.h>

#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <vector>

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
  /// subsystem is taken for hung. `limit` counts from when it is sent: a request before it may take its own time.
  void ping(Duration limit, std::function<void(const control::End&)> told);
  /// Answers all that wait: the subsystem is gone, and nothing is asked any more.
  void end_all();

 private:
  struct Pending;
  using Place = std::list<std::unique_ptr<Pending>>::iterator;

  Place add(const Question& question, Duration limit, Reply reply);
  void send_first();
  /// Empty text: done.
  std::string send(Pending& first);
  void on_readable();
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
  std::vector<platform::Descriptor> late_;       // sockets whose answers may still come, but count no more
};

}  // namespace kpl::master
