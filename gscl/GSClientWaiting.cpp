// Waiting for notifications: the blocks that record them, what fills the blocks, and the wait itself.
//
// Lock order: transaction lock, then wait mutex. A waiting thread holds neither while it sleeps.
#include <errno.h>

#include "gscl/GSClient.h"
#include "gscl/GSClientData_internal.h"
#include "gscl/GSTransaction_internal.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace_text_internal.h"

namespace zelt_gscl_V1 {

using MutexScope = gscl_internal::MutexScope<GSBaseMutex>;

namespace {

constexpr int kWhereBits = zelt_gscl::GS_TRIGGER_BEFORE_AFTER_CALLBACK;
// Result of a match: the block does not hold what is waited for.
constexpr GSWaitForRC kNotYet = zelt_gscl::GS_WAITFOR_ERROR;
constexpr wyx_notification_type_t kNoNotification = static_cast<wyx_notification_type_t>(-1);
constexpr wyx_request_t kNoProtocol = static_cast<wyx_request_t>(-1);

// Numbers the requests of all clients; it wraps.
std::atomic<unsigned int> global_sequence{0};

GSxClientData& dataOf(void* data) { return *static_cast<GSxClientData*>(data); }

unsigned int ownerText(pthread_t owner) { return static_cast<unsigned int>(owner); }

/// Approved, rejected and n-phase records carry the same three fields, at places of their own.
template <class Record>
void summarizeProtocol(const void* notify, wyx_notification_summary_t& sum) {
  const Record* record = static_cast<const Record*>(notify);
  sum.gs_protocol_type = record->gs_protocol_type;
  sum.gs_summary_code = record->gs_summary_code;
  if (record->gs_proposal != nullptr) sum.gs_whats_changed = record->gs_proposal->gs_whats_changed;
}

wyx_notification_summary_t summarize(const void* notify) {
  wyx_notification_summary_t sum = {};
  sum.gs_notification_type = *static_cast<const wyx_notification_type_t*>(notify);
  sum.gs_protocol_type = kNoProtocol;
  switch (sum.gs_notification_type) {
    case WYX_DELAYED_ERROR_NOTIFICATION: {
      const auto* record = static_cast<const wyx_delayed_error_notification_t*>(notify);
      sum.gs_protocol_type = record->gs_protocol_type;
      sum.gs_delayed_return_code = record->gs_delayed_return_code;
      break;
    }
    case WYX_N_PHASE_NOTIFICATION:
      summarizeProtocol<wyx_n_phase_notification_t>(notify, sum);
      break;
    case WYX_APPROVED_NOTIFICATION:
      summarizeProtocol<wyx_approved_notification_t>(notify, sum);
      break;
    case WYX_REJECTED_NOTIFICATION:
      summarizeProtocol<wyx_rejected_notification_t>(notify, sum);
      break;
    case WYX_ANNOUNCEMENT_NOTIFICATION:
      sum.gs_summary_code = static_cast<const wyx_announcement_notification_t*>(notify)->gs_summary_code;
      break;
    case WYX_SUBSCRIPTION_NOTIFICATION:
      sum.gs_protocol_type = WYX_SUBSCRIPTION;
      sum.gs_subscription_type = static_cast<const wyx_subscription_notification_t*>(notify)->gs_subscription_type;
      break;
    default:
      break;
  }
  return sum;
}

GSWaitForRC waitError(int error) {
  switch (error) {
    case ETIMEDOUT:
      return zelt_gscl::GS_WAITFOR_PENDING;
    case EINVAL:
      return zelt_gscl::GS_WAITFOR_EINVAL;
    case EPERM:
      return zelt_gscl::GS_WAITFOR_EPERM;
    case EFAULT:
      return zelt_gscl::GS_WAITFOR_EFAULT;
    case EDEADLK:
      return zelt_gscl::GS_WAITFOR_EDEADLK;
    default:
      return zelt_gscl::GS_WAITFOR_ERROR;
  }
}

/// What the caller of a wait gets in its outputs when nothing was received.
void reportNothing(wyx_notification_type_t* type, wyx_notification_summary_t* summary) {
  if (summary != nullptr) {
    summary->gs_notification_type = kNoNotification;
    summary->gs_protocol_type = kNoProtocol;
  }
  if (type != nullptr) *type = kNoNotification;
}

/// Hands the block's summary to the caller and closes the block to further notifications.
void reportReceived(waitfor_control_block_t& block, int where_what, wyx_notification_type_t* type,
                    wyx_notification_summary_t* summary) {
  if (summary != nullptr) *summary = block.summary;
  if (type != nullptr) *type = block.summary.gs_notification_type;
  block.satisfied = 1;
  block.loc_triggered &= ~where_what;
}

}  // namespace

void waitfor_control_block_t::clean() {
  sequence = 0;
  protocol_type = -1;
  owner = freeBlockOwner();
  loc_triggered = 0;
  satisfied = 0;
  summary.gs_notification_type = kNoNotification;
  summary.gs_protocol_type = kNoProtocol;
}

void waitfor_control_block_t::PassNotificationToWaiter(GSClientType, int where, int,
                                                       wyx_notification_summary_t* sum) {
  GS_TRACE(GSCL_TRC_DETAIL, "PassNotify (seq=%d)\n", static_cast<int>(sequence));
  summary = *sum;
  loc_triggered |= where;
}

GSWaitForRC waitfor_control_block_t::isAlreadySatisfied(GSClientType obj_type, int wf_where_what) const {
  const bool own_requests_only = (wf_where_what & zelt_gscl::GS_RESPOND_TO_ANY_CALLBACKS) == 0;
  if (protocol_type == -1) {
    GS_TRACE(GSCL_TRC_DETAIL, "IsAlreadySatisifed(%x) NOT_OK due to LastProt=-1\n", ownerText(owner));
    return own_requests_only ? zelt_gscl::GS_WAITFOR_NOT_REQUESTED : kNotYet;
  }
  if ((loc_triggered & wf_where_what & kWhereBits) == 0) {
    GS_TRACE(GSCL_TRC_DETAIL, "IsAlready(%x) NOT_OK2 where_recv=%x wf_where=%x\n", ownerText(owner),
             static_cast<unsigned int>(loc_triggered), static_cast<unsigned int>(wf_where_what));
    return kNotYet;
  }
  if (obj_type == zelt_gscl::GS_SUBSCRIBER || !own_requests_only) {
    GS_TRACE(GSCL_TRC_DETAIL, "IsAlreadySatisfied(%x) OK...where_recv=%x where=%x\n", ownerText(owner),
             static_cast<unsigned int>(loc_triggered), static_cast<unsigned int>(wf_where_what));
    return zelt_gscl::GS_WAITFOR_RECEIVED;
  }
  if (summary.gs_notification_type != WYX_N_PHASE_NOTIFICATION) {
    GS_TRACE(GSCL_TRC_DETAIL, "IsAlreadySatisfied(%x) OK where_recv=%x where=%x\n", ownerText(owner),
             static_cast<unsigned int>(loc_triggered), static_cast<unsigned int>(wf_where_what));
    return zelt_gscl::GS_WAITFOR_RECEIVED;
  }
  // A phase in the middle of the protocol; its end is still to come.
  GS_TRACE(GSCL_TRC_DETAIL, "IsAlreadySatisfied(%x) NOT_OK3 where_recv=%x where=%x\n", ownerText(owner),
           static_cast<unsigned int>(loc_triggered), static_cast<unsigned int>(wf_where_what));
  return kNotYet;
}

waitfor_control_block_t* GSxClientData::find_wfc(pthread_t tid) {
  if (tid == freeBlockOwner()) return nullptr;
  for (waitfor_control_block_t& block : waiters) {
    if (block.owner == tid) return &block;
  }
  return nullptr;
}

waitfor_control_block_t* GSxClientData::add_wfc(pthread_t tid, int prot, unsigned int seq) {
  waitfor_control_block_t* own = find_wfc(tid);
  waitfor_control_block_t* unused = nullptr;
  waitfor_control_block_t* oldest_satisfied = nullptr;
  waitfor_control_block_t* oldest = nullptr;
  for (waitfor_control_block_t& block : waiters) {
    if (unused == nullptr && block.owner == freeBlockOwner()) unused = &block;
    if (block.satisfied != 0 && (oldest_satisfied == nullptr || block.sequence <= oldest_satisfied->sequence)) {
      oldest_satisfied = &block;
    }
    if (oldest == nullptr || block.sequence <= oldest->sequence) oldest = &block;
  }
  waitfor_control_block_t* block = own != nullptr                ? own
                                   : unused != nullptr           ? unused
                                   : oldest_satisfied != nullptr ? oldest_satisfied
                                                                 : oldest;
  block->clean();
  block->sequence = seq;
  block->owner = tid;
  block->protocol_type = prot;
  return block;
}

void GSxClientData::ApplyNotificationToWaiters(GSClientType obj_type, int where, int for_my_req,
                                               wyx_notification_summary_t* sum) {
  GS_TRACE(GSCL_TRC_DETAIL, "ApplyNotify(seq=%d)\n", static_cast<int>(last_seq_for_my_own));
  for (waitfor_control_block_t& block : waiters) {
    if (block.owner == freeBlockOwner() || block.satisfied != 0) continue;
    block.PassNotificationToWaiter(obj_type, where, for_my_req, sum);
  }
}

GSWaitForRC GSxClientData::await(const waitfor_control_block_t& block, GSClient& client, int where_what,
                                 const timespec* abstime, const gscl_internal::CancellationHold& hold) {
  const auto evaluate = [&] {
    const GSWaitForRC match = block.isAlreadySatisfied(client.type(), where_what);
    const bool hopeless = match == kNotYet && client.getClientState() == zelt_gscl::GS_IAM_IDLE;
    return hopeless ? zelt_gscl::GS_WAITFOR_NOT_A_MEMBER : match;
  };
  GSWaitForRC result = evaluate();
  while (result == kNotYet) {
    const int error = [&] {
      const gscl_internal::CancellationHold::Lifted lifted(hold);
      return _wait_cond.wait(&_wait_mutex, abstime);
    }();
    result = evaluate();
    if (result == kNotYet && error != 0) return waitError(error);
  }
  return result;
}

int GSClient::startProtocolRequested(wyx_request_t req_type) {
  GSxClientData& data = dataOf(_clData);
  {
    MutexScope lock(data._wait_mutex);
    const unsigned int seq = global_sequence.fetch_add(1, std::memory_order_relaxed) + 1;
    data.last_seq_for_my_own = seq;
    data.add_wfc(pthread_self(), req_type, seq);
  }
  GS_TRACE(GSCL_TRC_DETAIL, "startProtocolRequested(%s) type=%s\n", GSCL_ID(this),
           gscl_request_type_name(req_type));
  return 0;
}

int GSClient::setVoteIsSubmitted() {
  GS_TRACE(GSCL_TRC_DETAIL, "setVoteIsSubmitted(%s)\n", GSCL_ID(this));
  return 0;
}

int GSClient::setNotificationReceived(GSWaitForTriggerType where, void* notify, int for_my_req) {
  gscl_internal::CancellationHold hold;
  GSTransaction transaction(this);
  const GSClientType kind = type();
  // Every notification of a subscriber answers its subscription.
  if (kind == zelt_gscl::GS_SUBSCRIBER) for_my_req = 1;
  if (for_my_req == 0) {
    GS_TRACE(GSCL_TRC_DETAIL, "setNotify for_my_req=0 ...set tid_for_my_own to NULL\n");
    GS_TRACE(GSCL_TRC_DETAIL, "setNotify for_my_req=0 but no-any-callbacks\n");
  } else if ((where & zelt_gscl::GS_TRIGGER_AFTER_CALLBACK) == 0) {
    GS_TRACE(GSCL_TRC_DETAIL, "setNotify where=%x for_my_req=1 NOT-AFTER...\n", static_cast<unsigned int>(where));
  } else {
    wyx_notification_summary_t sum = summarize(notify);
    GS_TRACE(GSCL_TRC_DETAIL, "setNotify(%s, where=%x,what=%s,type=%s) IS_MYREQ=%d\n", GSCL_ID(this),
             static_cast<unsigned int>(where), gscl_notification_type_name(sum.gs_notification_type),
             gscl_request_type_name(sum.gs_protocol_type), for_my_req);
    GSxClientData& data = dataOf(_clData);
    MutexScope lock(data._wait_mutex);
    data.ApplyNotificationToWaiters(kind, where, for_my_req, &sum);
    data._wait_cond.broadcast();
  }
  transaction.end();
  return 0;
}

GSWaitForRC GSClient::waitForNotification(GSWaitForTriggerType where_what_inp, const timespec* abstime,
                                          wyx_notification_type_t* notify_type,
                                          wyx_notification_summary_t* notify_summary) {
  int ww = where_what_inp;
  if ((ww & zelt_gscl::GS_RESPOND_TO_ANY_CALLBACKS) != 0) {
    ww &= ~zelt_gscl::GS_RESPOND_TO_ONLY_REQUESTED;
  } else {
    ww |= zelt_gscl::GS_RESPOND_TO_ONLY_REQUESTED;
  }
  if ((ww & (zelt_gscl::GS_RESPOND_TO_ANY_CALLBACKS | zelt_gscl::GS_TRIGGER_BEFORE_CALLBACK)) != 0) {
    GS_TRACE(GSCL_TRC_API, "waitFor where_what=%x not supported\n", static_cast<unsigned int>(ww));
    return zelt_gscl::GS_WAITFOR_NOT_SUPPORTED;
  }

  // But for the sleep itself: a notification that is no longer recorded is one that the caller has been told of.
  const gscl_internal::CancellationHold hold;
  GSxClientData& data = dataOf(_clData);
  wyx_notification_summary_t seen = {};
  seen.gs_notification_type = kNoNotification;
  GSWaitForRC result = zelt_gscl::GS_WAITFOR_ERROR;
  {
    // A cancelled wait unwinds through here with the mutex held.
    MutexScope lock(data._wait_mutex);
    waitfor_control_block_t* block = data.find_wfc(pthread_self());
    if (block != nullptr) {
      result = data.await(*block, *this, ww, abstime, hold);
      seen = block->summary;
    }
    if (result == zelt_gscl::GS_WAITFOR_RECEIVED) {
      reportReceived(*block, ww, notify_type, notify_summary);
    } else {
      reportNothing(notify_type, notify_summary);
    }
  }
  if (result == zelt_gscl::GS_WAITFOR_RECEIVED) {
    GS_TRACE(GSCL_TRC_DETAIL, "GSClient::waitFor(%s) where=%x, notify=%s sumCode=%s _SATISFIED\n", GSCL_ID(this),
             static_cast<unsigned int>(ww), gscl_notification_type_name(seen.gs_notification_type),
             zelt_gscl::gscl_summary_code_names(seen.gs_summary_code));
  } else {
    GS_TRACE(GSCL_TRC_DETAIL, "GSClient::waitFor(%s) where=%x, notify=%s is not matched..so wait again\n",
             GSCL_ID(this), static_cast<unsigned int>(ww), gscl_notification_type_name(seen.gs_notification_type));
  }
  return result;
}

}  // namespace zelt_gscl_V1
