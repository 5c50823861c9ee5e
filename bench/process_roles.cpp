#include "bench/process_roles.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>

#include "examples/commands.h"

namespace zn {
namespace {

using zelt_gscl_V1::GSController;

sockaddr_un address_of(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  return address;
}

class BenchSubscriber : public zelt_gscl_V1::GSSubscriber {
 public:
  BenchSubscriber(const char* group, Slot& slot) : GSSubscriber(group, WYX_SUBSCRIBE_STATE), witness_(slot) {}
  void subscribeCb(const wyx_subscription_notification_t* n) override {
    witness_.event(n->gs_event_seqnum, true);
    const wyx_state_value_t* state = n->gs_state_value;
    if (state && state->gs_length > 0) witness_.payload(n->gs_event_seqnum, state->gs_state, state->gs_length);
    witness_.slot().ready = 1;
  }

 private:
  Witness witness_;
};

int echo(const std::string& path) {
  const int s = connect_to(path);
  char bytes[kPayload];
  ssize_t count;
  while ((count = ::recv(s, bytes, sizeof bytes, 0)) > 0) {
    if (::send(s, bytes, static_cast<size_t>(count), MSG_NOSIGNAL) != count) return 1;
  }
  return 0;
}

int receiver(Slot& slot, const std::string& path) {
  const int s = connect_to(path);
  char bytes[kPayload];
  Witness witness(slot);
  while (::recv(s, bytes, sizeof bytes, 0) > 0) witness.payload(0, bytes, kPayload);
  return 0;
}

// Dispatches until the standard input ends, and does what stands there.
template <class Obey>
int serve(GSController& controller, Obey obey) {
  Commands commands;
  for (;;) {
    pollfd ready[] = {{controller.getGSDescriptor(), POLLIN, 0}, {commands.descriptor(), POLLIN, 0}};
    if (::poll(ready, 2, -1) < 0) return 1;
    if (ready[0].revents && controller.dispatch(WYX_NON_BLOCKING) != WYX_OK) return 1;
    if (ready[1].revents && !commands.read_some()) return 0;
    for (std::string line; commands.next(&line);) obey(line);
  }
}

int member(GSController& controller, Slot& slot, int number, const char* group) {
  BenchMember member(group, static_cast<short>(number), slot);
  if (member.joinGroup() != WYX_OK) return 1;
  return serve(controller, [&](const std::string& line) {
    long left = 0;
    int length = 0;
    if (std::sscanf(line.c_str(), "send %ld %d", &left, &length) != 2) return;
    while (left > 0) {
      const wyx_rc_t rc = member.send_next_message(length);
      if (rc == WYX_OK) left--;
      if (rc != WYX_OK && rc != WYX_COLLIDE) return member.witness().fault();
      controller.dispatch(WYX_NON_BLOCKING);
    }
  });
}

int subscriber(GSController& controller, Slot& slot, const char* group) {
  BenchSubscriber subscriber(group, slot);
  if (subscriber.subscribeGroup() != WYX_OK) return 1;
  return serve(controller, [](const std::string&) {});
}

// A member that counts what it is told and looks at nothing else.
class CountingMember : public zelt_gscl_V1::GSProvider {
 public:
  CountingMember(const std::string& group, int instance, Slot& slot)
      : GSProvider(group.c_str(), static_cast<short>(instance), nullptr), slot_(slot) {}
  void approvedCb(const wyx_approved_notification_t* n) override {
    if (n->gs_protocol_type == WYX_FAILURE_LEAVE) {
      slot_.time = now_ns();
      slot_.failures++;
    }
    slot_.count.fetch_add(1, std::memory_order_release);
  }
  void announcementCb(const wyx_announcement_notification_t*) override { slot_.ready = 0; }  // the session is over
  wyx_rc_t propose_big_state() {
    std::string state(kBigState, 'b');
    return changeStateValue(wyx_state_value_t{kBigState, state.data()}, WYX_1_PHASE, 0);
  }

