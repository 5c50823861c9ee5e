// The third version of the controller and the operations on the whole domain.
#include "gscl/GSControllerData_internal.h"
#include "gscl/base_api_internal.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace_text_internal.h"

using gscl_internal::callBaseApi;
using zelt_gscl_V1::GSxControllerData;
using Api = GSAPIRtnCollection;

// Null records are the base API's to judge; only their trace line is left out.

wyx_rc_t stub_dissolve_domain(const wyx_domain_spec_t* domain) {
  if (domain != nullptr) {
    GS_TRACE(GSCL_TRC_API, "stub_dissolve_domain node=%d\n", static_cast<int>(domain->node_number));
  }
  return callBaseApi<&Api::wyx_dissolve_domain>(domain);
}

wyx_rc_t stub_dissolve_site(const wyx_site_spec_t* site, wyx_site_dissolve_action_t action) {
  if (site != nullptr) {
    GS_TRACE(GSCL_TRC_API, "stub_dissolve_site site=%d, action=%d\n", static_cast<int>(site->site_number), action);
  }
  return callBaseApi<&Api::wyx_dissolve_site>(site, action);
}

namespace {

void traceDissolution(const wyx_subcluster_dissolution_info_t* subcluster) {
  if (subcluster->gs_subcluster_type == WYX_SUBCLUSTER_TYPE_LOCAL) {
    GS_TRACE(GSCL_TRC_API, "stub_dissolve_subcluster node=%d\n",
             static_cast<int>(subcluster->info.local_domain.node_number));
  } else {
    GS_TRACE(GSCL_TRC_API, "stub_dissolve_subcluster site=%d, action=%d\n",
             static_cast<int>(subcluster->info.site_spec.site_number), subcluster->action);
  }
}

}  // namespace

wyx_rc_t stub_dissolve_subcluster(const wyx_subcluster_dissolution_info_t* subcluster) {
  if (subcluster != nullptr) traceDissolution(subcluster);
  return callBaseApi<&Api::wyx_dissolve_subcluster>(subcluster);
}

wyx_rc_t stub_send_domain_msg_to_gsd(wyx_priv_channel_msg_type_t type, void* data, unsigned long length) {
  GS_TRACE(GSCL_TRC_API, "stub_send_domain_msg_to_gsd msg_code=%d\n", type);
  return callBaseApi<&Api::wyx_internal_send_domain_msg_to_gsd>(type, data, length);
}

wyx_rc_t stub_change_responsiveness(const wyx_responsiveness_t* responsiveness) {
  gscl_internal::CancellationHold hold;
  const wyx_rc_t rc = callBaseApi<&Api::wyx_change_responsiveness>(responsiveness);
  zelt_gscl_V1::GSController* controller = zelt_gscl_V1::GSController::theController();
  if (rc == WYX_OK && controller != nullptr && responsiveness != nullptr) {
    wyx_responsiveness_t accepted = *responsiveness;
    controller->setResponsiveness(&accepted);
  }
  GS_TRACE(GSCL_TRC_API, "GSCntl::changeResponsiveness issued. RC=%s.\n", zelt_gscl::gscl_rc_name(rc));
  return rc;
}

void stub_domain_controlCb(const wyx_domain_control_notification_t* notification) {
  GS_TRACE(GSCL_TRC_API, "stub_domain_control_cb() domain_event=%d ENTER\n", notification->domain_event_type);
  if (auto* controller = GSxControllerData::_theDomainController.load(std::memory_order_acquire)) {
    controller->domainControlCb(notification);
  } else {
    GS_TRACE(GSCL_TRC_WARNING, "stub_domain_control_cb() domain_event=%d dropped: no controller of version 3\n",
             notification->domain_event_type);
  }
  GS_TRACE(GSCL_TRC_API, "stub_domain_control_cb() domain_event=%d LEAVE\n", notification->domain_event_type);
}

namespace zelt_gscl_V3 {

static_assert(sizeof(GSController) == sizeof(zelt_gscl_V1::GSController), "later versions add no field");

GSController::GSController(unsigned int version) : zelt_gscl_V2::GSController(version) {
  GSxControllerData::_theDomainController.store(this, std::memory_order_release);
}

GSController::~GSController() = default;

GSController* GSController::theController() {
  // Only another type for the pointer: the object may be of an older version.
  return reinterpret_cast<GSController*>(zelt_gscl_V1::GSController::theController());
}

wyx_rc_t GSController::changeResponsiveness(const wyx_responsiveness_t* responsiveness) {
  return stub_change_responsiveness(responsiveness);
}

wyx_rc_t GSController::dissolveDomain(const wyx_domain_spec_t* domain) { return stub_dissolve_domain(domain); }

void GSController::domainControlCb(const wyx_domain_control_notification_t*) {}

wyx_rc_t GSController::dissolveSite(const wyx_site_spec_t* site, wyx_site_dissolve_action_t action) {
  return stub_dissolve_site(site, action);
}

wyx_rc_t GSController::dissolveSubcluster(const wyx_subcluster_dissolution_info_t* subcluster) {
  return stub_dissolve_subcluster(subcluster);
}

wyx_rc_t GSController::sendDomainMsgToGSD(wyx_priv_channel_msg_type_t type, void* data, unsigned long length) {
  return stub_send_domain_msg_to_gsd(type, data, length);
}

}  // namespace zelt_gscl_V3
