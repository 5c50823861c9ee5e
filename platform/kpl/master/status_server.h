// Answers what libkpl's kplstat asks: short status of one subsystem, for any process of this host.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "common/named_socket.h"
#include "master/loop.h"
#include "master/status_connections.h"

namespace kpl::master {

class StatusServer {
 public:
  using Lookup = StatusConnections::Lookup;

  /// Takes the place of a dead master's socket at `path`. The socket goes with the object. Throws
  /// platform::ListenError.
  StatusServer(const Loop& loop, const std::string& path, Lookup lookup);
  StatusServer(const StatusServer&) = delete;
  StatusServer& operator=(const StatusServer&) = delete;

  /// Binds anew what somebody has removed or replaced. Only while the lock of the control socket is held: another
  /// master's socket must not be taken.
  void keep_in_place();

 private:
  void listen_at_path();
  void on_readable();

  const Loop& loop_;
  const std::string path_;
  StatusConnections connections_;
  std::unique_ptr<platform::NamedSocket> socket_;
  std::optional<Event> readable_;
  Event accept_again_;
};

}  // namespace kpl::master
