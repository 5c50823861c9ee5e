// Connections of libkpl's kplstat: one question each, and its answer.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "common/descriptor.h"
#include "control/control.h"
#include "master/loop.h"

namespace kpl::master {

/// The answer goes into the connection that asked: there is no address that somebody could take or lead elsewhere.
class StatusConnections {
 public:
  /// The lines for a subsystem's name, or, when that is empty, for a process id; nothing when there is none such.
  using Lookup = std::function<std::optional<std::vector<control::Line>>(const std::string& name, int pid)>;

  StatusConnections(const Loop& loop, Lookup lookup) : loop_(loop), lookup_(std::move(lookup)) {}

  /// Takes those that wait at a listening socket that does not block, `most` of them. False: there are no
  /// descriptors for them now.
  bool accept_from(int listening, int most);

 private:
  struct Connection {
    platform::Descriptor socket;
    std::optional<Event> readable;  // goes before the socket
  };
  using Id = std::uint64_t;

  /// False: the question is still to come.
  bool serve(int socket) const;

  const Loop& loop_;
  const Lookup lookup_;
  std::map<Id, Connection> silent_;  // have not asked yet; the oldest first
  Id last_ = 0;
};

}  // namespace kpl::master
