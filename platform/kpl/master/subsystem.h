// One subsystem: started, asked, stopped, and started again when it dies.
#pragma once

#include <spdlog/logger.h>
#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <list>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "control/control.h"
#include "master/channel.h"
#include "master/definition.h"
#include "master/launch.h"
#include "master/loop.h"
#include "master/output_log.h"
#include "master/requests.h"

namespace kpl::master {

/// What a subsystem uses of the master; outlives it.
struct Surroundings {
  const Loop& loop;
  spdlog::logger& log;
  const std::string& status_socket;  // for KPL_MASTER_SOCKET
};

/// States, and what happens in them. "-": cannot happen.
///
///            | start        | program runs | program does not run | stop     | process ended         | delay over
///   inactive | -> starting  | -            | -                    | refused  | -                     | -
///   starting | refused      | -> active    | -> inactive, or waiting after a crash (1) | -> stopping | (1) | -
///   active   | refused      | -            | -                    | stopping | waiting, or inactive (2) | -
///   stopping | refused      | -            | -> inactive          | joins in | -> inactive           | -
///   waiting  | -> starting  | -            | -                    | inactive | -                     | starting
///
/// (1) The process says why and ends; only its end counts. A first start that fails is not tried again.
/// One that does not answer a ping in its time is killed; that it was counts as any other crash.
/// (2) Waiting where the definition says restart and is still there. The delay doubles from crash to crash; a run
///     that was longer than the longest delay starts over with the shortest.
/// A stop that the subsystem refuses leads back to active.
class Subsystem {
 public:
  enum class State { kInactive, kStarting, kActive, kStopping, kWaiting };

  Subsystem(Definition definition, const Surroundings& around);
  Subsystem(const Subsystem&) = delete;
  Subsystem& operator=(const Subsystem&) = delete;

  const Definition& definition() const { return definition_; }
  /// Counts from the next start on.
  void set_definition(Definition definition);
  /// Has no definition any more: does not start again.
  void undefine();
  bool defined() const { return defined_; }
  State state() const { return state_; }
  /// -1 when there is none.
  pid_t pid() const { return process_ ? process_->pid : -1; }

  /// Answered when the program runs, or with the reason why it does not.
  void start(Reply reply);
  /// Answered when the process has ended, when it refuses, or when its time is over. After a kCancel it ends.
  void stop(control::StopKind kind, Reply reply);
  void ask(const Question& question, Reply reply);
  /// The process is no more; `status` as waitpid gives it.
  void ended(int status);

  /// For people: "active", "waiting" ...
  const char* state_name() const;
  /// For `list` and `status`.
  control::Entry entry() const;

 private:
  using Clock = std::chrono::steady_clock;

  struct Process {
    pid_t pid;
    Clock::time_point since;
    std::optional<Event> next_ping;  // goes after the requests, which end the ping under way
    std::string hung;                // why it is being killed; empty: it is not
    std::optional<Event> kill_late;
    std::unique_ptr<Channel> channel;
    std::unique_ptr<Requests> requests;  // null: signals
    platform::Descriptor report;
    std::optional<Event> report_readable;
  };
  struct Stop {
    Stop(const Loop& loop, Reply to, Event::Action on_late)
        : reply(std::move(to)), late(loop, std::move(on_late)) {}
    Reply reply;
    Event late;
  };
  using StopId = std::uint64_t;

  void take_definition();
  /// Empty text: the process is made.
  std::string try_launch();
  /// A pipe for what it writes.
  platform::Descriptor open_output();
  void on_report();
  void ping_later();
  void on_ping_time();
  void on_ping_answer(const control::End& end);
  void on_delay_over();
  void on_stop_late(StopId which, control::StopKind kind);
  void kill_as_late();
  std::string late() const { return definition_.name + " has not ended within its stop-time"; }
  void send_stop(control::StopKind kind, StopId which);
  void on_stop_answer(StopId which, const control::End& end);
  /// Nothing when it was answered before.
  void finish_stop(StopId which, const control::End& end);
  void restart_later(const std::string& why);

  Definition definition_;
  std::optional<Definition> next_definition_;
  bool defined_ = true;
  Surroundings around_;
  State state_ = State::kInactive;
  std::unique_ptr<Process> process_;
  std::list<OutputLog> outputs_;  // each until nobody can write there, which may be after the process's end
  std::string launch_problem_;    // of the process that could not become the program
  std::optional<Reply> starter_;  // waits for the program to run
  std::map<StopId, Stop> stops_;  // wait for the end
  StopId last_stop_ = 0;
  Event delay_over_;
  Duration next_delay_;
  int restarts_ = 0;      // since the last start that was asked for
  std::string last_end_;  // of the last process
};

}  // namespace kpl::master
