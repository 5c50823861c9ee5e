// The client's private record, with the blocks in which notifications are recorded for waiting threads.
#ifndef GSCL_GSCLIENT_DATA_H
#define GSCL_GSCLIENT_DATA_H

#include <pthread.h>

#include <atomic>

#include "gscl/GSClient.h"
#include "gscl/GSLockPrim.h"
#include "gscl/GSString.h"
#include "gscl/scopes_internal.h"

namespace zelt_gscl_V1 {

constexpr int kMaxGroupNameLength = 32;
constexpr int kWaitBlocks = 4;

/// Owner of a free block.
inline pthread_t freeBlockOwner() { return static_cast<pthread_t>(-1); }

/// Where one requesting thread's notifications are recorded. Guarded by the client's wait mutex.
struct waitfor_control_block_t {
  unsigned int sequence;               // of the request that started the block; 0 when clean
  int protocol_type;                   // of that request; -1 when clean
  pthread_t owner;                     // the requesting thread
  int loc_triggered;                   // where-bits passed since the start or the last satisfied wait
  int satisfied;                       // 1: answered; records nothing until it is started again
  wyx_notification_summary_t summary;  // of the last notification passed

  void clean();
  void PassNotificationToWaiter(GSClientType obj_type, int where, int for_my_req, wyx_notification_summary_t* sum);
  /// GS_WAITFOR_ERROR here means: not yet.
  GSWaitForRC isAlreadySatisfied(GSClientType obj_type, int wf_where_what) const;
};

/// Token and states are written under the client lock (the token under none) and read without, hence atomic. The
/// client lock guards name, members and state values; the wait mutex the blocks and the sequence number.
struct GSxClientData {
  GSxClientData();
  GSxClientData(const GSxClientData&) = delete;
  GSxClientData& operator=(const GSxClientData&) = delete;

  waitfor_control_block_t* find_wfc(pthread_t tid);
  waitfor_control_block_t* add_wfc(pthread_t tid, int prot, unsigned int seq);
  void ApplyNotificationToWaiters(GSClientType obj_type, int where, int for_my_req,
                                  wyx_notification_summary_t* sum);
  /// Waits until the block holds what is waited for, the client is idle, or the wait fails. The caller holds the
  /// wait mutex and holds cancellation off, which is lifted while it sleeps; the block may be taken over by
  /// another thread meanwhile and is then looked at as it is.
  GSWaitForRC await(const waitfor_control_block_t& block, GSClient& client, int where_what,
                    const timespec* abstime, const gscl_internal::CancellationHold& hold);

  GSString _groupName;
  std::atomic<wyx_token_t> _token;
  std::atomic<GSClientState> _state;
  std::atomic<GSClientState> _oldstate;
  GSMembershipList _members;
  GSStateValue _currentStateValue;
  GSStateValue _proposedStateValue;
  waitfor_control_block_t waiters[kWaitBlocks];
  unsigned int last_seq_for_my_own;
  GSBaseMutex _wait_mutex;
  GSBaseCondition _wait_cond;  // broadcast by every notification that is recorded
  GSRWLock _transactionLock;
};

}  // namespace zelt_gscl_V1

#endif
