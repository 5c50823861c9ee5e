// The queries that the base API answers without reference to any group.
#include "gscl/GSController.h"
#include "gscl/base_api_internal.h"

namespace zelt_gscl_V1 {

using gscl_internal::callBaseApi;
using Api = GSAPIRtnCollection;

wyx_rc_t GSController::getLimits(wyx_limits* limits) { return callBaseApi<&Api::wyx_get_limits>(limits); }

wyx_rc_t GSController::get_node_number(int* node) { return callBaseApi<&Api::wyx_get_node_number>(node); }

wyx_rc_t GSController::get_domain_master_node_number(int* node) {
  return callBaseApi<&Api::wyx_get_domain_master_node_number>(node);
}

wyx_rc_t GSController::get_adapter_info(wyx_adapter_info* adapter) {
  return callBaseApi<&Api::wyx_get_adapter_info>(adapter);
}

wyx_rc_t GSController::get_adapter_info_by_addr(const wyx_ip_addr* address, wyx_adapter_info* adapter) {
  return callBaseApi<&Api::wyx_get_adapter_info_by_addr>(address, adapter);
}

wyx_rc_t GSController::get_adapter_info_by_id(int provider_token, const wyx_provider_t* id,
                                              wyx_adapter_info* adapter) {
  return callBaseApi<&Api::wyx_get_adapter_info_by_id>(provider_token, id, adapter);
}

wyx_rc_t GSController::get_ipaddr_by_id(int provider_token, const wyx_provider_t* id, wyx_ip_addr* address) {
  return callBaseApi<&Api::wyx_get_ipaddr_by_id>(provider_token, id, address);
}

wyx_rc_t GSController::get_ffdc_id(char* id) { return callBaseApi<&Api::wyx_get_ffdc_id>(id); }

wyx_rc_t GSController::get_zelt_active_version(wyx_zelt_version_t* version) {
  return callBaseApi<&Api::wyx_get_zelt_active_version>(version);
}

wyx_rc_t GSController::get_zelt_installed_version(wyx_zelt_version_t* version) {
  return callBaseApi<&Api::wyx_get_zelt_installed_version>(version);
}

wyx_rc_t GSController::pell_migrate_prep() { return callBaseApi<&Api::wyx_migrate_to_pell_prep>(); }

wyx_rc_t GSController::pell_migrate_commit() { return callBaseApi<&Api::wyx_migrate_to_pell_commit>(); }

wyx_rc_t GSController::pell_migrate_abort() { return callBaseApi<&Api::wyx_migrate_to_pell_abort>(); }

wyx_rc_t GSController::pell_migrate_vote(wyx_migration_vote_t vote) {
  return callBaseApi<&Api::wyx_migrate_vote>(vote);
}

}  // namespace zelt_gscl_V1
