// The processes that processes.cpp, disturbances.cpp and cluster.cpp measure. All are the program itself, started
// with
// --role=...
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "bench/board.h"
#include "gscl/gscl.h"

namespace zn {

constexpr int kPayload = 64;          // bytes of every state value and message that is not big
constexpr int kBigState = 64 * 1024;  // the most there can be

/// What is sent: who sent it, which of its messages it is, and as many bytes as it says.
struct Payload {
  uint32_t sender = 0;
  int32_t length = kPayload;
  uint64_t number = 0;
  std::string bytes() const;
  static bool read(const char* bytes, int length, Payload* payload);
};

/// Checks what a process sees and reports it on the board: no gap in the group's sequence (for a member; a
/// subscriber is not told everything), each sender's numbers one after the other, contents intact.
class Witness {
 public:
  explicit Witness(Slot& slot) : slot_(slot) {}
  void event(uint64_t seqnum, bool gaps_allowed);
  void payload(uint64_t seqnum, const char* bytes, int length);
  void failure();
  void fault() { slot_.errors++; }
  Slot& slot() { return slot_; }

 private:
  Slot& slot_;
  uint64_t last_seqnum_ = 0;
  std::map<uint32_t, uint64_t> last_number_;
};

/// A member that approves whatever is proposed and sends payloads of its own.
class BenchMember : public zelt_gscl_V1::GSProvider {
 public:
  BenchMember(const char* group, short instance, Slot& slot)
      : GSProvider(group, instance, nullptr), witness_(slot), sender_(static_cast<uint32_t>(instance)) {}

  wyx_rc_t propose_next_state(wyx_num_phases_t phases);
  wyx_rc_t send_next_message(int length);
  Witness& witness() { return witness_; }

  void nPhaseCb(const wyx_n_phase_notification_t* n) override;
  void approvedCb(const wyx_approved_notification_t* n) override;
  void rejectedCb(const wyx_rejected_notification_t*) override { witness_.fault(); }
  void delayedErrorCb(const wyx_delayed_error_notification_t*) override { witness_.fault(); }

 private:
  Witness witness_;
  uint32_t sender_;
  uint64_t next_number_ = 1;
};

/// Runs a role; the process ends with the result.
///   echo PATH              sends every packet back
///   receiver BOARD SLOT PATH   reports every packet
///   member BOARD SLOT GROUP    a group member; "send N BYTES" on its input makes it send N messages
///   subscriber BOARD SLOT GROUP
///   idle BOARD SLOT            a session and nothing else
///   newcomer BOARD SLOT        the same as soon as it is served, and reports when that was
///   everywhere BOARD SLOT N    providers in N groups; "join I", "state I" on its input makes one join, propose
///                              64 KiB
///   crowd BOARD SLOT N         the same with N providers in one group
///   deaf BOARD SLOT            reads nothing while 4 MiB come for it; on a line of input more, until it is closed
int run_role(const std::string& role, int argc, char** argv);

/// A pathname socket of the kind that the daemon uses.
int listen_on(const std::string& path);
int connect_to(const std::string& path);

}  // namespace zn
