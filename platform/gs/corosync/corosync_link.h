// Corosync in the daemon's event loop: its process group, its rings and its quorum.
//
// Nothing blocks longer than Corosync's own calls do. What it cannot take yet waits here, in its order. Where it
// is not there, goes away or is started again, each reason is logged once and it is tried again, with longer and
// longer pauses.
#pragma once

#include <corosync/cpg.h>
#include <corosync/quorum.h>
#include <corosync/votequorum.h>
#include <event2/event.h>
#include <spdlog/logger.h>

#include <deque>
#include <functional>
#include <memory>
#include <span>
#include <variant>

#include "cluster/replication.h"
#include "common/event_ptr.h"

namespace gs::cluster {

/// Runs what the loop calls, and does what the loop needs after it.
using Around = std::function<void(const std::function<void()>& action)>;

/// What Corosync tells. None of it comes from inside a call of the link's.
class CorosyncListener {
 public:
  virtual ~CorosyncListener() = default;
  /// It is there: this daemon as the group knows it, and the host's own address, empty where it has none.
  virtual void connected(const Process& self, const std::string& host_address) = 0;
  virtual void gone(const std::string& why) = 0;
  virtual void view_changed(const View& view) = 0;
  virtual void ring_changed(const RingId& ring) = 0;
  virtual void verdict(const Verdict& verdict) = 0;
  virtual void received(const Process& from, std::span<const std::byte> bytes) = 0;
  /// Nothing more is there for now.
  virtual void settle() = 0;
};

/// Not safe for concurrent use.
class CorosyncLink {
 public:
  struct Settings {
    std::string group = "zn-gscl";
    bool require_quorum = true;
  };
  /// `base` and `listener` outlive it.
  CorosyncLink(const Settings& settings, event_base* base, Around around, CorosyncListener& listener,
               std::shared_ptr<spdlog::logger> log);
  ~CorosyncLink();
  CorosyncLink(const CorosyncLink&) = delete;
  CorosyncLink& operator=(const CorosyncLink&) = delete;

  /// Connects as soon as that can be.
  void start();
  // In this order, as soon as Corosync takes them.
  void join();
  /// What has not been sent yet is not sent any more.
  void leave();
  void send(std::vector<std::byte> message);
  /// Bytes of what Corosync has not taken yet.
  std::size_t unsent() const { return unsent_; }

 private:
  using EventPtr = platform::EventPtr;
  struct Join {};
  struct Leave {};
  using Task = std::variant<Join, Leave, std::vector<std::byte>>;
  static std::size_t size_of(const Task& task) {
    const auto* message = std::get_if<std::vector<std::byte>>(&task);
    return message == nullptr ? 0 : message->size();
  }
  static constexpr int kAtOnce = 64;  // callbacks before others are served
  /// Over when a callback throws, too.
  struct Dispatching {
    bool& on;
    ~Dispatching() { on = false; }
  };

  bool connect(std::string* why);
  bool connect_cpg(std::string* why);
  bool connect_quorum(std::string* why);
  void disconnect_cpg();
  std::string host_address(Node node) const;
  bool watch(int fd, EventPtr* readable);
  void disconnect();
  void try_to_connect();
  void lose(const std::string& what);
  template <typename Dispatch>
  void dispatch(const char* what, Dispatch dispatch);
  void enqueue(Task task);
  void forget_tasks();
  template <void (CorosyncLink::*Member)()>
  EventPtr timer();
  void connect_after(std::chrono::milliseconds pause);
  void work_off();
  void break_later(const std::string& why);
  void lose_broken() { lose(broken_); }
  bool leave_group();
  cs_error_t join_again();
  cs_error_t run(const Task& task);
  void on_quorum(bool quorate, const quorum_ring_id& ring, std::span<const std::uint32_t> members);

  static CorosyncLink& of(cpg_handle_t handle);
  static cpg_model_v1_data_t cpg_callbacks();
  static quorum_model_v1_data_t quorum_callbacks();

  const Settings settings_;
  event_base* const base_;
  const Around around_;
  CorosyncListener& listener_;
  const std::shared_ptr<spdlog::logger> log_;
  cpg_name name_{};
  cpg_handle_t cpg_ = 0;
  quorum_handle_t quorum_ = 0;
  votequorum_handle_t votes_ = 0;
  bool dispatching_ = false;
  std::string told_;    // why Corosync is not there
  std::string broken_;  // what it has refused
  EventPtr cpg_readable_;
  EventPtr quorum_readable_;
  EventPtr work_later_;
  EventPtr lose_later_;
  EventPtr connect_later_;
  std::deque<Task> tasks_;
  std::size_t unsent_ = 0;  // bytes of them
  int refused_joins_ = 0;   // since one was taken
  std::chrono::milliseconds pause_;
};

}  // namespace gs::cluster
