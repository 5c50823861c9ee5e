#include "client/current_session.h"

#include <cerrno>

#include "client/daemon_address.h"
#include "client/embedded_transport.h"
#include "client/socket_transport.h"

namespace gs::client {
namespace {

struct Current {
  Mutex mutex;
  std::shared_ptr<Session> session GS_GUARDED_BY(mutex);
};

// Never destroyed: other threads may be inside an entry point while the process ends.
Current& current() {
  static Current& instance = *new Current;
  return instance;
}

std::unique_ptr<Transport> open_transport(const SetupOptions& options, wyx_rc_t* rc) {
  const auto address = daemon_address_from_environment();
  if (!address) {
    *rc = WYX_BAD_PARAMETER;
    return nullptr;
  }
  if (address->embedded) return EmbeddedTransport::open(rc);
  wire::Hello hello;
  hello.api_version = options.api_version;
  hello.socket_control = static_cast<std::uint32_t>(options.socket_control);
  hello.program = program_invocation_short_name;
  return SocketTransport::open(address->path, hello, rc);
}

/// False: another session is open.
bool install(const std::shared_ptr<Session>& session) {
  Current& c = current();
  MutexLock lock(c.mutex);
  if (c.session && !c.session->gone()) return false;
  if (c.session) session->inherit(std::move(c.session));
  c.session = session;
  return true;
}

}  // namespace

std::shared_ptr<Session> current_session() {
  Current& c = current();
  MutexLock lock(c.mutex);
  return c.session;
}

wyx_rc_t open_session(const SetupOptions& options, wyx_descriptor_t* descriptor) {
  const auto before = current_session();
  if (before && !before->gone()) return WYX_EXISTS;

  wyx_rc_t rc = WYX_OK;
  auto transport = open_transport(options, &rc);
  if (!transport) return rc;
  auto session = std::make_shared<Session>(std::move(transport), options.routines);
  const bool checked = options.responsiveness.gs_responsiveness_type != WYX_NO_RESPONSIVENESS;
  if (checked) rc = session->set_responsiveness(options.responsiveness);
  if (rc == WYX_OK && !install(session)) rc = WYX_EXISTS;
  if (rc == WYX_OK) {
    *descriptor = session->descriptor();
  } else {
    session->quit();
  }
  return rc;
}

wyx_rc_t quit_session() {
  std::shared_ptr<Session> session;
  {
    Current& c = current();
    MutexLock lock(c.mutex);
    std::swap(c.session, session);
  }
  if (!session) return WYX_NO_INIT;
  session->quit();
  return WYX_OK;
}

wyx_rc_t query_node(wire::NodeInfo* info) {
  const auto session = current_session();
  if (session && !session->gone()) return session->query_node(info);
  const auto address = daemon_address_from_environment();
  if (!address) return WYX_BAD_PARAMETER;
  if (!address->embedded) return SocketTransport::query_node_of(address->path, info);
  *info = {EmbeddedTransport::kNodeNumber, EmbeddedTransport::kNodeNumber};
  return WYX_OK;
}

}  // namespace gs::client
