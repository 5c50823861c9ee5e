#include "client/current_session.h"

#include <cerrno>
#include <utility>
#include <vector>

#include "client/embedded_transport.h"
#include "client/environment.h"
#include "client/fork.h"
#include "client/socket_transport.h"

namespace gs::client {
namespace {

// Null or never destroyed, and so what it points at: other threads may be inside an entry point while the process
// ends.
std::shared_ptr<Session>* current GS_GUARDED_BY(process_mutex) = nullptr;

/// The place of this process's session. One that an ancestor left there is left behind untouched: it is the
/// ancestor's, and this process's descriptors for it stay.
std::shared_ptr<Session>& own_session() GS_REQUIRES(process_mutex) {
  static auto& of_ancestors = *new std::vector<std::shared_ptr<Session>>;
  if (current == nullptr) current = new std::shared_ptr<Session>;
  if (*current && (*current)->inherited()) of_ancestors.push_back(std::exchange(*current, nullptr));
  return *current;
}

std::unique_ptr<Transport> open_transport(const SetupOptions& options, wyx_rc_t* rc) {
  const auto address = daemon_address();
  const auto limit = request_limit();
  if (!address || !limit) {
    *rc = WYX_BAD_PARAMETER;
    return nullptr;
  }
  // Nobody would hand out what is not asked for.
  auto socket_control = static_cast<std::uint32_t>(options.socket_control);
  if (options.routines.domain_control == nullptr) socket_control &= ~kDomainControlBits;
  if (address->embedded) return EmbeddedTransport::open(socket_control, rc);
  wire::Hello hello;
  hello.api_version = options.api_version;
  hello.socket_control = socket_control;
  hello.program = program_invocation_short_name;
  return SocketTransport::open(address->path, hello, *limit, rc);
}

/// In the place of `before`. False: another thread's session is there by now.
bool install(const std::shared_ptr<Session>& session, const std::shared_ptr<Session>& before) {
  MutexLock lock(process_mutex);
  std::shared_ptr<Session>& own = own_session();
  if (own != before) return false;
  own = session;
  return true;
}

}  // namespace

std::shared_ptr<Session> current_session() {
  MutexLock lock(process_mutex);
  return own_session();
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
  if (rc == WYX_OK && before) session->follow(before);
  if (rc == WYX_OK && !install(session, before)) rc = WYX_EXISTS;
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
    MutexLock lock(process_mutex);
    session = std::exchange(own_session(), nullptr);
  }
  if (!session) return WYX_NO_INIT;
  session->quit();
  return WYX_OK;
}

wyx_rc_t query_node(wire::NodeInfo* info) {
  const auto session = current_session();
  if (session && !session->gone()) return session->query_node(info);
  const auto address = daemon_address();
  if (!address) return WYX_BAD_PARAMETER;
  if (!address->embedded) return SocketTransport::query_node_of(address->path, info);
  *info = {EmbeddedTransport::kNodeNumber, EmbeddedTransport::kNodeNumber};
  return WYX_OK;
}

wyx_rc_t query_adapters(const wire::QueryAdapters& query, wire::NodeAdapters* found) {
  const auto session = current_session();
  if (session && !session->gone()) return session->query_adapters(query, found);
  const auto address = daemon_address();
  if (!address) return WYX_BAD_PARAMETER;
  return address->embedded ? WYX_CONNECT_FAILED : SocketTransport::query_adapters_of(address->path, query, found);
}

}  // namespace gs::client
