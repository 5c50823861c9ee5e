#include "gscl/GSDispatcher.h"

#include "gscl/base_api_internal.h"

namespace zelt_gscl_V1 {

static_assert(sizeof(GSDispatcher) == sizeof(void*), "a virtual table and nothing else");

GSDispatcher::GSDispatcher() = default;

GSDispatcher::~GSDispatcher() = default;

wyx_rc_t GSDispatcher::dispatch(wyx_dispatch_flag_t flag) {
  return gscl_internal::callBaseApi<&GSAPIRtnCollection::wyx_dispatch>(flag);
}

}  // namespace zelt_gscl_V1
