// What a daemon reads, from clients that may say anything: the input is a small program that opens connections,
// sends whole, damaged and made-up packets, stalls, dies and lets time pass. Among its clients is one that
// behaves; the daemon may close any other, but that one is served to the end.
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "gs/daemon_memory.h"
#include "gs/made_up_request.h"
#include "gs/wire_samples.h"

namespace gs::daemon {
namespace {

void require(bool condition, const char* what) {
  if (condition) return;
  fprintf(stderr, "the well-behaved client: %s\n", what);
  abort();
}

/// The input, byte by byte; zeros once it is used up.
class Input {
 public:
  Input(const std::uint8_t* data, std::size_t size) : left_(data, size) {}
  bool empty() const { return left_.empty(); }
  std::uint8_t byte() {
    if (left_.empty()) return 0;
    const std::uint8_t value = left_.front();
    left_ = left_.subspan(1);
    return value;
  }
  std::uint16_t word() { return static_cast<std::uint16_t>(byte() | byte() << 8); }
  wire::Packet bytes(std::size_t count) {
    count = std::min(count, left_.size());
    const auto taken = std::as_bytes(left_.first(count));
    left_ = left_.subspan(count);
    return {taken.begin(), taken.end()};
  }

 private:
  std::span<const std::uint8_t> left_;
};

class Run {
 public:
  Run(const std::uint8_t* data, std::size_t size) : input_(data, size) {
    require(good_.join(0, 0, "g0") == WYX_OK && good_.join(1, 1, "g0") == WYX_OK, "join");
  }

  void run() {
    for (int steps = 0; !input_.empty() && steps < kMaxSteps; ++steps) {
      step();
      for (const ConnectionId id : open_) daemon_.transport.wires.at(id).sent.clear();
      good_.events();
      require(!good_.closed(), "closed");
    }
    good_.ask(wire::SetResponsiveness{});
    daemon_.layer.say_farewell();
    const auto events = good_.events();
    require(!events.empty() && std::holds_alternative<wire::Farewell>(events.back()), "no farewell");
  }

 private:
  static constexpr int kMaxSteps = 400;
  static constexpr std::size_t kMaxConnections = 24;
  static constexpr std::size_t kQueueBound = 64 * 1024;

  void step() {
    static constexpr void (Run::*kSteps[])() = {&Run::open,       &Run::full_session,   &Run::sample,
                                                &Run::raw_packet, &Run::framed_payload, &Run::attach,
                                                &Run::request,    &Run::change_wire,    &Run::writable,
                                                &Run::lose,       &Run::pass_time,      &Run::answer_ping};
    (this->*kSteps[input_.byte() % std::size(kSteps)])();
  }
  void writable() { daemon_.layer.writable(some()); }
  void lose() { daemon_.layer.lost(some(), "fuzzed"); }
  void pass_time() { daemon_.pass(Duration(input_.byte() * 100)); }
  void answer_ping() { daemon_.say(some(), wire::PingAnswer{input_.byte(), input_.byte() % 2 == 0}); }

  /// One of the connections, open or not; never the well-behaved client's.
  ConnectionId some() {
    if (open_.empty()) open();
    return open_[input_.byte() % open_.size()];
  }

  void open() {
    if (open_.size() < kMaxConnections) open_.push_back(daemon_.open(input_.byte() % 2));
  }

  void full_session() {
    if (open_.size() + 2 > kMaxConnections) return;
    MemoryClient client(daemon_);
    open_.push_back(client.request);
    open_.push_back(client.event);
    last_welcome_ = client.welcome;
  }

  void attach() {
    daemon_.say(some(), wire::Attach{last_welcome_.session_number, last_welcome_.cookie + input_.byte() % 2});
  }

  void sample() {
    static const auto kMessages = wire::samples::client_messages();
    const ConnectionId to = some();
    auto packets = wire::packets_of(kMessages[input_.byte() % kMessages.size()]);
    for (int flips = input_.byte() % 4; flips > 0; --flips) {
      wire::Packet& packet = packets[0];
      packet[input_.word() % packet.size()] ^= std::byte{input_.byte()};
    }
    if (input_.byte() % 8 == 1) packets[0].resize(input_.word() % packets[0].size());
    for (const wire::Packet& packet : packets) daemon_.layer.received(to, packet);
  }

  void raw_packet() {
    const ConnectionId to = some();
    daemon_.layer.received(to, input_.bytes(input_.byte()));
  }

  /// A header that is right, or nearly, around any payload.
  void framed_payload() {
    const ConnectionId to = some();
    const auto payload = input_.bytes(input_.byte());
    auto packet = wire::packets_of(wire::ClientMessage(wire::Quit{}))[0];
    packet.resize(wire::kHeaderSize);
    const std::uint32_t length = static_cast<std::uint32_t>(payload.size()) + (input_.byte() == 1 ? 1 : 0);
    std::memcpy(packet.data() + 12, &length, sizeof length);
    packet.insert(packet.end(), payload.begin(), payload.end());
    daemon_.layer.received(to, packet);
  }

  void change_wire() {
    auto& wire = daemon_.transport.wires.at(some());
    const std::uint8_t how = input_.byte();
    wire.full = how % 4 == 1;
    wire.gone = how % 8 == 2;
  }

  void request() {
    const ConnectionId to = some();
    daemon_.say(to, wire::Call{made_up_.request()});
  }

  Input input_;
  test::MadeUp<Input> made_up_{input_};
  static ClientLimits limits() {
    ClientLimits limits;
    limits.user_queue_bound = 2 * kQueueBound;
    limits.total_queue_bound = 4 * kQueueBound;
    return limits;
  }

  MemoryDaemon daemon_{{1, kQueueBound}, limits()};
  MemoryClient good_{daemon_};
  std::vector<ConnectionId> open_;
  wire::Welcome last_welcome_;
};

}  // namespace
}  // namespace gs::daemon

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  gs::daemon::Run(data, size).run();
  return 0;
}
