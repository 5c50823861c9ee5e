// The session of this process.
#pragma once

#include <memory>

#include "client/session.h"

namespace gs::client {

/// Null before wyx_setup and after wyx_quit, and in the child of a fork until its own wyx_setup. Whoever holds the
/// result keeps the session's storage and descriptors, not the session itself, which another thread may quit. Any
/// thread.
std::shared_ptr<Session> current_session();

/// What wyx_setup gives.
struct SetupOptions {
  std::uint32_t api_version = 0;
  wyx_socket_ctrl_t socket_control = WYX_SOCKET_NO_SIGNAL;
  wyx_responsiveness_t responsiveness = {};
  SessionRoutines routines;
};

/// Opens the session. WYX_EXISTS when there is one whose group services are not gone; one whose are gone is
/// replaced, and what it has not handed out yet comes first in the new one.
wyx_rc_t open_session(const SetupOptions& options, wyx_descriptor_t* descriptor);
wyx_rc_t quit_session();

// Ask with the open session, or without one.
wyx_rc_t query_node(wire::NodeInfo* info);
wyx_rc_t query_adapters(const wire::QueryAdapters& query, wire::NodeAdapters* found);

}  // namespace gs::client
