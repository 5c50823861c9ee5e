// The frame around the work of an entry point.
#pragma once

#include <new>

#include "client/current_session.h"
#include "client/entry_guard.h"

namespace gs::client {

template <typename Work>
wyx_rc_t entry(const Work& work) {
  EntryGuard guard;
  try {
    return work();
  } catch (const std::bad_alloc&) {
    return WYX_NO_MEMORY;
  }
}

/// `work` gets the open session.
template <typename Work>
wyx_rc_t session_entry(const Work& work) {
  return entry([&work] {
    const auto session = current_session();
    return session ? work(*session) : WYX_NO_INIT;
  });
}

/// `work` gets the open session, in which `token` is a client of this kind.
template <typename Work>
wyx_rc_t client_entry(Token token, Client::Kind kind, const Work& work) {
  return session_entry([&](Session& session) {
    const wyx_rc_t rc = session.check_token(token, kind);
    return rc == WYX_OK ? work(session) : rc;
  });
}

}  // namespace gs::client
