// An observer of a group.
//
// Used in: examples/watcher.cpp.
#ifndef GSCL_GSSUBSCRIBER_H
#define GSCL_GSSUBSCRIBER_H

#include "gscl/GSClient.h"

namespace zelt_gscl_V1 {

/// Watches a group's membership and state value without joining it. Derive from it and override subscribeCb; here
/// it only writes a trace line.
///
/// States, threads, lifetime: see GSClient. Idle until subscribeGroup() is accepted, subscribed from the first
/// notification on, idle again after unsubscribeGroup() or when the group or the daemon ends; it may then
/// subscribe again. The getters of GSClient give the membership and the current state value as of the last
/// notification.
class ZN_GSCL_EXPORT GSSubscriber : public GSClient {
 public:
  /// `gname` is cut at 32 characters: see setGroupName. `how` says what to be told of: flags of
  /// wyx_subscription_ctrl_t.
  GSSubscriber(const char* gname, wyx_subscription_ctrl_t how);
  /// Unsubscribes first; the result is dropped.
  virtual ~GSSubscriber();

  virtual GSClientType type();

  /// wyx_subscribe; its result. When subscribed already, unsubscribe first: a second subscription takes the place
  /// of the first, which goes on in the daemon, reaching nobody, until the session ends. Holds the controller's
  /// write lock and the client's transaction lock across the call.
  virtual wyx_rc_t subscribeGroup();
  /// wyx_unsubscribe; its result, or WYX_BAD_MEMBER_TOKEN when neither subscribing nor subscribed. Holds the
  /// client's transaction lock across the call.
  virtual wyx_rc_t unsubscribeGroup();

  /// Something that was subscribed to has changed, on the dispatching thread, no lock held. The record lives only
  /// during the call.
  virtual void subscribeCb(const wyx_subscription_notification_t* notification);

  /// For the next subscribeGroup(). No lock: the caller orders the two.
  void setSubscriptionCtrl(wyx_subscription_ctrl_t how);

 private:
  void* _subsData;
};

}  // namespace zelt_gscl_V1

#endif
