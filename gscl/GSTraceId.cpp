#include <stdio.h>

#include "gscl/GSProvider.h"
#include "gscl/GSString.h"
#include "gscl/GSUtils.h"
#include "gscl/trace_text_internal.h"

namespace {

constexpr int kTraceIdSize = 100;

const char* printable(const char* name) { return name == nullptr ? "(null)" : name; }

}  // namespace

namespace gscl_internal {

zelt_gscl_V1::GSString providerTraceId(zelt_gscl_V1::GSProvider* provider) {
  zelt_gscl_V1::GSString id(kTraceIdSize);
  const wyx_provider_t self = provider->getId();
  snprintf(id, kTraceIdSize, "Prov[%s,Id=%d/%d,T=%d]", printable(provider->getGroupName()),
           self._gs_provider_info._gs_instance_number, self._gs_provider_info._gs_node_number,
           provider->getToken());
  return id;
}

}  // namespace gscl_internal

namespace zelt_gscl_V1 {

GSString getTraceIdStr(GSClient* client) {
  if (client->type() == zelt_gscl::GS_PROVIDER) {
    return gscl_internal::providerTraceId(static_cast<GSProvider*>(client));
  }
  GSString id(kTraceIdSize);
  snprintf(id, kTraceIdSize, "Subs[G=%s,T=%d]", printable(client->getGroupName()), client->getToken());
  return id;
}

}  // namespace zelt_gscl_V1
