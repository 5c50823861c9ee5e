// What providers and subscribers have in common: name, token, state, membership, state values, waiting.
//
// Used in: examples/member.cpp, examples/watcher.cpp.
#ifndef GSCL_GSCLIENT_H
#define GSCL_GSCLIENT_H

#include <time.h>

#include "gscl/GSObject.h"
#include "gscl/GSTypes.h"
#include "gscl/GSValues.h"
#include "gscl/export.h"
#include "gscl/wyx_api.h"

namespace zelt_gscl_V1 {

class GSController;
class GSDelivery;
class GSRequest;
class GSTransaction;

/// Base of GSProvider and GSSubscriber. Holds its own copies of the group's membership and state values, which the
/// controller brings up to date with every notification before it calls the client's callback.
///
/// State machine (GSProvider, GSSubscriber; the controller makes every move):
///
///   state          | event                                               | next state
///   any            | join accepted (WYX_OK)                              | GS_IAM_JOINING
///   any            | join or subscribe refused                           | GS_IAM_IDLE
///   JOINING        | own join approved / rejected                        | GS_IAM_JOINED / GS_IAM_IDLE
///   any (provider) | own leave: approved, rejected or any phase of it    | GS_IAM_IDLE
///   any (provider) | announcement: group dissolved, or the daemon died   | GS_IAM_IDLE, token -1, no members
///   JOINED/JOINING | goodbye: WYX_OK or WYX_BAD_MEMBER_TOKEN             | GS_IAM_IDLE, token -1, no members
///   any            | subscribe accepted (WYX_OK)                         | GS_IAM_SUBSCRIBING
///   SUBSCRIBING    | a notification that does not end the subscription   | GS_IAM_SUBSCRIBED
///   any (subscr.)  | subscription dissolved, or the daemon died          | GS_IAM_IDLE, no members
///   SUBSCRIB*      | unsubscribe accepted (WYX_OK)                       | GS_IAM_IDLE, token -1
///   any            | delayed error of a join or a subscription           | GS_IAM_IDLE
///
/// An idle client receives no notifications.
///
/// Threads: requests, getters and waits may be called from any thread. Callbacks run on the thread that calls
/// dispatch(), with no lock held; they may issue requests and destroy clients, their own included, but must not
/// wait on their own client, nor for a thread that destroys it: that one waits until the callback is over. Lock
/// order within a client: transaction lock, client lock, wait mutex; the controller's lock comes before all of
/// them.
///
/// Lifetime: the application owns its clients. The destructor takes the client out of the registry and then waits
/// until no other thread delivers a notification to it, so that the library never touches a client that is gone.
/// A GSProvider or GSSubscriber itself may thus be destroyed at any time. The parts of a derived class are gone
/// before that wait, though: destroy a client of a class of your own
/// - on the dispatching thread, from a callback, its own too, or between two calls of dispatch(); or
/// - when waitForNotification has returned GS_WAITFOR_RECEIVED for the client's last notification, with no further
///   one on its way; or
/// - otherwise ordered after its last callback.
/// To be idle is not enough: an approved leave makes the client idle before its callback. No thread may be inside
/// any other operation of a client that is destroyed, and callbacks on two threads must not destroy each other's
/// client.
///
/// Cancellation: waitForNotification is a cancellation point; requests and destructors are not.
class ZN_GSCL_EXPORT GSClient : public GSLockableObject {
 public:
  /// Names the group (see setGroupName) and registers with the current controller; without one the client will
  /// never receive a notification.
  explicit GSClient(const char* gname);
  virtual ~GSClient();

  GSClient(const GSClient&) = delete;
  GSClient& operator=(const GSClient&) = delete;

  /// GS_PROVIDER or GS_SUBSCRIBER.
  virtual GSClientType type() = 0;

  /// A request that was answered WYX_OK has failed after all. Does nothing here. For a join or a subscription the
  /// client is idle again. The record lives only during the call.
  virtual void delayedErrorCb(const wyx_delayed_error_notification_t* notification);

  GSClientState getClientState() const;  ///< no lock
  /// Before the last move, which may have been to the same state; no lock.
  GSClientState getOldClientState() const;
  wyx_token_t getToken() const;  ///< -1: none; no lock

