// The paging-space policy: Linux has none to choose, so a daemon that only tries gets on, one that insists fails.
#include "dae/dae_failure_internal.h"

int dae_set_psalloc__INTERNAL__(dae_psalloc_t ps_policy, const char*, const char**) {
  switch (ps_policy) {
    case DAE_A_DONT_CARE:
    case DAE_A_LATE_TRY:
    case DAE_A_EARLY_TRY:
      return DAE_OK;
    case DAE_A_LATE:
    case DAE_A_EARLY:
      return dae::fail(DAE_E_NOPSALLOC, "DAE_EM_NOPSALLOC");
    default:
      return dae::fail(DAE_E_AINVALID, "DAE_EM_AINVALID");
  }
}
