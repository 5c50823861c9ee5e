// Enumerations and the notification summary that the client classes share.
//
// Plain values: nothing here allocates, locks or depends on a controller. Every enumeration has int as its
// underlying type, because codes that this library does not know are passed through unchanged.
// Printable names: GSUtils.h.
#ifndef GSCL_GSTYPES_H
#define GSCL_GSTYPES_H

#include "gscl/wyx_api.h"

namespace zelt_gscl {

/// The kind of a client object.
enum GSClientType : int { GS_PROVIDER = 1, GS_SUBSCRIBER = 2 };

/// Where a client stands with its group.
enum GSClientState : int {
  GS_IAM_IDLE = 0,         ///< not in the group, nothing asked for
  GS_IAM_JOINING = 1,      ///< provider: the join is issued, its outcome not yet delivered
  GS_IAM_JOINED = 2,       ///< provider: a member
  GS_IAM_SUBSCRIBING = 3,  ///< subscriber: the subscription is issued, no notification delivered yet
  GS_IAM_SUBSCRIBED = 4    ///< subscriber: notifications arrive
};

/// What a wait counts as its notification: at least one of the callback points, and whose notifications.
enum GSWaitForTriggerType : int {
  GS_TRIGGER_BEFORE_CALLBACK = 0x1,
  GS_TRIGGER_AFTER_CALLBACK = 0x2,
  GS_TRIGGER_BEFORE_AFTER_CALLBACK = 0x3,
  GS_RESPOND_TO_ONLY_REQUESTED = 0x100,
  GS_RESPOND_TO_ANY_CALLBACKS = 0x200
};

/// Result of a wait.
enum GSWaitForRC : int {
  GS_WAITFOR_EFAULT = -5,
  GS_WAITFOR_EDEADLK = -4,
  GS_WAITFOR_EINVAL = -3,
  GS_WAITFOR_EPERM = -2,
  GS_WAITFOR_ERROR = -1,
  GS_WAITFOR_NOT_REQUESTED = 0,
  GS_PROTOCOL_NOT_REQUESTED = 0,
  GS_WAITFOR_PENDING = 1,
  GS_NOTIFICATION_PENDING = 1,
  GS_WAITFOR_RECEIVED = 2,
  GS_NOTIFICATION_RECEIVED = 2,
  GS_WAITFOR_NOT_A_MEMBER = 3,
  GS_WAITFOR_NOT_SUPPORTED = 99
};

}  // namespace zelt_gscl

namespace zelt_gscl_V1 {

typedef zelt_gscl::GSClientType GSClientType;
typedef zelt_gscl::GSClientState GSClientState;
typedef zelt_gscl::GSWaitForTriggerType GSWaitForTriggerType;
typedef zelt_gscl::GSWaitForRC GSWaitForRC;

/// What a notification said, as a wait reports it. Which fields mean something follows from the type; a type of
/// -1 says that there was no notification.
struct wyx_notification_summary_t {
  wyx_notification_type_t gs_notification_type;
  wyx_request_t gs_protocol_type;
  wyx_whats_changed_t gs_whats_changed;
  wyx_summary_code_t gs_summary_code;
  wyx_subscription_type_t gs_subscription_type;
  wyx_rc_t gs_delayed_return_code;
};

}  // namespace zelt_gscl_V1

#endif
