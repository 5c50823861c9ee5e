// What a daemon reads, from clients that may say anything: the input is a small program that opens connections,
// sends whole, damaged and made-up packets, stalls, dies and lets time pass. Among its clients is one that
// behaves; the daemon may close any other, but that one is served to the end.
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "fuzz/input.h"
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
    fuzz::damage(input_, packets);
    for (const wire::Packet& packet : packets) daemon_.layer.received(to, packet);
  }

  void raw_packet() {
    const ConnectionId to = some();
    daemon_.layer.received(to, input_.bytes(input_.byte()));
  }

  void framed_payload() {
    const ConnectionId to = some();
    daemon_.layer.received(to, fuzz::framed_payload(input_));
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

  fuzz::Input input_;
  test::MadeUp<fuzz::Input> made_up_{input_};
  static ClientLimits limits() {
    ClientLimits limits;
    limits.user_queue_bound = 2 * kQueueBound;
    limits.total_queue_bound = 4 * kQueueBound;
    return limits;
  }

  MemoryDaemon daemon_{{kQueueBound}, limits()};
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
