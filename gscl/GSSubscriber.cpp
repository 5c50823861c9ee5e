#include "gscl/GSSubscriber.h"

#include <memory>

#include "gscl/GSController.h"
#include "gscl/GSDelivery_internal.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace_text_internal.h"

namespace zelt_gscl_V1 {

namespace {

/// Not guarded: the application orders setSubscriptionCtrl and subscribeGroup.
struct GSxSubscriberData {
  wyx_subscription_ctrl_t _subctrl;
};

static_assert(sizeof(GSSubscriber) == 32, "client, private record");
static_assert(sizeof(GSxSubscriberData) == 4, "");

GSxSubscriberData& dataOf(void* data) { return *static_cast<GSxSubscriberData*>(data); }

}  // namespace

GSSubscriber::GSSubscriber(const char* gname, wyx_subscription_ctrl_t how) : GSClient(gname), _subsData(nullptr) {
  auto data = std::make_unique<GSxSubscriberData>(GSxSubscriberData{how});
  _subsData = data.get();
  GS_TRACE(GSCL_TRC_API, "%s created\n", GSCL_ID(this));
  data.release();
}

GSSubscriber::~GSSubscriber() {
  gscl_internal::CancellationHold hold;
  GS_TRACE(GSCL_TRC_API, "%s destroyed\n", GSCL_ID(this));
  GSSubscriber::unsubscribeGroup();
  GSDelivery::retire(this);
  delete &dataOf(_subsData);
}

GSClientType GSSubscriber::type() { return zelt_gscl::GS_SUBSCRIBER; }

wyx_rc_t GSSubscriber::subscribeGroup() {
  gscl_internal::CancellationHold hold;
  wyx_proposal_info_t proposal;
  wyx_subscribe_request_t& request = proposal._gs_protocol_info._gs_subscribe_request;
  request.gs_subscription_control = dataOf(_subsData)._subctrl;
  request.gs_subscription_group = const_cast<char*>(getGroupName());
  request.gs_subscription_callback = GSController::stub_subscribeCb;
  const wyx_rc_t rc = GSController::stub_subscribe_group(this, &proposal);
  GS_TRACE(GSCL_TRC_API, "%s: subscribe sync_rc=%s\n", GSCL_ID(this), gscl_rc_name(rc));
  return rc;
}

wyx_rc_t GSSubscriber::unsubscribeGroup() {
  gscl_internal::CancellationHold hold;
  const wyx_rc_t rc = GSController::stub_unsubscribe_group(this);
  GS_TRACE(GSCL_TRC_API, "%s: unsubscribe sync_rc=%s\n", GSCL_ID(this), gscl_rc_name(rc));
  return rc;
}

void GSSubscriber::subscribeCb(const wyx_subscription_notification_t* notification) {
  GS_TRACE(GSCL_TRC_API, "subscribeCb(%s) %s\n", GSCL_ID(this),
           gscl_subscription_type_names(notification->gs_subscription_type));
}

void GSSubscriber::setSubscriptionCtrl(wyx_subscription_ctrl_t how) { dataOf(_subsData)._subctrl = how; }

}  // namespace zelt_gscl_V1
