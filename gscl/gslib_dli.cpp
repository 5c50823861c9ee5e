#include "gscl/gslib_dli.h"

#include <dlfcn.h>
#include <errno.h>
#include <sched.h>
#include <stdio.h>
#include <unistd.h>

#include "gscl/base_api_internal.h"
#include "gscl/fatal_internal.h"

GSAPIRtnCollection_t* GSAPIRtns = nullptr;
pthread_once_t GSAPIOnceInit = PTHREAD_ONCE_INIT;

static_assert(sizeof(GSAPIRtnCollection_t) == 32 * sizeof(void*), "32 entry points, nothing between them");

namespace {

constexpr char kBaseApiLibrary[] = "libwyx_r.so";
constexpr useconds_t kTableWaitMicroseconds = 100;

GSAPIRtnCollection_t GSAPIRtnArea;
void* GSAPIObject = nullptr;

template <class Function>
void lookUp(Function& field, const char* name) {
  field = reinterpret_cast<Function>(dlsym(GSAPIObject, name));
}

void openBaseApiLibrary() {
  if (GSAPIObject != nullptr) return;
  GSAPIObject = dlopen(kBaseApiLibrary, RTLD_NOW);
  const int error = errno;
  if (GSAPIObject != nullptr) return;
  fprintf(stderr, "dlopen %s errno=%d\n", kBaseApiLibrary, error);
  GSCL_REQUIRE(GSAPIObject != nullptr, "GSAPIObject != __null");
}

}  // namespace

void Load_GSAPI_Routines() {
  if (gscl_internal::loadedBaseApi() != nullptr) return;
  openBaseApiLibrary();

#define GSCL_LOOK_UP(entry) lookUp(GSAPIRtnArea.entry, #entry)
  GSCL_LOOK_UP(wyx_setup);
  GSCL_LOOK_UP(wyx_get_node_number);
  GSCL_LOOK_UP(wyx_get_limits);
  GSCL_LOOK_UP(wyx_get_adapter_info);
  GSCL_LOOK_UP(wyx_get_adapter_info_by_addr);
  GSCL_LOOK_UP(wyx_get_adapter_info_by_id);
  GSCL_LOOK_UP(wyx_get_ipaddr_by_id);
  GSCL_LOOK_UP(wyx_dispatch);
  GSCL_LOOK_UP(wyx_join);
  GSCL_LOOK_UP(wyx_change_state_value);
  GSCL_LOOK_UP(wyx_send_message);
  GSCL_LOOK_UP(wyx_leave);
  GSCL_LOOK_UP(wyx_expel);
  GSCL_LOOK_UP(wyx_change_attributes);
  GSCL_LOOK_UP(wyx_goodbye);
  GSCL_LOOK_UP(wyx_vote);
  GSCL_LOOK_UP(wyx_quit);
  GSCL_LOOK_UP(wyx_subscribe);
  GSCL_LOOK_UP(wyx_unsubscribe);
  GSCL_LOOK_UP(wyx_get_ffdc_id);
  GSCL_LOOK_UP(wyx_change_responsiveness);
  GSCL_LOOK_UP(wyx_dissolve_domain);
  GSCL_LOOK_UP(wyx_dissolve_site);
  GSCL_LOOK_UP(wyx_get_zelt_active_version);
  GSCL_LOOK_UP(wyx_get_zelt_installed_version);
  GSCL_LOOK_UP(wyx_migrate_to_pell_prep);
  GSCL_LOOK_UP(wyx_migrate_to_pell_commit);
  GSCL_LOOK_UP(wyx_migrate_to_pell_abort);
  GSCL_LOOK_UP(wyx_migrate_vote);
  GSCL_LOOK_UP(wyx_get_domain_master_node_number);
  GSCL_LOOK_UP(wyx_internal_send_domain_msg_to_gsd);
  GSCL_LOOK_UP(wyx_dissolve_subcluster);
#undef GSCL_LOOK_UP

  __atomic_store_n(&GSAPIRtns, &GSAPIRtnArea, __ATOMIC_RELEASE);
}

void gscl_internal::awaitBaseApi() {
  pthread_once(&GSAPIOnceInit, Load_GSAPI_Routines);
  while (loadedBaseApi() == nullptr) {
    sched_yield();
    usleep(kTableWaitMicroseconds);
  }
}
