// How the library calls the base API: wait for the table, test the entry point, call it.
#ifndef GSCL_BASE_API_CALL_H
#define GSCL_BASE_API_CALL_H

#include "gscl/gslib_dli.h"

namespace gscl_internal {

/// The table, or null when nothing has loaded it yet.
inline GSAPIRtnCollection_t* loadedBaseApi() { return __atomic_load_n(&GSAPIRtns, __ATOMIC_ACQUIRE); }

/// Loads the table if need be and returns when it is there.
void awaitBaseApi();

/// The table; waits for it to be loaded.
inline GSAPIRtnCollection_t* baseApi() {
  if (GSAPIRtnCollection_t* table = loadedBaseApi()) return table;
  awaitBaseApi();
  return loadedBaseApi();
}

/// Calls one entry point; WYX_NOT_SUPPORTED when the base API library does not have it. A wyx_dispatch that waits
/// is a cancellation point, with nothing of ours held.
template <auto Entry, class... Arguments>
wyx_rc_t callBaseApi(Arguments... arguments) {
  auto function = baseApi()->*Entry;
  return function == nullptr ? WYX_NOT_SUPPORTED : function(arguments...);
}

}  // namespace gscl_internal

#endif