 private:
  Slot& slot_;
};

// Joins and proposes for one of its members when told; its slot says whether it still has its session.
int counting(GSController& controller, Slot& slot, std::vector<std::unique_ptr<CountingMember>> members) {
  slot.ready = 1;
  return serve(controller, [&](const std::string& line) {
    char what[8];
    std::size_t which = 0;
    if (std::sscanf(line.c_str(), "%7s %zu", what, &which) != 2 || which >= members.size()) return;
    const bool join = std::strcmp(what, "join") == 0;
    const wyx_rc_t rc = join ? members[which]->joinGroup() : members[which]->propose_big_state();
    if (rc != WYX_OK) slot.errors++;
  });
}

int everywhere(GSController& controller, Slot& slot, int number, int groups) {
  // With so many at work on few processors, what is timed beside them is the daemon, not its turn on a processor.
  if (::nice(10) == -1) return 1;
  std::vector<std::unique_ptr<CountingMember>> members;
  for (int i = 0; i < groups; i++) {
    members.push_back(std::make_unique<CountingMember>("group" + std::to_string(i), number, slot));
  }
  return counting(controller, slot, std::move(members));
}

int crowd(GSController& controller, Slot& slot, int number, int providers) {
  std::vector<std::unique_ptr<CountingMember>> members;
  for (int i = 0; i < providers; i++) {
    members.push_back(std::make_unique<CountingMember>("crowd", number * providers + i, slot));
  }
  return counting(controller, slot, std::move(members));
}

// Reads nothing: 4 MiB of notifications wait for it, and when it is told so more, until it is closed.
int deaf(Slot& slot, int number) {
  constexpr int kFourMiB = 4 * 1024 * 1024 / kBigState;
  CountingMember member("deaf" + std::to_string(number), 1, slot);
  if (member.joinGroup() != WYX_OK) return 1;
  for (int i = 0; i < kFourMiB; i++) {
    if (member.propose_big_state() != WYX_OK) return 1;
  }
  slot.ready = 1;
  Commands commands;
  commands.read_some();
  for (int i = 0; i < 8 * kFourMiB && member.propose_big_state() == WYX_OK; i++) {
  }
  slot.ready = 0;
  return 0;
}

}  // namespace

std::string Payload::bytes() const {
  std::string bytes(static_cast<size_t>(length), static_cast<char>(number & 0xff));
  std::memcpy(bytes.data(), this, sizeof *this);
  return bytes;
}

bool Payload::read(const char* bytes, int length, Payload* payload) {
  if (length < static_cast<int>(sizeof *payload)) return false;
  std::memcpy(payload, bytes, sizeof *payload);
  if (payload->length != length) return false;
  for (int i = static_cast<int>(sizeof *payload); i < length; i++) {
    if (bytes[i] != static_cast<char>(payload->number & 0xff)) return false;
  }
  return true;
}

void Witness::event(uint64_t seqnum, bool gaps_allowed) {
  const bool follows = gaps_allowed ? seqnum >= last_seqnum_ : seqnum == last_seqnum_ + 1;
  if (last_seqnum_ != 0 && !follows) fault();
  last_seqnum_ = seqnum;
}

void Witness::payload(uint64_t seqnum, const char* bytes, int length) {
  Payload payload;
  if (!Payload::read(bytes, length, &payload)) return fault();
  uint64_t& last = last_number_[payload.sender];
  if (last != 0 && payload.number != last + 1) fault();
  last = payload.number;
  uint64_t digest = slot_.digest;
  for (uint64_t word : {seqnum, static_cast<uint64_t>(payload.sender), payload.number}) {
    digest = (digest ^ word) * 0x100000001b3ull;
  }
  slot_.digest = digest;
  slot_.seqnum = seqnum;
  slot_.time = now_ns();
  slot_.count.fetch_add(1, std::memory_order_release);
}

void Witness::failure() {
  slot_.time = now_ns();
  slot_.failures.fetch_add(1, std::memory_order_release);
}

wyx_rc_t BenchMember::propose_next_state(wyx_num_phases_t phases) {
  std::string bytes = Payload{sender_, kPayload, next_number_}.bytes();
  const wyx_rc_t rc = changeStateValue(wyx_state_value_t{kPayload, bytes.data()}, phases, 30);
  if (rc == WYX_OK) next_number_++;
  return rc;
}

wyx_rc_t BenchMember::send_next_message(int length) {
  std::string bytes = Payload{sender_, length, next_number_}.bytes();
  const wyx_rc_t rc = send_message(wyx_provider_message_t{length, bytes.data()}, WYX_1_PHASE, 0);
  if (rc == WYX_OK) next_number_++;
  return rc;
}

void BenchMember::nPhaseCb(const wyx_n_phase_notification_t* n) {
  witness_.event(n->gs_event_seqnum, false);
  if (vote(WYX_VOTE_APPROVE, WYX_NULL_VOTE, nullptr, nullptr) != WYX_OK) witness_.fault();
}

void BenchMember::approvedCb(const wyx_approved_notification_t* n) {
  witness_.event(n->gs_event_seqnum, false);
  const wyx_proposal_t& proposal = *n->gs_proposal;
  const wyx_state_value_t* state = proposal.gs_current_state_value;
  const wyx_provider_message_t* message = proposal.gs_provider_message;
  if (n->gs_protocol_type == WYX_STATE_VALUE_CHANGE && state) {
    witness_.payload(n->gs_event_seqnum, state->gs_state, state->gs_length);
  } else if (n->gs_protocol_type == WYX_PROVIDER_MESSAGE && message) {
    witness_.payload(n->gs_event_seqnum, message->gs_message, message->gs_length);
  } else if (n->gs_protocol_type == WYX_FAILURE_LEAVE) {
    witness_.failure();
  }
  witness_.slot().ready = 1;
}

int run_role(const std::string& role, int argc, char** argv) {
  if (role == "echo" && argc == 1) return echo(argv[0]);
  if (argc < 2) return 2;
  Board board(argv[0]);
  if (!board.ok()) return 2;
  const int number = std::atoi(argv[1]);
  if (role == "receiver") return receiver(board[number], argv[2]);

  GSController controller;
  while (controller.initialize() != WYX_OK) {
    if (role != "newcomer") return 1;
    ::usleep(1000);
  }
  if (role == "newcomer") board[number].time = now_ns();
  if (role == "member") return member(controller, board[number], number, argv[2]);
  if (role == "subscriber") return subscriber(controller, board[number], argv[2]);
  if (role == "everywhere") return everywhere(controller, board[number], number, std::atoi(argv[2]));
  if (role == "crowd") return crowd(controller, board[number], number, std::atoi(argv[2]));
  if (role == "deaf") return deaf(board[number], number);
  board[number].ready = 1;
  return serve(controller, [](const std::string&) {});
}

int listen_on(const std::string& path) {
  const sockaddr_un address = address_of(path);
  const int s = ::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
  if (::bind(s, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return -1;
  return ::listen(s, 512) == 0 ? s : -1;
}

int connect_to(const std::string& path) {
  const sockaddr_un address = address_of(path);
  const int s = ::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
  if (::connect(s, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return -1;
  return s;
}

}  // namespace zn
