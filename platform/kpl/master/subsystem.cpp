#include "master/subsystem.h"

#include <sys/wait.h>

#include <algorithm>
#include <csignal>
#include <cstring>

namespace kpl::master {
namespace {

using control::End;
using control::Result;
using control::StopKind;

constexpr std::size_t kMaxOutputs = 8;  // pipes that old runs have left open, and that of the last one

std::string text_of_end(int status) {
  if (WIFEXITED(status)) return "exit status " + std::to_string(WEXITSTATUS(status));
  if (WIFSIGNALED(status)) return std::string("signal ") + strsignal(WTERMSIG(status));
  return "status " + std::to_string(status);
}

/// For a time limit to be told to the requester: it counts from here, the packet's way not included.
control::Wait wait_for(Duration time) { return {in_seconds(time)}; }

}  // namespace

Subsystem::Subsystem(Definition definition, const Surroundings& around)
    : definition_(std::move(definition)),
      around_(around),
      delay_over_(around.loop, [this] { on_delay_over(); }),
      next_delay_(definition_.restart_delay) {}

// ------------------------------------------------------------------------------------------------------- start

void Subsystem::start(Reply reply) {
  if (process_) {
    const std::string what =
        definition_.name + " is " + state_name() + " already (pid " + std::to_string(pid()) + ")";
    return reply(End{Result::kWrongState, 0, what});
  }
  delay_over_.disarm();
  take_definition();
  restarts_ = 0;
  next_delay_ = definition_.restart_delay;
  const std::string problem = try_launch();
  if (!problem.empty()) {
    state_ = State::kInactive;
    last_end_ = problem;
    around_.log.error("{}: not started: {}", definition_.name, problem);
    return reply(End{Result::kFailed, 0, problem});
  }
  reply(wait_for(definition_.request_time));
  starter_ = std::move(reply);
}

void Subsystem::set_definition(Definition definition) {
  next_definition_ = std::move(definition);
  defined_ = true;
  if (state_ == State::kInactive) take_definition();
}

void Subsystem::undefine() {
  next_definition_.reset();
  defined_ = false;
}

void Subsystem::take_definition() {
  if (next_definition_) definition_ = std::move(*next_definition_);
  next_definition_.reset();
}

std::string Subsystem::try_launch() try {
  auto process = std::make_unique<Process>();
  process->channel = open_channel(definition_);
  const platform::Descriptor output = definition_.output.empty() ? open_output() : platform::Descriptor();
  const int request_end = process->channel ? process->channel->subsystem_end() : -1;
  Launched launched = launch(definition_, {request_end, output.get(), around_.status_socket});
  process->pid = launched.pid;
  process->since = Clock::now();
  process->report = std::move(launched.report);
  process->report_readable.emplace(around_.loop, process->report.get(), EV_READ | EV_PERSIST,
                                   [this] { on_report(); });
  if (process->channel) {
    process->channel->forget_subsystem_end();
    process->requests =
        std::make_unique<Requests>(around_.loop, *process->channel, definition_.name, launched.pid);
  }
  process_ = std::move(process);
  launch_problem_.clear();
  state_ = State::kStarting;
  return {};
} catch (const std::runtime_error& error) {
  return error.what();
}

platform::Descriptor Subsystem::open_output() {
  if (outputs_.size() == kMaxOutputs) {
    around_.log.warn("{}: the output of an old run is still open, with {} later ones: not read any more",
                     definition_.name, kMaxOutputs - 1);
    outputs_.pop_front();
  }
  OutputLog& made = outputs_.emplace_back(around_.loop, around_.log, definition_.name, [this] {
    outputs_.remove_if([](const OutputLog& output) { return output.is_over(); });
  });
  return made.take_subsystem_end();
}

void Subsystem::on_report() {
  const std::optional<std::string> problem = launch_result(definition_, process_->report.get());
  if (!problem) return;
  process_->report_readable.reset();
  launch_problem_ = *problem;
  if (!launch_problem_.empty()) return;  // the process ends now
  if (state_ == State::kStarting) state_ = State::kActive;
  if (definition_.ping_interval) ping_later();
  around_.log.info("{}: started, pid {}", definition_.name, process_->pid);
  if (!starter_) return;
  const Reply reply = std::move(*starter_);
  starter_.reset();
  reply(End{Result::kOk, 0, definition_.name + " started, pid " + std::to_string(pid())});
}

// ------------------------------------------------------------------------------------------------------ pings

void Subsystem::ping_later() {
  process_->next_ping.emplace(around_.loop, [this] { on_ping_time(); });
  process_->next_ping->arm(*definition_.ping_interval);
}

void Subsystem::on_ping_time() {
  if (state_ != State::kActive) return ping_later();
  process_->requests->ping(definition_.ping_limit, [this](const End& end) { on_ping_answer(end); });
}

void Subsystem::on_ping_answer(const End& end) {
  if (!process_) return;  // it has ended meanwhile
  around_.log.debug("{}: ping: {}", definition_.name,
                    end.result == Result::kFailed ? end.text : name_of(end.result));
  if (end.result != Result::kNoAnswer || state_ != State::kActive) return ping_later();
  process_->hung = "hung (ping: " + end.text + ")";
  around_.log.error("{}: {}; SIGTERM", definition_.name, process_->hung);
  kill(pid(), SIGTERM);
  process_->kill_late.emplace(around_.loop, [this] { kill_as_late(); });
  process_->kill_late->arm(definition_.stop_time);
}

void Subsystem::kill_as_late() {
  around_.log.warn("{}; SIGKILL", late());
  kill(pid(), SIGKILL);
}

// --------------------------------------------------------------------------------------------------- its end

void Subsystem::ended(int status) {
  if (process_->report_readable) on_report();
  const auto process = std::move(process_);
  const bool asked = state_ == State::kStopping;
  const bool stable = Clock::now() - process->since > definition_.restart_delay_max;
  if (stable) next_delay_ = definition_.restart_delay;
  last_end_ = launch_problem_.empty() ? text_of_end(status) : launch_problem_;
  if (!process->hung.empty()) last_end_ = process->hung + ", " + last_end_;
  state_ = State::kInactive;
  if (process->requests) process->requests->end_all();
  while (!stops_.empty()) {
    finish_stop(stops_.begin()->first, End{Result::kOk, 0, definition_.name + " ended: " + last_end_});
  }
  if (starter_) {
    const Reply reply = std::move(*starter_);
    starter_.reset();
    around_.log.error("{}: not started: {}", definition_.name, last_end_);
    return reply(End{Result::kFailed, 0, last_end_});
  }
  if (asked) return around_.log.info("{}: ended: {}", definition_.name, last_end_);
  if (definition_.restart && defined_) return restart_later(last_end_);
  around_.log.error("{}: ended unasked: {}", definition_.name, last_end_);
}

void Subsystem::restart_later(const std::string& why) {
  const Duration delay = next_delay_;
  next_delay_ = std::min(2 * delay, std::max(delay, definition_.restart_delay_max));
  state_ = State::kWaiting;
  delay_over_.arm(delay);
  around_.log.error("{}: ended unasked: {}; restart in {} s", definition_.name, why, in_seconds(delay));
}

void Subsystem::on_delay_over() {
  ++restarts_;
  take_definition();
  const std::string problem = try_launch();
  if (problem.empty()) return;
  last_end_ = problem;
  restart_later(problem);
}

// ------------------------------------------------------------------------------------------------------- stop

void Subsystem::stop(StopKind kind, Reply reply) {
  if (state_ == State::kWaiting) {
    delay_over_.disarm();
    state_ = State::kInactive;
    return reply(End{Result::kOk, 0, definition_.name + " is not started again"});
  }
  if (!process_) return reply(End{Result::kWrongState, 0, definition_.name + " is not active"});
  state_ = State::kStopping;
  reply(wait_for(definition_.stop_time));
  const StopId which = ++last_stop_;
  const auto placed = stops_.try_emplace(which, around_.loop, std::move(reply),
                                         [this, which, kind] { on_stop_late(which, kind); });
  placed.first->second.late.arm(definition_.stop_time);
  send_stop(kind, which);
}

void Subsystem::send_stop(StopKind kind, StopId which) {
  if (kind == StopKind::kCancel) {
    kill(pid(), SIGTERM);
  } else if (process_->requests) {
    const auto parm = static_cast<short>(kind == StopKind::kForced);
    process_->requests->ask({KPL_ACTION_STOP, parm, 0, {}}, definition_.request_time,
                            [this, which](const control::Answer& answer) {
                              if (const End* end = std::get_if<End>(&answer)) on_stop_answer(which, *end);
                            });
  } else {
    kill(pid(), kind == StopKind::kForced ? definition_.forced_signal : definition_.normal_signal);
  }
}

/// After a good answer its end is awaited. Without process it has ended, and `ended` answers.
void Subsystem::on_stop_answer(StopId which, const End& end) {
  if (end.result == Result::kOk || !process_) return;
  const bool refused = end.result != Result::kNoAnswer;
  finish_stop(which, end);
  if (refused && stops_.empty() && launch_problem_.empty()) state_ = State::kActive;
}

void Subsystem::on_stop_late(StopId which, StopKind kind) {
  if (kind == StopKind::kCancel) return kill_as_late();
  finish_stop(which, End{Result::kNoAnswer, 0, late()});
}

void Subsystem::finish_stop(StopId which, const End& end) {
  auto finished = stops_.extract(which);
  if (finished) finished.mapped().reply(end);
}

// --------------------------------------------------------------------------------------------------- requests

void Subsystem::ask(const Question& question, Reply reply) {
  if (!process_) return reply(End{Result::kWrongState, 0, definition_.name + " is not active"});
  if (!process_->requests) {
    return reply(End{Result::kNotSupported, 0, definition_.name + " takes signals only, which can only stop it"});
  }
  reply(wait_for(definition_.request_time));
  process_->requests->ask(question, definition_.request_time, std::move(reply));
}

const char* Subsystem::state_name() const {
  switch (state_) {
    case State::kInactive:
      return "inactive";
    case State::kStarting:
      return "starting";
    case State::kActive:
      return "active";
    case State::kStopping:
      return "stopping";
    case State::kWaiting:
      return "waiting";
  }
  return "unknown";
}

control::Entry Subsystem::entry() const {
  nlohmann::json entry = {
      {"name", definition_.name},
      {"group", definition_.group},
      {"state", state_name()},
      {"restarts", restarts_},
      {"last_end", last_end_},
      {"program", definition_.program},
      {"arguments", definition_.arguments},
      {"user", definition_.user},
      {"autostart", definition_.autostart},
      {"restart", definition_.restart},
      {"file", definition_.file},
      {"transport", name_of(definition_.transport)},
  };
  if (process_) {
    entry["pid"] = pid();
    entry["seconds"] = std::chrono::duration<double>(Clock::now() - process_->since).count();
  }
  return {std::move(entry)};
}

}  // namespace kpl::master
