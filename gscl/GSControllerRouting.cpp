// The way of a notification to its client.
//
// Each routing function finds and pins the client, brings it up to date, and delivers. A trace line names the
// client as it stands at that step; after the callback the client may be gone, and then nothing is said of it.
#include "gscl/GSClientData_internal.h"
#include "gscl/GSController.h"
#include "gscl/GSDelivery_internal.h"
#include "gscl/GSProvider.h"
#include "gscl/GSSubscriber.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace_text_internal.h"

namespace {

void traceNoController(const char* function) {
  GS_TRACE(GSCL_TRC_WARNING, "%s dropped: no controller\n", function);
}

}  // namespace

wyx_callback_rc_t stub_responsivenessCb(const wyx_responsiveness_notification_t* notification) {
  if (auto* controller = zelt_gscl_V1::GSController::theController()) {
    return controller->responsivenessCb(notification);
  }
  traceNoController("stub_responsivenessCb");
  return WYX_CALLBACK_OK;
}

void stub_queryCb(const wyx_query_notification_t* notification) {
  if (auto* controller = zelt_gscl_V1::GSController::theController()) return controller->queryCb(notification);
  traceNoController("stub_queryCb");
}

namespace zelt_gscl_V1 {

using zelt_gscl::GS_IAM_IDLE;
using zelt_gscl::GS_IAM_JOINED;
using zelt_gscl::GS_IAM_JOINING;
using zelt_gscl::GS_IAM_SUBSCRIBED;
using zelt_gscl::GS_IAM_SUBSCRIBING;

namespace {

bool has(int flags, int flag) { return (flags & flag) != 0; }

bool proposedBy(GSProvider* provider, const wyx_proposal_t* proposal) {
  return proposal->gs_proposed_by == provider->getId();
}

/// Whether a protocol notification answers the provider's own request. A joiner has no id yet that the proposer
/// could be compared with; its state tells.
int isOwnRequest(GSProvider* provider, wyx_request_t protocol, const wyx_proposal_t* proposal) {
  if (protocol == WYX_JOIN) return provider->getClientState() == GS_IAM_JOINING ? 1 : 0;
  return proposedBy(provider, proposal) ? 1 : 0;
}

}  // namespace

void GSDelivery::updateStateValues(GSProvider* provider, const wyx_proposal_t* proposal) {
  gscl_internal::WriteScope<GSClient> lock(*provider);
  auto* data = static_cast<GSxClientData*>(provider->_clData);
  data->_currentStateValue = proposal->gs_current_state_value;
  data->_proposedStateValue = proposal->gs_proposed_state_value;
}

int GSDelivery::joinApproved(GSProvider* provider, const wyx_proposal_t* proposal, int for_my_req) {
  if (provider->getClientState() == GS_IAM_JOINING) {
    provider->setId(proposal->gs_proposed_by);
    provider->setClientState(GS_IAM_JOINED);
    return 1;
  }
  if (provider->getClientState() == GS_IAM_JOINED) {
    GS_TRACE(GSCL_TRC_API, "GSController::stub_approvedCb(%s)- I was already joined.. ID=[%d/%d]. my_req=%d\n",
             GSCL_ID(provider), provider->getId()._gs_provider_info._gs_instance_number,
             provider->getId()._gs_provider_info._gs_node_number, for_my_req);
  }
  return for_my_req;
}

void GSDelivery::updateMembership(GSSubscriber* subscriber, const wyx_subscription_notification_t* notification) {
  const wyx_subscription_type_t what = notification->gs_subscription_type;
  if (has(what, WYX_SUBSCRIPTION_MEMBERSHIP)) {
    GS_TRACE(GSCL_TRC_API, "%s received FULL_MBRSHIP.\n", GSCL_ID(subscriber));
    subscriber->setMembers(notification->gs_full_membership);
  } else if (has(what, WYX_SUBSCRIPTION_DELTA_JOIN)) {
    GS_TRACE(GSCL_TRC_API, "%s received DELTA_JOINS.\n", GSCL_ID(subscriber));
    subscriber->plusMembers(notification->gs_changing_membership);
  } else if (has(what, WYX_SUBSCRIPTION_DELTA_LEAVE)) {
    GS_TRACE(GSCL_TRC_API, "%s received DELTA_LEAVES.\n", GSCL_ID(subscriber));
    subscriber->minusMembers(notification->gs_changing_membership);
  } else {
    GS_TRACE(GSCL_TRC_API, "WHATELSE=%x\n", static_cast<unsigned int>(what));
  }
}

void GSController::stub_nPhaseCb(const wyx_n_phase_notification_t* notification) {
  GSDelivery delivery(notification->gs_provider_token);
  if (!delivery.hasController()) return traceNoController("stub_nPhaseCb");
  GSProvider* provider = delivery.provider();
  if (provider == nullptr) {
    GS_TRACE(GSCL_TRC_WARNING, "stub_nPhaseCb token %d not found\n", notification->gs_provider_token);
    return;
  }
  const wyx_request_t protocol = notification->gs_protocol_type;
  const wyx_proposal_t* proposal = notification->gs_proposal;
  int for_my_req = isOwnRequest(provider, protocol, proposal);
  if (protocol == WYX_LEAVE && proposedBy(provider, proposal)) {
    for_my_req = 1;
    provider->setClientState(GS_IAM_IDLE);
  }
  if (protocol == WYX_FAILURE_LEAVE) for_my_req = 0;
  if (protocol == WYX_JOIN && provider->getClientState() == GS_IAM_JOINING) {
    for_my_req = 1;
    provider->setCurrentStateValue(proposal->gs_current_state_value);
  }
  GS_TRACE(GSCL_TRC_API, "GSController::stub_nPhaseCb(%s) protocol=%s token=%d, sumCode=%s, notification=%s\n",
           GSCL_ID(provider), gscl_request_type_name(protocol), notification->gs_provider_token,
           gscl_summary_code_names(notification->gs_summary_code),
           gscl_notification_type_name(notification->gs_notification_type));
  if (proposal->gs_phase_info.gs_num_phases == 1 || proposal->gs_phase_info.gs_phase_number == 1) {
    provider->setProposedStateValue(nullptr);
  }
  if (has(proposal->gs_whats_changed, WYX_PROPOSED_STATE_VALUE)) {
    provider->setProposedStateValue(proposal->gs_proposed_state_value);
  }
  delivery.deliver(notification, for_my_req, [&] { provider->nPhaseCb(notification); });
}

void GSController::stub_approvedCb(const wyx_approved_notification_t* notification) {
  GSDelivery delivery(notification->gs_provider_token);
  if (!delivery.hasController()) return traceNoController("stub_approvedCb");
  GSProvider* provider = delivery.provider();
  if (provider == nullptr) {
    GS_TRACE(GSCL_TRC_WARNING, "stub_approvedCb provider_token=%d not found\n", notification->gs_provider_token);
    return;
  }
  const wyx_request_t protocol = notification->gs_protocol_type;
  const wyx_proposal_t* proposal = notification->gs_proposal;
  GS_TRACE(GSCL_TRC_API, "GSController::stub_approvedCb(%s) for prot=%s  sumCode=%s, whats_changed=0x%x\n",
           GSCL_ID(provider), gscl_request_type_name(protocol),
           gscl_summary_code_names(notification->gs_summary_code),
           static_cast<unsigned int>(proposal->gs_whats_changed));
  int for_my_req = isOwnRequest(provider, protocol, proposal);
  if (protocol == WYX_JOIN) {
    for_my_req = GSDelivery::joinApproved(provider, proposal, for_my_req);
  } else if (protocol == WYX_LEAVE && proposedBy(provider, proposal)) {
    provider->setClientState(GS_IAM_IDLE);
  } else if (protocol == WYX_FAILURE_LEAVE) {
    for_my_req = 0;
  }
  if (has(proposal->gs_whats_changed, WYX_UPDATED_MEMBERSHIP)) {
    GS_TRACE(GSCL_TRC_API, "GSController::stub_approved: set new members\n");
    provider->setMembers(proposal->gs_current_providers);
  }
  GSDelivery::updateStateValues(provider, proposal);
  const bool alive = delivery.deliver(notification, for_my_req, [&] {
    GS_TRACE(GSCL_TRC_DETAIL, "calling approvedCb()\n");
    provider->approvedCb(notification);
    GS_TRACE(GSCL_TRC_DETAIL, "returned from approvedCb()\n");
  });
  if (!alive) return;
  // A thread that waited for this notification has gone on and may be destroying the provider.
  GS_TRACE(GSCL_TRC_API, "GSController::stub_approvedCb(%s) done\n",
           gscl_internal::text(gscl_internal::providerTraceId(provider)));
}

void GSController::stub_rejectedCb(const wyx_rejected_notification_t* notification) {
  GSDelivery delivery(notification->gs_provider_token);
  if (!delivery.hasController()) return traceNoController("stub_rejectedCb");
  GSProvider* provider = delivery.provider();
  if (provider == nullptr) {
    GS_TRACE(GSCL_TRC_WARNING, "stub_rejectedCb provider_token=%d not found\n", notification->gs_provider_token);
    return;
  }
  const wyx_request_t protocol = notification->gs_protocol_type;
  const wyx_proposal_t* proposal = notification->gs_proposal;
  GS_TRACE(GSCL_TRC_API, "GSController::stub_rejectCb(%s) protocol=%s sumCode=%s, myId=%d provider_token=%d\n",
           GSCL_ID(provider), gscl_request_type_name(protocol),
           gscl_summary_code_names(notification->gs_summary_code), provider->getId().gs_provider_id,
           notification->gs_provider_token);
  int for_my_req = protocol == WYX_FAILURE_LEAVE ? 0 : isOwnRequest(provider, protocol, proposal);
  if (protocol == WYX_JOIN && provider->getClientState() == GS_IAM_JOINING) {
    for_my_req = 1;
    provider->setClientState(GS_IAM_IDLE);
  } else if (protocol == WYX_LEAVE && proposedBy(provider, proposal)) {
    provider->setClientState(GS_IAM_IDLE);
  }
  GSDelivery::updateStateValues(provider, proposal);
  delivery.deliver(notification, for_my_req, [&] { provider->rejectedCb(notification); });
}

void GSController::stub_announcementCb(const wyx_announcement_notification_t* notification) {
  GSDelivery delivery(notification->gs_provider_token);
  if (!delivery.hasController()) return traceNoController("stub_announcementCb");
  GSProvider* provider = delivery.provider();
  if (provider == nullptr) {
    GS_TRACE(GSCL_TRC_WARNING, "stub_announcementCb provider_token=%d not found\n",
             notification->gs_provider_token);
    return;
  }
  const wyx_summary_code_t summary = notification->gs_summary_code;
  GS_TRACE(GSCL_TRC_API, "GSController::stub_announceCb(%s) summary=%s\n", GSCL_ID(provider),
           gscl_summary_code_names(summary));
  // Compared whole: combined with anything else it is an ordinary announcement.
  const bool ended = summary == WYX_GROUP_DISSOLVED || summary == WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY;
  if (ended) {
    provider->setClientState(GS_IAM_IDLE);
    provider->eraseMembers();
    provider->setToken(-1);
  }
  delivery.deliver(notification, ended ? 1 : 0, [&] { provider->announcementCb(notification); });
}

void GSController::stub_mergeCb(const wyx_merge_notification_t* notification) {
  GSDelivery delivery(notification->gs_provider_token);
  if (!delivery.hasController()) return traceNoController("stub_mergeCb");
  if (GSProvider* provider = delivery.provider()) provider->mergeCb(notification);
}

void GSController::stub_subscribeCb(const wyx_subscription_notification_t* notification) {
  GSDelivery delivery(notification->gs_subscriber_token);
  if (!delivery.hasController()) return traceNoController("stub_subscribeCb");
  GSSubscriber* subscriber = delivery.subscriber();
  if (subscriber == nullptr) {
    GS_TRACE(GSCL_TRC_WARNING, "Subscriber %d is not found...ERROR\n", notification->gs_subscriber_token);
    return;
  }
  const wyx_subscription_type_t what = notification->gs_subscription_type;
  int for_my_req = 0;
  if (has(what, WYX_SUBSCRIPTION_DISSOLVED | WYX_SUBSCRIPTION_GS_HAS_DIED)) {
    for_my_req = 1;
    GS_TRACE(GSCL_TRC_API, "%s is dissolved.\n", GSCL_ID(subscriber));
    subscriber->setClientState(GS_IAM_IDLE);
    subscriber->eraseMembers();
  } else if (subscriber->getClientState() == GS_IAM_SUBSCRIBING) {
    for_my_req = 1;
    subscriber->setClientState(GS_IAM_SUBSCRIBED);
    GS_TRACE(GSCL_TRC_API, "%s is now subscribed.\n", GSCL_ID(subscriber));
  } else if (subscriber->getClientState() == GS_IAM_IDLE) {
    GS_TRACE(GSCL_TRC_WARNING, "%s is currently idle but got subscribeCb\n", GSCL_ID(subscriber));
  }
  if (subscriber->getClientState() == GS_IAM_SUBSCRIBED) GSDelivery::updateMembership(subscriber, notification);
  if (has(what, WYX_SUBSCRIPTION_STATE)) subscriber->setCurrentStateValue(notification->gs_state_value);
  delivery.deliver(notification, for_my_req, [&] { subscriber->subscribeCb(notification); });
}

void GSController::stub_delayedErrorCb(const wyx_delayed_error_notification_t* notification) {
  GSDelivery delivery(notification->gs_request_token);
  if (!delivery.hasController()) return traceNoController("stub_delayedErrorCb");
  const wyx_request_t protocol = notification->gs_protocol_type;
  GSClient* client = delivery.client();
  if (client == nullptr) {
    GS_TRACE(GSCL_TRC_WARNING,
             "GSController::stub_delayedErrCb - unable to find a client(token=%d) for protocol=%s\n",
             notification->gs_request_token, gscl_request_type_name(protocol));
    return;
  }
  GS_TRACE(GSCL_TRC_API, "GSController::stub_delayedErrorCb(%s) protocol=%s token=%d, delayRc=%s\n",
           GSCL_ID(client), gscl_request_type_name(protocol), notification->gs_request_token,
           gscl_rc_name(notification->gs_delayed_return_code));
  if (protocol == WYX_JOIN || protocol == WYX_SUBSCRIPTION) client->setClientState(GS_IAM_IDLE);
  delivery.deliver(notification, 1, [&] { client->delayedErrorCb(notification); });
}

}  // namespace zelt_gscl_V1
