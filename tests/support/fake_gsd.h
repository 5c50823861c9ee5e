// A daemon that a test plays itself, message by message, to say and do what the real one would not on demand.
#pragma once

#include "support/connection.h"
#include "support/temp_dir.h"

namespace test_support {

/// The daemon's end of a connection.
using FakePeer = Connection<gs::wire::ServerMessage, gs::wire::ClientMessage>;

struct FakeSession {
  FakePeer request;
  FakePeer event;
  void close() {
    request.close();
    event.close();
  }
};

class FakeGsd : FakePeer {
 public:
  FakeGsd() : FakePeer(unix_socket()) {
    at_path(dir_ / "gsd.sock", ::bind);
    if (listen(fd(), 8) != 0) throw std::runtime_error("listen");
  }

  std::string endpoint() const { return "unix:" + dir_ / "gsd.sock"; }

  FakePeer accept() {
    wait_readable();
    return FakePeer(::accept4(fd(), nullptr, nullptr, SOCK_CLOEXEC));
  }
  /// Both channels of a session on node 1, greeted; to be called while the client sets up.
  FakeSession accept_session() {
    FakeSession session;
    session.request = accept();
    session.request.receive<gs::wire::Hello>();
    session.request.send(gs::wire::Welcome{1, 1, 99});
    session.event = accept();
    session.event.receive<gs::wire::Attach>();
    session.event.send(gs::wire::Answer{WYX_OK});
    return session;
  }

 private:
  TempDir dir_;
};

}  // namespace test_support
