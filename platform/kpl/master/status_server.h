// Answers what libkpl's kplstat asks: short status of one subsystem, for any process of this host.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "common/descriptor.h"
#include "control/control.h"
#include "master/loop.h"

namespace kpl::master {

class StatusServer {
 public:
  /// The lines for a subsystem's name, or, when that is empty, for a process id; nothing when there is none such.
  using Lookup = std::function<std::optional<std::vector<control::Line>>(const std::string& name, int pid)>;

  /// Takes the place of a dead master's socket at `path`. Throws platform::ListenError.
  StatusServer(const Loop& loop, const std::string& path, Lookup lookup);
  /// Removes the socket.
  ~StatusServer();
  StatusServer(const StatusServer&) = delete;
  StatusServer& operator=(const StatusServer&) = delete;

 private:
  void on_readable();

  const std::string path_;
  const Lookup lookup_;
  platform::Descriptor socket_;
  std::optional<Event> readable_;
};

}  // namespace kpl::master
