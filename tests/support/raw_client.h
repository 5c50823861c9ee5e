// A client made of sockets and packets, to say to a daemon what no library would.
#pragma once

#include "support/connection.h"

namespace test_support {

class RawConnection : public Connection<gs::wire::ClientMessage, gs::wire::ServerMessage> {
 public:
  explicit RawConnection(const std::string& path) : Connection(unix_socket()) { at_path(path, ::connect); }

  wyx_rc_t call(const gs::Request& request) {
    send(gs::wire::Call{request});
    return receive<gs::wire::Answer>().rc;
  }
};

/// A session with both its channels.
struct RawSession {
  explicit RawSession(const std::string& path) : request(path), event(path) {
    request.send(gs::wire::Hello{gs::wire::kProtocolVersion, 0, 0, "raw"});
    const auto welcome = request.receive<gs::wire::Welcome>();
    event.send(gs::wire::Attach{welcome.session_number, welcome.cookie});
    if (event.receive<gs::wire::Answer>().rc != WYX_OK) throw std::runtime_error("attach refused");
  }

  RawConnection request;
  RawConnection event;
};

}  // namespace test_support
