// The daemon's loop: sockets, timers and signals around the session layer.
#pragma once

#include <event2/event.h>
#include <spdlog/logger.h>

#include <chrono>
#include <csignal>
#include <functional>
#include <memory>
#include <unordered_map>
#include <vector>

#include "common/access.h"
#include "common/descriptor.h"
#include "common/event_ptr.h"
#include "common/listener.h"
#include "daemon/options.h"
#include "daemon/ordering.h"
#include "daemon/session_layer.h"

namespace gs::daemon {

using platform::AccessRule;
using platform::Descriptor;
using platform::EventPtr;
using platform::Listener;

class Server : private Transport {
 public:
  Server(const Options& options, std::shared_ptr<spdlog::logger> log);
  ~Server();

  /// Serves until SIGTERM, SIGINT or `stop`, then tells the clients and gives them a bounded time to be told.
  /// Throws std::runtime_error where it has ended because it cannot serve.
  void run();
  /// `why` is for the log. Again: does nothing.
  void stop(const std::string& why);

  // What else the loop does, each of them set once at most.
  /// Calls `action` whenever `fd` is readable.
  void watch(int fd, std::function<void()> action) { watched_.emplace(*this, fd, EV_READ, std::move(action)); }
  void on_hangup(std::function<void()> action) { hangup_.emplace(*this, SIGHUP, EV_SIGNAL, std::move(action)); }
  bool stopping() const { return stopping_; }
  void repeat(std::chrono::milliseconds every, std::function<void()> action);
  /// Before the clients are told.
  void on_stopping(std::function<void()> action) { stopping_action_ = std::move(action); }
  void set_log_level(spdlog::level::level_enum level) { log_->set_level(level); }
  spdlog::logger& log() { return *log_; }
  void set_bounds(const Options& options);
  std::size_t clients() const { return sessions_.sessions(); }
  inspect::ReportT inspect(const inspect::AskT& ask) const { return sessions_.inspect(ask); }

 private:
  struct FreeBase {
    void operator()(event_base* base) const { event_base_free(base); }
  };

  /// Calls an action again and again.
  class Repeated {
   public:
    Repeated(Server& server, evutil_socket_t fd, short what, std::function<void()> action);
    Repeated(Server& server, std::chrono::milliseconds every, std::function<void()> action);

   private:
    Repeated(Server& server, Descriptor timer, std::function<void()> action);
    static void call(evutil_socket_t, short, void* self);

    Server& server_;
    const std::function<void()> action_;
    Descriptor timer_;  // where there is one
    EventPtr event_;
  };

  struct Connection {
    Server* server;
    ConnectionId id;
    Descriptor socket;
    std::chrono::milliseconds connected;  // since boot
    Descriptor process;                   // of the peer, once that is watched
    EventPtr readable;                    // the events go before their descriptors
    EventPtr writable;
    EventPtr process_ended;
  };

  // Transport.
  Sent send_packet(ConnectionId to, std::span<const std::byte> header, std::span<const std::byte> slice) override;
  void wait_writable(ConnectionId id) override;
  bool watch_process(ConnectionId id) override;
  void close(ConnectionId id) override;

  // Called by the loop.
  void on_acceptable();
  void on_readable(ConnectionId id);
  void on_writable(ConnectionId id);
  void on_process_ended(ConnectionId id);
  void on_deadline();
  void on_continue() { sessions_.continue_work(); }

  std::unique_ptr<Ordering> make_ordering(const Options& options);
  void give_up(const std::string& why);
  void look_at_path();
  void start_accepting();
  void accept_again();
  bool accept_one();
  void add_connection(Descriptor socket);
  void pause_accepting(int error);
  void arm_deadline();
  void finish_when_drained();
  bool receive_one(ConnectionId id);

  template <typename Action>
  void guarded(ConnectionId id, Action action);
  void tend_memory();
  template <void (Server::*Member)()>
  static void call(evutil_socket_t, short, void* server);
  template <void (Server::*Member)(ConnectionId)>
  static void call_connection(evutil_socket_t, short, void* connection);

  EventPtr make_event(evutil_socket_t fd, short what, event_callback_fn callback, void* argument);

  const std::shared_ptr<spdlog::logger> log_;
  const AccessRule access_;
  std::unique_ptr<event_base, FreeBase> base_;
  Listener listener_;
  std::unique_ptr<Ordering> ordering_;
  SessionLayer sessions_;
  EventPtr acceptable_;
  EventPtr accept_again_;
  EventPtr deadline_;
  EventPtr continue_;
  EventPtr terminated_;
  EventPtr interrupted_;
  EventPtr farewell_over_;
  std::function<void()> stopping_action_ = [] {};
  std::optional<Repeated> watched_;
  std::optional<Repeated> hangup_;
  std::optional<Repeated> repeated_;
  std::optional<Repeated> look_again_;
  std::optional<Time> armed_;  // for which time deadline_ stands
  std::unordered_map<ConnectionId, Connection> connections_;
  ConnectionId last_connection_ = 0;
  bool stopping_ = false;
  std::string gave_up_;          // why
  bool told_unwatched_ = false;  // that the process of a peer cannot be watched
  bool short_of_memory_ = false;
  Time next_trim_{};
  std::vector<std::byte> packet_;  // of whatever connection is being read
};

}  // namespace gs::daemon
