// What trace lines are made of besides names.
#ifndef GSCL_TRACE_TEXT_H
#define GSCL_TRACE_TEXT_H

#include <cstdint>

#include "gscl/GSString.h"
#include "gscl/GSUtils.h"
#include "gscl/trace.h"

namespace zelt_gscl_V1 {
class GSProvider;
}

namespace gscl_internal {

/// An address as "%x" prints it: its low 32 bits.
inline unsigned int addressText(const void* address) {
  return static_cast<unsigned int>(reinterpret_cast<std::uintptr_t>(address));
}

/// The text of a string that lives until the end of the expression.
inline const char* text(const zelt_gscl_V1::GSString& string) { return string; }

/// A provider's trace identity without a virtual call, for a provider that may be in destruction on another
/// thread.
zelt_gscl_V1::GSString providerTraceId(zelt_gscl_V1::GSProvider* provider);

/// The client's trace identity as it stands now, for use as an argument of a trace line.
#define GSCL_ID(client) gscl_internal::text(zelt_gscl_V1::getTraceIdStr(client))

}  // namespace gscl_internal

#endif
