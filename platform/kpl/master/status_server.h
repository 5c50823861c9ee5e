// Answers what libkpl's kplstat asks: short status of one subsystem, for any process of this host.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "common/named_socket.h"
#include "control/control.h"
#include "master/loop.h"

namespace kpl::master {

class StatusServer {
 public:
  /// The lines for a subsystem's name, or, when that is empty, for a process id; nothing when there is none such.
  using Lookup = std::function<std::optional<std::vector<control::Line>>(const std::string& name, int pid)>;

  /// Takes the place of a dead master's socket at `path`, and of what somebody puts there later. The socket goes
  /// with the object. Throws platform::ListenError.
  StatusServer(const Loop& loop, const std::string& path, Lookup lookup);
  StatusServer(const StatusServer&) = delete;
  StatusServer& operator=(const StatusServer&) = delete;

 private:
  void listen_at_path();
  void look_at_path();
  void on_readable();

  const Loop& loop_;
  const std::string path_;
  const Lookup lookup_;
  std::unique_ptr<platform::NamedSocket> socket_;
  std::optional<Event> readable_;
  Event look_again_;
};

}  // namespace kpl::master
