#include "gscl/GSProvider.h"

#include <stdio.h>

#include <atomic>
#include <cstddef>
#include <memory>

#include "gscl/GSController.h"
#include "gscl/GSDelivery_internal.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace_text_internal.h"

namespace zelt_gscl_V1 {

using ReadScope = gscl_internal::ReadScope<GSProvider>;
using WriteScope = gscl_internal::WriteScope<GSProvider>;

namespace {

/// Instance number and id are read without a lock. The client lock guards the attributes; the local name never
/// changes after construction.
struct GSxProviderData {
  std::atomic<short> _inst_number{0};
  std::atomic<wyx_provider_t> _myId{wyx_provider_t{{-1, -1}}};
  GSGroupAttributes _attributes;
  GSString _local_name;
};

static_assert(sizeof(GSProvider) == 32, "client, private record");
static_assert(sizeof(std::atomic<wyx_provider_t>) == 4 && std::atomic<wyx_provider_t>::is_always_lock_free, "");
static_assert(offsetof(GSxProviderData, _myId) == 4, "");
static_assert(offsetof(GSxProviderData, _attributes) == 8, "");
static_assert(offsetof(GSxProviderData, _local_name) == 8 + sizeof(GSGroupAttributes), "");

GSxProviderData& dataOf(void* data) { return *static_cast<GSxProviderData*>(data); }

/// "<group>_<instance>", whatever the length of the group's name.
GSString defaultLocalName(const char* gname, short instance) {
  char number[8];
  snprintf(number, sizeof number, "_%d", instance);
  GSString name(gname == nullptr ? "" : gname);
  name += number;
  return name;
}

}  // namespace

GSProvider::GSProvider(const char* gname, short instance, const char* locname)
    : GSClient(gname), _provData(nullptr) {
  auto data = std::make_unique<GSxProviderData>();
  _provData = data.get();
  data->_inst_number.store(instance, std::memory_order_relaxed);
  data->_local_name = locname;
  setDefaultAttributes(gname);
  if (locname == nullptr) data->_local_name = defaultLocalName(gname, instance);
  GS_TRACE(GSCL_TRC_API, "%s created\n", GSCL_ID(this));
  data.release();
}

GSProvider::~GSProvider() {
  gscl_internal::CancellationHold hold;
  GS_TRACE(GSCL_TRC_API, "%s destroyed\n", GSCL_ID(this));
  if (getClientState() == zelt_gscl::GS_IAM_JOINED) {
    GS_TRACE(GSCL_TRC_WARNING, "The provider(%s) is being deleted before leaving the group.\n", GSCL_ID(this));
  }
  GSDelivery::retire(this);
  delete &dataOf(_provData);
}

GSClientType GSProvider::type() { return zelt_gscl::GS_PROVIDER; }

void GSProvider::nPhaseCb(const wyx_n_phase_notification_t* notification) {
  GS_TRACE(GSCL_TRC_API, "nPhaseCb(%s) for %s\n", GSCL_ID(this),
           gscl_request_type_name(notification->gs_protocol_type));
}

void GSProvider::approvedCb(const wyx_approved_notification_t* notification) {
  const wyx_request_t protocol = notification->gs_protocol_type;
  GS_TRACE(GSCL_TRC_API, "approvedCb(%s) for %s by [%d.%d]\n", GSCL_ID(this), gscl_request_type_name(protocol),
           notification->gs_proposal->gs_proposed_by._gs_provider_info._gs_node_number,
           notification->gs_proposal->gs_proposed_by._gs_provider_info._gs_instance_number);
  if (protocol == WYX_JOIN && getOldClientState() == zelt_gscl::GS_IAM_JOINING &&
      getClientState() == zelt_gscl::GS_IAM_JOINED) {
    GS_TRACE(GSCL_TRC_API, "My Join(%s) is approved\n", GSCL_ID(this));
  } else if (protocol == WYX_FAILURE_LEAVE) {
    GS_TRACE(GSCL_TRC_API, "%s Failure approved.\n", GSCL_ID(this));
  }
}

void GSProvider::rejectedCb(const wyx_rejected_notification_t* notification) {
  const wyx_request_t protocol = notification->gs_protocol_type;
  GS_TRACE(GSCL_TRC_API, "rejectedCb(%s) for %s\n", GSCL_ID(this), gscl_request_type_name(protocol));
  if (protocol == WYX_JOIN && getOldClientState() == zelt_gscl::GS_IAM_JOINING &&
      getClientState() == zelt_gscl::GS_IAM_IDLE) {
    GS_TRACE(GSCL_TRC_API, "My join(%s) is rejected.\n", GSCL_ID(this));
  } else if (protocol == WYX_FAILURE_LEAVE) {
    GS_TRACE(GSCL_TRC_API, "%s Failure rejected.\n", GSCL_ID(this));
  }
}

void GSProvider::announcementCb(const wyx_announcement_notification_t* notification) {
  GS_TRACE(GSCL_TRC_API, "announcementCb(%s) %s\n", GSCL_ID(this),
           gscl_summary_code_names(notification->gs_summary_code));
}

void GSProvider::mergeCb(const wyx_merge_notification_t*) {
  GS_TRACE(GSCL_TRC_API, "mergeCb(%s)\n", GSCL_ID(this));
}

wyx_provider_t GSProvider::getId() { return dataOf(_provData)._myId.load(std::memory_order_relaxed); }

void GSProvider::setId(const wyx_provider_t& id) {
  WriteScope lock(*this);
  dataOf(_provData)._myId.store(id, std::memory_order_relaxed);
}

short GSProvider::getInstanceNumber() { return dataOf(_provData)._inst_number.load(std::memory_order_relaxed); }

void GSProvider::setInstanceNumber(short instance) {
  dataOf(_provData)._inst_number.store(instance, std::memory_order_relaxed);
}

const char* GSProvider::getLocalName() { return dataOf(_provData)._local_name; }

void GSProvider::setDefaultAttributes(const char* gname) {
  GSGroupAttributes defaults;
  defaults.setGroupName(gname);
  WriteScope lock(*this);
  dataOf(_provData)._attributes.setAttributes(defaults.getAttributes());
}

void GSProvider::setGroupAttributes(const wyx_group_attributes_t* attributes) {
  if (attributes == nullptr) return;
  WriteScope lock(*this);
  dataOf(_provData)._attributes.setAttributes(attributes);
}

void GSProvider::getGroupAttributes(wyx_group_attributes_t* attributes) {
  if (attributes == nullptr) return;
  ReadScope lock(*this);
  *attributes = *dataOf(_provData)._attributes.getAttributes();
}

}  // namespace zelt_gscl_V1
