// The control socket: connections of kplctl, from root and the access group.
#pragma once

#include <spdlog/logger.h>

#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <optional>
#include <string>

#include "common/access.h"
#include "common/client_log.h"
#include "common/descriptor.h"
#include "common/listener.h"
#include "control/control.h"
#include "master/loop.h"
#include "master/requests.h"

namespace kpl::master {

class ControlServer {
 public:
  using Handler = std::function<void(const control::Request&, const Reply&)>;

  /// Throws platform::ListenError. `handler` may keep the Reply; one to a connection that is gone does nothing.
  ControlServer(const Loop& loop, spdlog::logger& log, const std::string& path, platform::AccessRule access,
                Handler handler);
  ~ControlServer();

  /// Somebody may have removed or replaced the socket; who is connected does not notice, new requesters would.
  /// True: all is in place, by now.
  bool keep_in_place();

 private:
  using ConnectionId = std::uint64_t;
  struct Connection {
    platform::Descriptor socket;
    std::deque<std::string> out;  // packets that wait for room
    std::size_t out_bytes = 0;
    std::optional<Event> readable;  // not while a request runs; the events go before the socket
    std::optional<Event> writable;
  };

  void on_acceptable();
  void start_accepting();
  /// False: nothing more is there, or descriptors have run out.
  bool accept_one();
  /// Into the log, unless there have been too many such lines of late. `user`: whose doing it is, if anybody's.
  void warn_about(std::optional<std::uint32_t> user, const std::string& line);
  void add_connection(platform::Descriptor socket);
  void on_readable(ConnectionId id);
  void on_packet(ConnectionId id, const std::string& packet);
  void answer(ConnectionId id, const control::Answer& answer);
  void send_waiting(ConnectionId id);

  const Loop& loop_;
  spdlog::logger& log_;
  const platform::AccessRule access_;
  const Handler handler_;
  platform::Listener listener_;
  std::map<ConnectionId, Connection> connections_;
  ConnectionId last_connection_ = 0;
  std::optional<Event> acceptable_;
  Event accept_again_;
  platform::ClientLog client_log_;
  Event tell_left_out_;
};

}  // namespace kpl::master
