#include "master/master.h"

#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>

#include "common/log.h"
#include "kpl.h"
#include "master/launch.h"

namespace kpl::master {
namespace {

using control::Action;
using control::End;
using control::Result;

constexpr int kFirstOwnCode = 256;

platform::AccessRule access_rule(const Options& options) {
  return {geteuid(), platform::group_id(options.access_group)};
}

/// The default socket's directory is the master's own.
const std::string& prepared(const std::string& path) {
  if (path == control::kDefaultSocketPath) platform::make_directory_of(path);
  return path;
}

Question question_of(const control::Request& request) {
  const auto is_long = static_cast<short>(request.long_form);
  switch (request.action) {
    case Action::kStatus:
      return {KPL_ACTION_STATUS, is_long, 0, {}};
    case Action::kTrace:
      return {KPL_ACTION_TRACE, is_long, static_cast<short>(request.on), {}};
    case Action::kRefresh:
      return {KPL_ACTION_REFRESH, 0, 0, {}};
    default:
      break;
  }
  return {static_cast<short>(request.code), static_cast<short>(request.parm1), static_cast<short>(request.parm2),
          request.data};
}

std::string padded(std::string text, std::size_t width) {
  text.resize(std::max(text.size() + 1, width), ' ');
  return text;
}

control::Line short_line(const std::string& name, const std::string& group, const std::string& pid,
                         const std::string& state) {
  return {name, padded(group.empty() ? "-" : group, 18) + padded(pid, 9) + state};
}

}  // namespace

Master::Master(const Options& options, std::shared_ptr<spdlog::logger> log,
               const platform::ServiceManager& manager)
    : log_(std::move(log)),
      manager_(manager),
      log_file_(options.log_file),
      folder_(options.definitions),
      status_socket_(options.status_socket_path()),
      control_(loop_, *log_, prepared(options.socket_path), access_rule(options),
               [this](const control::Request& request, const Reply& reply) { on_request(request, reply); }),
      status_(loop_, status_socket_, [this](const std::string& name, int pid) { return short_status(name, pid); }),
      look_again_(loop_, [this] { look_at_sockets(); }),
      children_(loop_, SIGCHLD, EV_SIGNAL | EV_PERSIST, [this] { on_children(); }),
      hangup_(loop_, SIGHUP, EV_SIGNAL | EV_PERSIST, [this] { on_hangup(); }),
      terminated_(loop_, SIGTERM, EV_SIGNAL | EV_PERSIST, [this] { on_terminate(); }),
      interrupted_(loop_, SIGINT, EV_SIGNAL | EV_PERSIST, [this] { on_terminate(); }),
      alive_(loop_, [this] {
        manager_.alive();
        alive_.arm(*manager_.alive_every());
      }) {
  look_again_.arm(platform::Listener::kLookAgain);
}

void Master::start() {
  read_definitions();
  for (const Claim& claim : find_claims(status_socket_)) {
    if (believes(claim)) left_behind_[claim.name] = claim.pid;
  }
  for (const auto& [name, pid] : left_behind_) log_->error("{}", left_behind(name));
  for (auto& [name, subsystem] : subsystems_) {
    if (!subsystem.definition().autostart) continue;
    const std::string obstacle = left_behind(name);
    if (!obstacle.empty()) {
      log_->error("{}: not started", name);
      continue;
    }
    subsystem.start([](const control::Answer&) {});  // logged there
  }
  tell_ready();
  if (manager_.alive_every()) alive_.arm(*manager_.alive_every());
}

void Master::tell_ready() const {
  manager_.ready(std::to_string(subsystems_.size()) + " subsystems defined in " + folder_);
}

void Master::look_at_sockets() {
  look_again_.arm(platform::Listener::kLookAgain);
  if (control_.keep_in_place()) status_.keep_in_place();
}

void Master::on_hangup() {
  if (stopping_) return;  // that was told last
  manager_.reloading();
  try {
    if (!log_file_.empty()) platform::log_to_file(log_file_);
  } catch (const std::exception& error) {
    log_->error("SIGHUP: {}; the log stays where it is", error.what());
  }
  read_definitions();
  tell_ready();
}

bool Master::believes(const Claim& claim) const {
  if (claim.user == geteuid()) return true;
  const auto found = subsystems_.find(claim.name);
  return found != subsystems_.end() && user_id(found->second.definition()) == claim.user;
}

std::string Master::left_behind(const std::string& name) const {
  const auto found = left_behind_.find(name);
  if (found == left_behind_.end()) return {};
  const auto claim = claim_of(found->second, status_socket_);
  if (!claim || claim->name != name || !believes(*claim)) return {};
  const std::string pid = std::to_string(found->second);
  return name + " runs as process " + pid +
         ", left behind by an earlier kplmstr: it cannot be asked, end it (kill " + pid + ") before you start it";
}

// -------------------------------------------------------------------------------------------------- definitions

void Master::read_definitions() {
  Folder folder;
  try {
    folder = read_folder(folder_);
  } catch (const platform::SettingError& error) {
    skipped_ = {{folder_, error.what()}};
    return log_->error("{}; nothing changes", error.what());
  }
  for (const auto& skipped : folder.skipped) log_->error("{}; skipped", skipped.problem);
  forget_undefined(folder);
  skipped_ = std::move(folder.skipped);
  for (Definition& definition : folder.definitions) {
    const auto found = subsystems_.find(definition.name);
    if (found != subsystems_.end()) {
      found->second.set_definition(std::move(definition));
    } else {
      const std::string name = definition.name;
      subsystems_.try_emplace(name, std::move(definition), Surroundings{loop_, *log_, status_socket_});
    }
  }
  log_->info("{} subsystems defined in {}", folder.definitions.size(), folder_);
}

/// A mistake in the file of one that runs, or waits to run again, must not end it.
void Master::forget_undefined(const Folder& folder) {
  for (auto& entry : subsystems_) {
    Subsystem& subsystem = entry.second;
    const auto same = [&](const Definition& definition) { return definition.name == entry.first; };
    if (std::any_of(folder.definitions.begin(), folder.definitions.end(), same)) continue;
    const auto its_file = [&](const auto& skipped) { return skipped.file == subsystem.definition().file; };
    const bool broken = std::any_of(folder.skipped.begin(), folder.skipped.end(), its_file);
    if (!broken || subsystem.state() == Subsystem::State::kInactive) subsystem.undefine();
  }
  erase_undefined();
}

void Master::erase_undefined() {
  std::erase_if(subsystems_, [](const auto& entry) { return !entry.second.defined() && entry.second.pid() <= 0; });
}

// ------------------------------------------------------------------------------------------------- processes

void Master::on_children() {
  for (;;) {
    int status = 0;
    const pid_t pid = waitpid(-1, &status, WNOHANG);
    if (pid <= 0) break;
    const auto found = std::find_if(subsystems_.begin(), subsystems_.end(),
                                    [&](const auto& entry) { return entry.second.pid() == pid; });
    if (found != subsystems_.end()) found->second.ended(status);
  }
  erase_undefined();
  if (stopping_) stop_when_all_ended();
}

void Master::on_terminate() {
  if (stopping_) return;
  stopping_ = true;
  manager_.stopping();
  log_->info("stopping");
  for (auto& [name, subsystem] : subsystems_) {
    if (subsystem.state() == Subsystem::State::kInactive) continue;
    subsystem.stop(control::StopKind::kCancel, [](const control::Answer&) {});
  }
  stop_when_all_ended();
}

void Master::stop_when_all_ended() {
  const auto has_process = [](const auto& entry) { return entry.second.pid() > 0; };
  if (std::none_of(subsystems_.begin(), subsystems_.end(), has_process)) loop_.stop();
}

// --------------------------------------------------------------------------------------------------- requests

void Master::on_request(const control::Request& request, const Reply& reply) {
  const bool for_all = request.subsystem.empty();
  const bool short_answer =
      request.action == Action::kList || (request.action == Action::kStatus && !request.long_form);
  if (for_all && !short_answer) return reply(End{Result::kFailed, 0, "a subsystem must be named"});
  const auto found = subsystems_.find(request.subsystem);
  if (!for_all && found == subsystems_.end()) {
    return reply(End{Result::kWrongState, 0, "there is no subsystem '" + request.subsystem + "'"});
  }
  if (short_answer) return tell_subsystems(request, reply);
  on_subsystem_request(found->second, request, reply);
}

void Master::tell_subsystems(const control::Request& request, const Reply& reply) {
  for (const auto& [name, subsystem] : subsystems_) {
    if (request.subsystem.empty() || name == request.subsystem) reply(subsystem.entry());
  }
  if (request.action == Action::kList && request.subsystem.empty()) {
    for (const auto& skipped : skipped_) reply(control::Message{skipped.problem + "; skipped"});
  }
  for (const auto& [name, pid] : left_behind_) {
    const std::string told = left_behind(name);
    if (!told.empty() && (request.subsystem.empty() || name == request.subsystem)) reply(control::Message{told});
  }
  reply(End{});
}

void Master::on_subsystem_request(Subsystem& subsystem, const control::Request& request, const Reply& reply) {
  if (request.action == Action::kStart && stopping_)
    return reply(End{Result::kWrongState, 0, "kplmstr is stopping"});
  if (const std::string told = left_behind(subsystem.definition().name); !told.empty()) {
    return reply(End{Result::kWrongState, 0, told});
  }
  if (request.action == Action::kStart) return subsystem.start(reply);
  if (request.action == Action::kStop) return subsystem.stop(request.stop, reply);
  if (request.action == Action::kRequest && request.code < kFirstOwnCode) {
    return reply(End{Result::kFailed, 0, "the code must be 256 or more"});
  }
  if (request.data.size() > control::kMaxData) {
    return reply(
        End{Result::kFailed, 0, "the data is longer than " + std::to_string(control::kMaxData) + " bytes"});
  }
  subsystem.ask(question_of(request), reply);
}

std::optional<std::vector<control::Line>> Master::short_status(const std::string& name, int pid) const {
  const auto wanted = [&](const auto& entry) {
    return name.empty() ? pid > 0 && entry.second.pid() == pid : entry.first == name;
  };
  const auto found = std::find_if(subsystems_.begin(), subsystems_.end(), wanted);
  if (found == subsystems_.end()) return std::nullopt;
  const Subsystem& subsystem = found->second;
  const std::string id = subsystem.pid() > 0 ? std::to_string(subsystem.pid()) : "-";
  return std::vector<control::Line>{
      short_line("Subsystem", "Group", "PID", "State"),
      short_line(found->first, subsystem.definition().group, id, subsystem.state_name())};
}

}  // namespace kpl::master
