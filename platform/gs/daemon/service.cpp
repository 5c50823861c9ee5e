#include "daemon/service.h"

#include <stdexcept>

#include "common/log.h"
#include "dae/dae.h"
#include "engine/text.h"

namespace gs::daemon {
namespace {

constexpr int kRestartCalls = 1;
constexpr int kMarginWidth = 14;

/// One line of long status: its label in the margin.
void line(const char* label, const std::string& text) {
  dae_margin_puts(kMarginWidth, label);
  dae_status_printf("%s\n", text.c_str());
}

std::string text(const inspect::Id& id) { return std::to_string(id.instance()) + "@" + std::to_string(id.node()); }

std::string members_of(const inspect::GroupT& group) {
  std::string all;
  for (const inspect::Id& member : group.members) all += (all.empty() ? "" : " ") + text(member);
  return all;
}

void print_group(const inspect::GroupT& group) {
  line("group", printable(group.name));
  line("  members", std::to_string(group.members.size()) + ": " + members_of(group));
  line("  state", std::to_string(group.state_size) + " bytes, event " + std::to_string(group.event_number));
  line("  protocol", group.running ? group.running->kind : "none");
  line("  subscribers", std::to_string(group.subscribers));
}

std::string domain_of(const inspect::DaemonT& daemon) {
  if (!daemon.serving) return "serving nobody";
  std::string text = "node " + std::to_string(daemon.node);
  if (daemon.nodes.size() == 1) return text;
  text += " of";
  for (const std::uint32_t node : daemon.nodes) text += " " + std::to_string(node);
  return text;
}

void print_session(const inspect::SessionT& session) {
  const inspect::ProcessT& process = *session.process;
  line("session", std::to_string(session.number) + " " + process.program + " (pid " + std::to_string(process.pid) +
                      ", uid " + std::to_string(process.uid) + ")");
  line("  queued", std::to_string(session.answer_bytes) + " bytes of answers, " +
                       std::to_string(session.notification_bytes) + " of notifications");
}

/// Page after page, all of the same moment. Returns how many there were.
template <typename List, typename Print>
std::size_t print_all(const Server& server, inspect::What what, List inspect::ReportT::*list, Print print) {
  inspect::AskT ask;
  ask.what = what;
  for (std::size_t printed = 0;;) {
    const inspect::ReportT page = server.inspect(ask);
    for (const auto& entry : page.*list) print(*entry);
    printed += (page.*list).size();
    if (!page.more) return printed;
    ask.from = page.next;
    ask.after = page.next_group;
  }
}

}  // namespace

void Service::detach() {
  const int code = InitKPL(kRestartCalls, nullptr, 0, nullptr);
  if (code == 0) return;
  throw std::runtime_error("cannot become a daemon: " + std::to_string(code) + " " + err_detail.dae_error_string);
}

void Service::attach(Server& server, Options& options, const platform::ServiceManager& manager) {
  server_ = &server;
  options_ = &options;
  manager_ = &manager;
  server.on_hangup([this] { on_hangup(); });
  server.on_stopping([this] { manager_->stopping(); });
  if (manager.alive_every()) server.repeat(*manager.alive_every(), [this] { manager_->alive(); });
  if (getKPLDescriptor() >= 0) server.watch(getKPLDescriptor(), [this] { on_request(); });
  if (getStopCode() != 0) server.stop(getStopMsg());  // SIGTERM came before the server took it over
}

void Service::tell_ready() const { manager_->ready(serves(*options_)); }

void Service::on_request() {
  doKPLreq();
  if (getStopCode() != 0) server_->stop(getStopMsg());
}

void Service::traceBegin(int dae_long) {
  tracing_ = true;
  server_->set_log_level(dae_long == 1 ? spdlog::level::trace : spdlog::level::debug);
}

void Service::traceEnd() {
  tracing_ = false;
  server_->set_log_level(options_->log_level);
}

/// What cannot change while clients are connected is told, not dropped in silence.
std::vector<std::string> Service::read_again() {
  std::vector<std::string> told;
  const auto later = [&](const char* setting) {
    told.push_back(std::string(setting) + ": changes with the next start");
  };
  const Options now = reread_();
  // Also under the old name: it may have been moved away to keep it short.
  if (!now.log_file.empty()) {
    platform::log_to_file(now.log_file);
    options_->log_file = now.log_file;
  } else if (!options_->log_file.empty()) {
    later("log-file");
  }
  options_->log_level = now.log_level;
  options_->queue_bound = now.queue_bound;
  options_->drain_time = now.drain_time;
  options_->user_queue_bound = now.user_queue_bound;
  options_->total_queue_bound = now.total_queue_bound;
  options_->max_sessions = now.max_sessions;
  options_->user_sessions = now.user_sessions;
  options_->root_sessions = now.root_sessions;
  if (!tracing_) server_->set_log_level(now.log_level);
  server_->set_bounds(now);
  if (now.socket_path != options_->socket_path) later("socket-path");
  if (now.access_group != options_->access_group) later("access-group");
  if (now.node_number != options_->node_number) later("node-number");
  if (now.corosync != options_->corosync) later("ordering");
  if (now.safe != options_->safe) later("delivery");
  if (now.member_timeout != options_->member_timeout) later("member-timeout");
  if (now.require_quorum != options_->require_quorum) later("require-quorum");
  if (now.engine.session_bytes != options_->engine.session_bytes) later("session-state-bound");
  if (now.engine.user_bytes != options_->engine.user_bytes) later("user-state-bound");
  if (now.engine.total_bytes != options_->engine.total_bytes) later("state-bound");
  if (now.engine.max_phase_time != options_->engine.max_phase_time) later("max-phase-time");
  return told;
}

void Service::refresh() try {
  for (const std::string& told : read_again()) inform_printf("%s\n", told.c_str());
} catch (const std::exception& error) {
  error_printf("%s", error.what());
  server_->log().error("refresh: {}", error.what());
}

void Service::on_hangup() {
  if (server_->stopping()) return;  // that was told last
  manager_->reloading();
  try {
    for (const std::string& told : read_again()) server_->log().warn("{}", told);
    server_->log().info("the configuration was read again");
  } catch (const std::exception& error) {
    server_->log().error("SIGHUP: {}; nothing changes", error.what());
  }
  tell_ready();
}

void Service::longStatus() {
  print_short_status();
  const std::size_t groups = print_all(*server_, inspect::What::Groups, &inspect::ReportT::groups, print_group);
  const std::size_t sessions =
      print_all(*server_, inspect::What::Sessions, &inspect::ReportT::sessions, print_session);
  line("total", std::to_string(groups) + " groups, " + std::to_string(sessions) + " sessions, " +
                    domain_of(*server_->inspect({}).daemon));
}

}  // namespace gs::daemon
