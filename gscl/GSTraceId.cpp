#include <stdio.h>

#include "gscl/GSProvider.h"
#include "gscl/GSString.h"
#include "gscl/GSUtils.h"

namespace zelt_gscl_V1 {

namespace {

constexpr int kTraceIdSize = 100;

const char* printable(const char* name) { return name == nullptr ? "(null)" : name; }

}  // namespace

GSString getTraceIdStr(GSClient* client) {
  GSString id(kTraceIdSize);
  char* text = id;
  if (client->type() == zelt_gscl::GS_PROVIDER) {
    const wyx_provider_t self = static_cast<GSProvider*>(client)->getId();
    snprintf(text, kTraceIdSize, "Prov[%s,Id=%d/%d,T=%d]", printable(client->getGroupName()),
             self._gs_provider_info._gs_instance_number, self._gs_provider_info._gs_node_number,
             client->getToken());
  } else {
    snprintf(text, kTraceIdSize, "Subs[G=%s,T=%d]", printable(client->getGroupName()), client->getToken());
  }
  return id;
}

}  // namespace zelt_gscl_V1
