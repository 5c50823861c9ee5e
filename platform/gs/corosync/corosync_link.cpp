#include "corosync/corosync_link.h"

#include <corosync/cfg.h>
#include <netdb.h>
#include <netinet/in.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

namespace gs::cluster {
namespace {

constexpr std::chrono::milliseconds kFirstPause{250};
constexpr std::chrono::milliseconds kLongestPause{10'000};
constexpr timeval kUntilTaken = {0, 1'000};  // before what Corosync did not take is tried again
constexpr int kManyJoins = 1'000;            // more than a membership takes to go
constexpr Node kMaxNode = 32'767;
constexpr cs_dispatch_flags_t kOne = CS_DISPATCH_ONE_NONBLOCKING;
constexpr std::uint32_t kUnknown = UINT32_MAX;  // votes that nobody has
constexpr int kLeaveTries = 40;
constexpr useconds_t kBetweenTries = 5'000;  // microseconds

bool try_again(cs_error_t error) { return error == CS_ERR_TRY_AGAIN || error == CS_ERR_BUSY; }

std::string text(const char* call, cs_error_t error) { return std::string(call) + ": " + cs_strerror(error); }

bool failed(const char* call, cs_error_t error, std::string* why) {
  *why = text(call, error);
  return false;
}

std::uint32_t leave_code(std::uint32_t reason) {
  if (reason == CPG_REASON_LEAVE) return WYX_HOST_LEAVE_DUE_TO_STOP;
  return reason == CPG_REASON_PROCDOWN ? WYX_PROVIDER_FAILURE : WYX_HOST_FAILURE;
}

std::vector<Process> processes(const cpg_address* list, std::size_t count) {
  std::vector<Process> processes;
  for (const cpg_address& a : std::span(list, count)) processes.push_back({a.nodeid, a.pid});
  return processes;
}

}  // namespace

CorosyncLink::CorosyncLink(const Settings& settings, event_base* base, Around around, CorosyncListener& listener,
                           std::shared_ptr<spdlog::logger> log)
    : settings_(settings),
      base_(base),
      around_(std::move(around)),
      listener_(listener),
      log_(std::move(log)),
      pause_(kFirstPause) {
  name_.length = static_cast<std::uint32_t>(std::min<std::size_t>(settings.group.size(), CPG_MAX_NAME_LENGTH));
  std::memcpy(name_.value, settings.group.data(), name_.length);
  work_later_ = timer<&CorosyncLink::work_off>();
  lose_later_ = timer<&CorosyncLink::lose_broken>();
  connect_later_ = timer<&CorosyncLink::try_to_connect>();
}

template <void (CorosyncLink::*Member)()>
CorosyncLink::EventPtr CorosyncLink::timer() {
  const auto callback = [](evutil_socket_t, short, void* link) {
    auto* self = static_cast<CorosyncLink*>(link);
    self->around_([self] { (self->*Member)(); });
  };
  EventPtr made(event_new(base_, -1, 0, callback, this));
  if (!made) throw std::bad_alloc();
  return made;
}

/// In order: the others are told that this host has left, not that something has died.
CorosyncLink::~CorosyncLink() {
  for (int i = 0; i < kLeaveTries && cpg_ != 0 && try_again(cpg_leave(cpg_, &name_)); ++i) usleep(kBetweenTries);
  disconnect();
}

void CorosyncLink::start() { event_active(connect_later_.get(), EV_TIMEOUT, 0); }

// ---------------------------------------------------------------------------------------------------- connecting

void CorosyncLink::try_to_connect() {
  std::string why;
  if (connect(&why)) {
    log_->info("connected with Corosync");
    told_.clear();
    pause_ = kFirstPause;
    return;
  }
  disconnect();
  if (std::exchange(told_, why) != why) log_->error("Corosync cannot be used: {}; it is tried again", why);
  connect_after(pause_);
  pause_ = std::min(2 * pause_, kLongestPause);
}

void CorosyncLink::connect_after(std::chrono::milliseconds pause) {
  const timeval after = {pause.count() / 1000, static_cast<suseconds_t>(pause.count() % 1000 * 1000)};
  event_add(connect_later_.get(), &after);
}

bool CorosyncLink::connect(std::string* why) {
  if (!connect_cpg(why)) return false;
  unsigned int node = 0;
  if (const auto e = cpg_local_get(cpg_, &node); e != CS_OK) return failed("cpg_local_get", e, why);
  if (node == 0 || node > kMaxNode) {
    *why = "its node id is " + std::to_string(node) + ": give this host a nodeid of 1 to 32767 in corosync.conf";
    return false;
  }
  if (!connect_quorum(why)) return false;
  listener_.connected({node, static_cast<std::uint32_t>(getpid())}, host_address(node));
  const auto tracked = quorum_trackstart(quorum_, CS_TRACK_CURRENT | CS_TRACK_CHANGES);
  return tracked == CS_OK || failed("quorum_trackstart", tracked, why);
}

bool CorosyncLink::connect_cpg(std::string* why) {
  cpg_model_v1_data_t model = cpg_callbacks();
  auto* data = reinterpret_cast<cpg_model_data_t*>(&model);
  int fd = -1;
  cs_error_t error = cpg_model_initialize(&cpg_, CPG_MODEL_V1, data, this);
  if (error != CS_OK) cpg_ = 0;
  if (error == CS_OK) error = cpg_fd_get(cpg_, &fd);
  if (error == CS_OK && !watch(fd, &cpg_readable_)) error = CS_ERR_NO_MEMORY;
  return error == CS_OK || failed("cpg_model_initialize", error, why);
}

void CorosyncLink::disconnect_cpg() {
  cpg_readable_.reset();
  if (cpg_ != 0) cpg_finalize(std::exchange(cpg_, 0));
}

bool CorosyncLink::connect_quorum(std::string* why) {
  quorum_model_v1_data_t model = quorum_callbacks();
  auto* data = reinterpret_cast<quorum_model_data_t*>(&model);
  std::uint32_t type = 0;
  int fd = -1;
  cs_error_t error = quorum_model_initialize(&quorum_, QUORUM_MODEL_V1, data, &type, this);
  if (error != CS_OK) quorum_ = 0;
  if (error == CS_OK) error = quorum_fd_get(quorum_, &fd);
  if (error == CS_OK && !watch(fd, &quorum_readable_)) error = CS_ERR_NO_MEMORY;
  if (error != CS_OK) return failed("quorum_model_initialize", error, why);
  if (type == QUORUM_FREE && settings_.require_quorum) {
    *why =
        "it has no quorum provider: set \"provider: corosync_votequorum\" in the quorum section of corosync.conf";
    return false;
  }
  error = votequorum_initialize(&votes_, nullptr);
  if (error != CS_OK) votes_ = 0;
  return error == CS_OK || !settings_.require_quorum || failed("votequorum_initialize", error, why);
}

/// Where the other hosts reach this one.
std::string CorosyncLink::host_address(Node node) const {
  constexpr int kAddresses = 8;
  corosync_cfg_handle_t cfg = 0;
  if (corosync_cfg_initialize(&cfg, nullptr) != CS_OK) return {};
  corosync_cfg_node_address_t addresses[kAddresses] = {};
  int count = 0;
  const auto error = corosync_cfg_get_node_addrs(cfg, node, kAddresses, &count, addresses);
  corosync_cfg_finalize(cfg);
  if (error != CS_OK || count < 1) return {};
  sockaddr_storage first{};
  std::memcpy(&first, addresses[0].address, sizeof addresses[0].address);
  const socklen_t length = first.ss_family == AF_INET6 ? sizeof(sockaddr_in6) : sizeof(sockaddr_in);
  char host[NI_MAXHOST] = "";
  getnameinfo(reinterpret_cast<const sockaddr*>(&first), length, host, sizeof host, nullptr, 0, NI_NUMERICHOST);
  return host;
}

bool CorosyncLink::watch(int fd, EventPtr* readable) {
  const auto callback = [](evutil_socket_t ready, short, void* link) {
    auto* self = static_cast<CorosyncLink*>(link);
    const bool cpg = self->cpg_readable_ && ready == event_get_fd(self->cpg_readable_.get());
    self->around_([=] {
      if (cpg) return self->dispatch("cpg_dispatch", [=] { return cpg_dispatch(self->cpg_, kOne); });
      self->dispatch("quorum_dispatch", [=] { return quorum_dispatch(self->quorum_, kOne); });
    });
  };
  readable->reset(event_new(base_, fd, EV_READ | EV_PERSIST, callback, this));
  return *readable && event_add(readable->get(), nullptr) == 0;
}

void CorosyncLink::disconnect() {
  disconnect_cpg();
  quorum_readable_.reset();
  if (votes_ != 0) votequorum_finalize(std::exchange(votes_, 0));
  if (quorum_ != 0) quorum_finalize(std::exchange(quorum_, 0));
  forget_tasks();
  event_del(lose_later_.get());
}

void CorosyncLink::lose(const std::string& what) {
  const std::string why = "Corosync is gone (" + what + ")";
  disconnect();
  told_.clear();
  connect_after(kFirstPause);
  listener_.gone(why);
}

// ------------------------------------------------------------------------------------------------ what it tells

template <typename Dispatch>
void CorosyncLink::dispatch(const char* what, Dispatch dispatch) {
  cs_error_t error = CS_OK;
  {
    const Dispatching now{dispatching_ = true};
    for (int i = 0; i < kAtOnce && error == CS_OK; ++i) error = dispatch();
  }
  if (error != CS_OK && error != CS_ERR_TRY_AGAIN) return lose(text(what, error));
  listener_.settle();
  work_off();
}

CorosyncLink& CorosyncLink::of(cpg_handle_t handle) {
  void* self = nullptr;
  cpg_context_get(handle, &self);
  return *static_cast<CorosyncLink*>(self);
}

cpg_model_v1_data_t CorosyncLink::cpg_callbacks() {
  cpg_model_v1_data_t model{};
  model.model = CPG_MODEL_V1;
  model.flags = CPG_MODEL_V1_DELIVER_INITIAL_TOTEM_CONF;
  model.cpg_deliver_fn = [](cpg_handle_t handle, const cpg_name*, std::uint32_t node, std::uint32_t pid,
                            void* message, std::size_t length) {
    of(handle).listener_.received({node, pid}, {static_cast<const std::byte*>(message), length});
  };
  model.cpg_confchg_fn = [](cpg_handle_t handle, const cpg_name*, const cpg_address* members,
                            std::size_t member_count, const cpg_address* left, std::size_t left_count,
                            const cpg_address* joined, std::size_t joined_count) {
    View view{processes(members, member_count), processes(joined, joined_count), {}};
    for (const cpg_address& a : std::span(left, left_count)) view.left[{a.nodeid, a.pid}] = leave_code(a.reason);
    of(handle).listener_.view_changed(view);
  };
  model.cpg_totem_confchg_fn = [](cpg_handle_t handle, cpg_ring_id ring, std::uint32_t, const std::uint32_t*) {
    of(handle).listener_.ring_changed({ring.seq, ring.nodeid});
  };
  return model;
}

quorum_model_v1_data_t CorosyncLink::quorum_callbacks() {
  quorum_model_v1_data_t model{};
  model.model = QUORUM_MODEL_V1;
  model.quorum_notify_fn = [](quorum_handle_t handle, std::uint32_t quorate, quorum_ring_id ring,
                              std::uint32_t count, const std::uint32_t* members) {
    const void* self = nullptr;
    quorum_context_get(handle, &self);
    static_cast<CorosyncLink*>(const_cast<void*>(self))->on_quorum(quorate != 0, ring, {members, count});
  };
  model.nodelist_notify_fn = [](quorum_handle_t, quorum_ring_id, std::uint32_t, const std::uint32_t*,
                                std::uint32_t, const std::uint32_t*, std::uint32_t, const std::uint32_t*) {};
  return model;
}

void CorosyncLink::on_quorum(bool quorate, const quorum_ring_id& ring, std::span<const std::uint32_t> members) {
  const bool required = settings_.require_quorum;
  Verdict verdict{{ring.seq, ring.nodeid}, quorate || !required, {}, required ? kUnknown : 0};
  for (const std::uint32_t node : members) {
    votequorum_info info{};
    if (node > kMaxNode) log_->error("the node id {} is over 32767: change it in corosync.conf", node);
    if (node > kMaxNode) continue;
    if (votes_ == 0 || votequorum_getinfo(votes_, node, &info) != CS_OK) continue;
    verdict.votes[node] = info.node_votes;
    if (required) verdict.needed = info.quorum;
  }
  listener_.verdict(verdict);
}

// ---------------------------------------------------------------------------------------------- what it is told

void CorosyncLink::join() { enqueue(Join{}); }

void CorosyncLink::leave() {
  forget_tasks();
  enqueue(Leave{});
}

void CorosyncLink::send(std::vector<std::byte> message) { enqueue(std::move(message)); }

void CorosyncLink::forget_tasks() {
  tasks_.clear();
  unsent_ = 0;
}

/// Where Corosync is not there, there is no group to do anything in.
void CorosyncLink::enqueue(Task task) {
  if (cpg_ == 0) return;
  unsent_ += size_of(task);
  tasks_.push_back(std::move(task));
  work_off();
}

/// Who has left has another connection: Corosync lets nobody join again on the old one.
bool CorosyncLink::leave_group() {
  std::string why;
  disconnect_cpg();
  if (connect_cpg(&why)) return true;
  lose(why);
  return false;
}

/// This process's last membership is not gone yet, or another one with its pid, in another container, is there.
cs_error_t CorosyncLink::join_again() {
  if (++refused_joins_ == kManyJoins) {
    log_->error(
        "Corosync says that process {} of this host is in the group already: two gsds in two containers? Run one "
        "on "
        "a host",
        getpid());
  }
  return CS_ERR_TRY_AGAIN;
}

cs_error_t CorosyncLink::run(const Task& task) {
  if (std::holds_alternative<Join>(task)) {
    const cs_error_t error = cpg_join(cpg_, &name_);
    if (error != CS_ERR_EXIST) refused_joins_ = 0;
    return error == CS_ERR_EXIST ? join_again() : error;
  }
  const auto& message = std::get<std::vector<std::byte>>(task);
  const iovec bytes = {const_cast<std::byte*>(message.data()), message.size()};
  return cpg_mcast_joined(cpg_, CPG_TYPE_AGREED, &bytes, 1);
}

/// Whoever has asked for it is not called from inside.
void CorosyncLink::break_later(const std::string& why) {
  broken_ = why;
  forget_tasks();
  event_active(lose_later_.get(), EV_TIMEOUT, 0);
}

/// Not from inside a callback of Corosync's: what it calls stays as it is until it is done.
void CorosyncLink::work_off() {
  while (cpg_ != 0 && !dispatching_ && !tasks_.empty()) {
    if (std::holds_alternative<Leave>(tasks_.front())) {
      tasks_.pop_front();
      if (!leave_group()) return;
      continue;
    }
    const cs_error_t error = run(tasks_.front());
    if (try_again(error)) break;
    if (error != CS_OK) return break_later(text("it refuses a task", error));
    unsent_ -= size_of(tasks_.front());
    tasks_.pop_front();
  }
  if (cpg_ != 0 && !tasks_.empty()) event_add(work_later_.get(), &kUntilTaken);
}

}  // namespace gs::cluster
