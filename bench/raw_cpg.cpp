#include "bench/raw_cpg.h"

#include <corosync/cpg.h>
#include <corosync/quorum.h>
#include <poll.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "bench/process_roles.h"
#include "examples/commands.h"

namespace zn {
namespace {

/// What a member of the process group does and is told.
class RawCpg {
 public:
  RawCpg(Board& board, int slot)
      : number_(slot),
        witness_(board[slot]),
        view_(board[slot + kViewSlot]),
        quorate_(board[slot + kQuorumSlot]) {}
  ~RawCpg() {
    if (cpg_ != 0) cpg_finalize(cpg_);
    if (quorum_ != 0) quorum_finalize(quorum_);
  }
  RawCpg(const RawCpg&) = delete;
  RawCpg& operator=(const RawCpg&) = delete;

  bool join();
  int serve();

 private:
  bool track_quorum();
  bool obey(const std::string& line);
  bool echo(long rounds, int length);
  bool send(long count, int length);
  cs_error_t send_one(int length);
  bool dispatch_what_is_there() { return cpg_dispatch(cpg_, CS_DISPATCH_ALL) == CS_OK; }
  void delivered(uint32_t node, const void* bytes, size_t length);
  static void note(Slot& slot, size_t members);

  const int number_;
  Witness witness_;
  Slot& view_;
  Slot& quorate_;
  cpg_handle_t cpg_ = 0;
  quorum_handle_t quorum_ = 0;
  uint32_t node_ = 0;
  uint64_t sent_ = 0;
  uint64_t own_ = 0;  // that have come back
};

bool RawCpg::join() {
  cpg_model_v1_data_t model{};
  model.model = CPG_MODEL_V1;
  model.cpg_deliver_fn = [](cpg_handle_t handle, const cpg_name*, uint32_t node, uint32_t, void* bytes,
                            size_t length) {
    void* self = nullptr;
    cpg_context_get(handle, &self);
    static_cast<RawCpg*>(self)->delivered(node, bytes, length);
  };
  model.cpg_confchg_fn = [](cpg_handle_t handle, const cpg_name*, const cpg_address*, size_t members,
                            const cpg_address*, size_t, const cpg_address*, size_t) {
    void* self = nullptr;
    cpg_context_get(handle, &self);
    note(static_cast<RawCpg*>(self)->view_, members);
  };
  auto* data = reinterpret_cast<cpg_model_data_t*>(&model);
  if (cpg_model_initialize(&cpg_, CPG_MODEL_V1, data, this) != CS_OK) return false;
  cpg_name name{};
  name.length = static_cast<uint32_t>(std::strlen(std::strcpy(name.value, "raw")));
  return cpg_local_get(cpg_, &node_) == CS_OK && cpg_join(cpg_, &name) == CS_OK && track_quorum();
}

bool RawCpg::track_quorum() {
  quorum_callbacks_t callbacks{};
  callbacks.quorum_notify_fn = [](quorum_handle_t handle, uint32_t, uint64_t, uint32_t members, uint32_t*) {
    const void* self = nullptr;
    quorum_context_get(handle, &self);
    note(static_cast<const RawCpg*>(self)->quorate_, members);
  };
  uint32_t type = 0;
  return quorum_initialize(&quorum_, &callbacks, &type) == CS_OK && quorum_context_set(quorum_, this) == CS_OK &&
         quorum_trackstart(quorum_, CS_TRACK_CURRENT | CS_TRACK_CHANGES) == CS_OK;
}

void RawCpg::note(Slot& slot, size_t members) {
  slot.time = now_ns();
  slot.seqnum.store(members, std::memory_order_release);
}

void RawCpg::delivered(uint32_t node, const void* bytes, size_t length) {
  witness_.payload(0, static_cast<const char*>(bytes), static_cast<int>(length));
  if (node == node_) own_++;
}

cs_error_t RawCpg::send_one(int length) {
  std::string bytes = Payload{static_cast<uint32_t>(number_), length, sent_ + 1}.bytes();
  const iovec whole{bytes.data(), bytes.size()};
  const cs_error_t error = cpg_mcast_joined(cpg_, CPG_TYPE_AGREED, &whole, 1);
  if (error == CS_OK) sent_++;
  return error;
}

bool RawCpg::echo(long rounds, int length) {
  std::string samples;
  for (long i = 0; i < rounds; i++) {
    const int64_t start = now_ns();
    if (send_one(length) != CS_OK) return false;
    while (own_ < sent_) {
      if (cpg_dispatch(cpg_, CS_DISPATCH_ONE) != CS_OK) return false;
    }
    samples += std::to_string(now_ns() - start) + " ";
  }
  std::printf("%s\n", samples.c_str());
  return std::fflush(stdout) == 0;
}

bool RawCpg::send(long count, int length) {
  int fd = -1;
  cpg_fd_get(cpg_, &fd);
  while (count > 0) {
    const cs_error_t error = send_one(length);
    if (error == CS_OK) count--;
    if (error != CS_OK && error != CS_ERR_TRY_AGAIN) return false;
    pollfd readable{fd, POLLIN, 0};
    const bool full = error == CS_ERR_TRY_AGAIN;
    if ((full || count % 64 == 0) && ::poll(&readable, 1, full ? 1 : 0) > 0 && !dispatch_what_is_there())
      return false;
  }
  return true;
}

bool RawCpg::obey(const std::string& line) {
  char what[8];
  long count = 0;
  int length = 0;
  if (std::sscanf(line.c_str(), "%7s %ld %d", what, &count, &length) != 3) return false;
  return what == std::string("echo") ? echo(count, length) : send(count, length);
}

int RawCpg::serve() {
  int cpg_fd = -1, quorum_fd = -1;
  cpg_fd_get(cpg_, &cpg_fd);
  quorum_fd_get(quorum_, &quorum_fd);
  Commands commands;
  for (;;) {
    pollfd ready[] = {{cpg_fd, POLLIN, 0}, {quorum_fd, POLLIN, 0}, {commands.descriptor(), POLLIN, 0}};
    if (::poll(ready, 3, -1) < 0) return 1;
    if (ready[0].revents && !dispatch_what_is_there()) return 1;
    if (ready[1].revents && quorum_dispatch(quorum_, CS_DISPATCH_ALL) != CS_OK) return 1;
    if (ready[2].revents && !commands.read_some()) return 0;
    for (std::string line; commands.next(&line);) {
      if (!obey(line)) return 1;
    }
  }
}

}  // namespace

int run_raw_cpg(Board& board, int slot) {
  RawCpg member(board, slot);
  return member.join() ? member.serve() : 1;
}

}  // namespace zn
