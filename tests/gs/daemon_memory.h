// The session layer over connections in memory and a clock that the test moves.
#pragma once

#include <spdlog/sinks/ostream_sink.h>

#include <map>
#include <sstream>

#include "daemon/local_ordering.h"
#include "daemon/session_layer.h"
#include "support/wire_packets.h"

namespace gs::daemon {

/// What the daemon has sent on each connection, until a client takes it.
class MemoryTransport : public Transport {
 public:
  struct Wire {
    std::vector<wire::Packet> sent;
    bool closed = false;
    bool full = false;  // takes nothing
    bool gone = false;  // fails
    bool wants_writable = false;
  };

  Sent send_packet(ConnectionId to, std::span<const std::byte> header, std::span<const std::byte> slice) override {
    Wire& wire = wires.at(to);
    if (wire.gone) return Sent::kGone;
    if (wire.full) return Sent::kFull;
    wire::Packet packet(header.begin(), header.end());
    packet.insert(packet.end(), slice.begin(), slice.end());
    wire.sent.push_back(std::move(packet));
    return Sent::kDone;
  }
  void wait_writable(ConnectionId connection) override { wires.at(connection).wants_writable = true; }
  bool watch_process(ConnectionId) override { return true; }
  void close(ConnectionId connection) override { wires.at(connection).closed = true; }

  /// The daemon's messages so far, taken off the wire.
  std::vector<wire::ServerMessage> take(ConnectionId connection) {
    std::vector<wire::ServerMessage> messages;
    wire::Assembler assembler(wire::kMaxServerMessage);
    std::string error;
    for (const wire::Packet& packet : std::exchange(wires.at(connection).sent, {})) {
      if (!assembler.add(packet, &error)) throw std::runtime_error(error);
      if (!assembler.complete()) continue;
      auto message = assembler.take_server_message(&error);
      if (!message) throw std::runtime_error(error);
      messages.push_back(std::move(*message));
    }
    return messages;
  }

  std::map<ConnectionId, Wire> wires;
};

struct MemoryDaemon {
  explicit MemoryDaemon(std::size_t queue_bound = 1 << 20) : MemoryDaemon({queue_bound}, {}) {}
  explicit MemoryDaemon(SessionLayer::Settings settings, const ClientLimits& limits)
      : layer((settings.limits = limits, settings),
              {transport, ordering, [this] { return time; }, [this] { return ++last_random; }, logger,
               [this] { work_left = true; }}) {
    logger->set_level(spdlog::level::trace);
  }

  ConnectionId open(std::uint32_t uid = 1000, int pid = 4711) {
    const ConnectionId id = ++last_connection;
    transport.wires[id];
    layer.opened(id, Peer{pid, uid, 100, {}});
    return id;
  }
  void say(ConnectionId id, const wire::ClientMessage& message) {
    for (const wire::Packet& packet : wire::packets_of(message)) layer.received(id, packet);
  }
  void pass(Duration duration) {
    const Time end = time + duration;
    while (layer.next_deadline() && *layer.next_deadline() <= end) {
      time = std::max(time, *layer.next_deadline());
      layer.run_timers();
    }
    time = end;
  }
  /// One round of the loop in which nothing else is ready. False: nothing was left to do.
  bool continue_work() {
    if (!std::exchange(work_left, false)) return false;
    layer.continue_work();
    return true;
  }
  bool closed(ConnectionId id) const { return transport.wires.at(id).closed; }
  bool logged(const std::string& text) const { return log.str().find(text) != std::string::npos; }

  MemoryTransport transport;
  LocalOrdering ordering{1};
  std::ostringstream log;
  const std::shared_ptr<spdlog::logger> logger =
      std::make_shared<spdlog::logger>("test", std::make_shared<spdlog::sinks::ostream_sink_st>(log));
  Time time{1'000'000};
  std::uint64_t last_random = 0;
  ConnectionId last_connection = 0;
  bool work_left = false;
  SessionLayer layer;
};

/// A session with both channels, and what a well-behaved client does with them.
class MemoryClient {
 public:
  explicit MemoryClient(MemoryDaemon& daemon, std::uint32_t uid = 1000, std::uint32_t socket_control = 0)
      : daemon_(daemon), request(daemon.open(uid)) {
    daemon_.say(request, wire::Hello{wire::kProtocolVersion, 0, socket_control, "client"});
    welcome = std::get<wire::Welcome>(daemon_.transport.take(request).at(0));
    event = daemon_.open(uid);
    daemon_.say(event, wire::Attach{welcome.session_number, welcome.cookie});
    greeting = daemon_.transport.take(event);
    if (std::get<wire::Answer>(greeting.at(0)).rc != WYX_OK) throw std::runtime_error("attach");
  }

  wyx_rc_t ask(const wire::ClientMessage& message) {
    daemon_.say(request, message);
    return std::get<wire::Answer>(daemon_.transport.take(request).at(0)).rc;
  }
  wyx_rc_t call(const Request& r) { return ask(wire::Call{r}); }
  wyx_rc_t join(Token token, std::int16_t instance, const std::string& group = "group") {
    JoinRequest r;
    r.token = token;
    r.instance = instance;
    r.attributes.group_name = group;
    return call(r);
  }
  std::vector<wire::ServerMessage> events() { return daemon_.transport.take(event); }
  /// The event channel takes again what comes, for so many turns of the loop at most.
  void read_again(int turns = 100) {
    event_wire().full = false;
    while (turns-- > 0 && std::exchange(event_wire().wants_writable, false)) daemon_.layer.writable(event);
  }
  MemoryTransport::Wire& event_wire() { return daemon_.transport.wires.at(event); }
  bool closed() const { return daemon_.closed(request) && daemon_.closed(event); }

 private:
  MemoryDaemon& daemon_;

 public:
  ConnectionId request = 0;
  ConnectionId event = 0;
  wire::Welcome welcome;
  std::vector<wire::ServerMessage> greeting;  // the answer to Attach, and what came with it
};

}  // namespace gs::daemon
