// What the daemon tells of itself, its groups and its clients: for whoever asks on a connection, and for its long
// status.
#pragma once

#include <string>
#include <vector>

#include "daemon/ordering.h"
#include "daemon/timers.h"
#include "engine/engine.h"
#include "inspect/messages.h"

namespace gs::daemon {

/// A session as it stands.
struct SessionStatus {
  std::uint64_t number = 0;
  std::string program;
  int pid = 0;
  std::uint32_t uid = 0;
  std::size_t answer_bytes = 0;        // that wait for the client to read them
  std::size_t notification_bytes = 0;  // likewise
  bool responding = true;
  Time since{};
};

/// Since the daemon was started.
struct Counters {
  std::uint64_t connections = 0;
  std::uint64_t sessions = 0;
  std::uint64_t faults = 0;  // connections closed for what they did or did not do
  std::uint64_t requests = 0;
  std::uint64_t refused = 0;  // requests with another answer than WYX_OK
  std::uint64_t notifications = 0;
  std::uint64_t pings = 0;
  std::uint64_t missed = 0;  // by taps
};

/// What a report is made of. A page has a bounded number of entries, so that others are served in between.
struct Facts {
  const Engine& engine;
  const Domain* domain;  // null: no client is served
  bool will_serve = true;
  const char* ordering = "";
  const char* version = "";
  std::uint32_t node = 0;  // where there is no domain; 0: not known
  Time now{};
  Time started{};
  const Counters& counters;
  std::size_t waiting_bytes = 0;  // for all clients
  std::size_t session_count = 0;
  std::vector<SessionStatus> sessions;  // by number, where the report names any
};

inspect::ReportT report(const inspect::AskT& ask, const Facts& facts);

inline inspect::Id id_of(ProviderId id) { return {id.instance, id.node}; }
std::vector<inspect::Id> ids_of(const SharedMembership& members);

}  // namespace gs::daemon
