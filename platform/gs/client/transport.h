// The way between a session and the group services behind it: a daemon's socket, or an engine in this process.
#pragma once

#include <cstdint>
#include <memory>

#include "engine/types.h"
#include "wire/messages.h"

namespace gs::client {

/// The next thing for the session to hand out.
struct Incoming {
  enum class Kind {
    kNothing,       // not now
    kNotification,  // `token`, `what`
    kPing,          // `ping`: to be answered with answer_ping
    kDomain,        // `domain`
    kGone           // group services are gone, and nothing follows
  };
  Kind kind = Kind::kNothing;
  Token token = -1;
  std::shared_ptr<const Notification> what;
  std::uint64_t ping = 0;
  std::shared_ptr<const DomainNotification> domain = nullptr;
};

/// Any thread may call any function, but `take` and `silence` one thread at a time. Once group services are gone
/// every request answers WYX_NO_INIT, every `wait` returns and `take` says what was still on its way, then kGone,
/// for good.
class Transport {
 public:
  Transport() = default;
  virtual ~Transport() = default;
  Transport(const Transport&) = delete;
  Transport& operator=(const Transport&) = delete;

  virtual std::uint32_t node_number() const = 0;

  /// Each of these waits for its answer.
  virtual wyx_rc_t call(Request request) = 0;
  virtual wyx_rc_t set_responsiveness(const wire::SetResponsiveness& settings) = 0;
  virtual wyx_rc_t query_node(wire::NodeInfo* info) = 0;
  virtual wyx_rc_t query_adapters(const wire::QueryAdapters& query, wire::NodeAdapters* found) = 0;
  virtual wyx_rc_t answer_quorum(std::uint64_t sequence) = 0;

  virtual Incoming take() = 0;
  virtual void answer_ping(std::uint64_t number, bool ok) = 0;
  /// Returns when `take` may have something, or a signal has come. A cancellation point, holding nothing.
  virtual void wait() = 0;

  /// Readable when `take` has something; owned by the transport.
  virtual int descriptor() const = 0;
  /// Makes the descriptor of a transport that is gone stay valid and never readable.
  virtual void silence() = 0;

  /// Also asks, without waiting, whether the other side is still there.
  virtual bool gone() = 0;
  /// Takes leave in good order; from then on gone.
  virtual void quit() = 0;
};

}  // namespace gs::client
