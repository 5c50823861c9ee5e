// One notification's way to its client, during which the client cannot go away unnoticed.
#ifndef GSCL_GSDELIVERY_H
#define GSCL_GSDELIVERY_H

#include <pthread.h>

#include "gscl/GSClient.h"

namespace zelt_gscl_V1 {

class GSController;
class GSProvider;
class GSSubscriber;

/// Finds the client of a token through the current controller and pins it until the delivery ends. Lives on the
/// dispatching thread's stack; deliveries nest when a callback dispatches.
///
/// The pin is set under the controller's read lock and a client's destructor leaves the registry under its write
/// lock before it looks for pins: so either the look-up does not find the client or the destructor sees the pin.
/// It waits for the pins of other threads; those of its own thread (the client is destroyed from within its own
/// callback) it marks as gone.
class GSDelivery {
 public:
  explicit GSDelivery(wyx_token_t token);
  ~GSDelivery();
  GSDelivery(const GSDelivery&) = delete;
  GSDelivery& operator=(const GSDelivery&) = delete;

  bool hasController() const { return controller_found_; }

  /// Null: not found, or destroyed by its callback since.
  GSClient* client() const { return client_; }
  /// Null also when the client is of the other kind.
  GSProvider* provider() const;
  GSSubscriber* subscriber() const;

  /// Reports the notification to the client's waiting threads, makes the callback, reports it again unless the
  /// client is gone. False: it is. What the callback throws goes on after that: whoever waits is told all the
  /// same.
  template <class Notification, class Callback>
  bool deliver(const Notification* notification, int for_my_req, Callback callback) {
    void* notify = const_cast<Notification*>(notification);
    client_->setNotificationReceived(zelt_gscl::GS_TRIGGER_BEFORE_CALLBACK, notify, for_my_req);
    const auto reportAfter = [&] {
      if (client_ == nullptr) return false;
      client_->setNotificationReceived(zelt_gscl::GS_TRIGGER_AFTER_CALLBACK, notify, for_my_req);
      return true;
    };
    try {
      callback();
    } catch (...) {
      reportAfter();
      throw;
    }
    return reportAfter();
  }

  /// The moves that more than one line of a routing function makes.
  ///
  /// A join was approved: when the provider was joining it is joined now, with the proposer's id as its own.
  /// Returns for_my_req as it is then.
  static int joinApproved(GSProvider* provider, const wyx_proposal_t* proposal, int for_my_req);
  /// Current and proposed state value as the proposal has them, under one hold of the client lock.
  static void updateStateValues(GSProvider* provider, const wyx_proposal_t* proposal);
  /// The subscriber's membership after a notification: full list, joins or leaves, the first that is there.
  static void updateMembership(GSSubscriber* subscriber, const wyx_subscription_notification_t* notification);

  /// Takes `client` out of the registry of whichever controller it stands in and returns when no other thread has
  /// it pinned and no delivery of this thread will touch it again. Called by destructors; takes and holds no lock
  /// while it waits.
  static void retire(GSClient* client);

 private:
  void pin();
  void unpin();
  /// Marks this thread's pins of `client` as gone; whether no other thread has it pinned.
  static bool settlePins(const GSClient* client);

  GSClient* client_ = nullptr;  // written by this thread only, under the pins' mutex; read by retire
  const pthread_t thread_ = pthread_self();
  bool controller_found_ = false;
  bool pinned_ = false;
  GSDelivery* previous_ = nullptr;
  GSDelivery* next_ = nullptr;
};

}  // namespace zelt_gscl_V1

#endif