  /// Stores at most the first 32 characters: longer names that begin alike become one group. Null: no name. Write
  /// lock. Not while another thread uses the name.
  void setGroupName(const char* gname);
  /// The client's own copy, valid until the name is set again; null without a name. No lock.
  const char* getGroupName() const;

  // Under the read lock; 1: the client is not idle and the answer is given, 0: it is not.

  int getMembers(GSMembershipList& out);         ///< `out` stays as it was on 0
  int getMemberCount();                          ///< the count itself; 0 when idle
  int getMemberAt(int idx, wyx_provider_t* id);  ///< also 0 for an index out of range or a null `id`
  int getCurrentStateValue(GSStateValue& out);   ///< `out` is assigned also on 0
  int getProposedStateValue(GSStateValue& out);  ///< of the protocol in progress; assigned also on 0

  /// Blocks until the notification that answers the calling thread's latest request on this client has been
  /// delivered, callback included, and says what it was. A notification that came before the call counts.
  ///
  /// `where` must be GS_TRIGGER_AFTER_CALLBACK, alone or with GS_RESPOND_TO_ONLY_REQUESTED. `abstime` is an
  /// absolute wall-clock time (GSGetAbsTime); null: no limit. The outputs may be null and are the caller's.
  ///
  /// GS_WAITFOR_RECEIVED       the outputs say what was delivered; it is not reported a second time. For a
  ///                           provider the phases of its own protocol do not count, only its end.
  /// GS_WAITFOR_PENDING        the time is over
  /// GS_WAITFOR_NOT_A_MEMBER   the client is idle and nothing was recorded
  /// GS_WAITFOR_ERROR          the calling thread has not requested anything
  /// GS_WAITFOR_NOT_SUPPORTED  another form of `where`; the outputs are not touched
  /// GS_WAITFOR_EINVAL, _EPERM, _EFAULT, _EDEADLK   the wait itself failed
  /// On any other than the first and NOT_SUPPORTED the notification and protocol types in the outputs are -1.
  ///
  /// At most four threads per client have a request recorded; the request of a fifth takes the oldest answered
  /// record away, else the oldest. The thread that had it gets GS_WAITFOR_ERROR, or, when it is asleep, waits for
  /// the other thread's notification instead of its own and may sleep on when that one takes it first: do not let
  /// more than four threads request on one client, or give every wait a time.
  ///
  /// Neither GSController::quit() nor the destruction of the controller wakes anybody or makes a client idle, and
  /// no notification of the session comes any more: a wait without limit, under way then or begun later, sleeps
  /// on, also past a new initialize(); one with a limit ends with GS_WAITFOR_PENDING. If the client is used again
  /// meanwhile, the sleeper is woken by the answer to another thread's request and reports that one as its own: do
  /// not use a client again while a thread waits on it. End the waits first (leave and wait for it), or give them
  /// a time. goodbyeGroup() and unsubscribeGroup() make the client idle and wake nobody either:
  /// GS_WAITFOR_NOT_A_MEMBER comes at the deadline or the next wake-up. A cancellation point while it sleeps.
  GSWaitForRC waitForNotification(GSWaitForTriggerType where, const timespec* abstime,
                                  wyx_notification_type_t* notify_type,
                                  wyx_notification_summary_t* notify_summary);

 private:
  friend class GSController;
  friend class GSDelivery;
  friend class GSRequest;
  friend class GSTransaction;

  // For the controller only. All take the client lock for writing but setToken.
  void setClientState(GSClientState state);
  void setToken(wyx_token_t token);
  void eraseMembers();
  void setMembers(const wyx_membership_t* members);
  void setMembers(GSMembershipList& members);
  void plusMembers(const wyx_membership_t* members);
  void minusMembers(const wyx_membership_t* members);
  void setCurrentStateValue(const wyx_state_value_t* value);
  void setProposedStateValue(const wyx_state_value_t* value);

  // The transaction lock orders a request against the bookkeeping of the notifications that answer it.
  void beginTransaction();
  void endTransaction();
  int startProtocolRequested(wyx_request_t req_type);
  int setVoteIsSubmitted();
  int setNotificationReceived(GSWaitForTriggerType where, void* notify, int for_my_req);

  void* _clData;
};

}  // namespace zelt_gscl_V1

#endif
