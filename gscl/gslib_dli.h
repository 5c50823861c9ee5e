// The table of base API entry points and its loader.
//
// libzn_gscl.so is never linked against the base API library. The first operation that needs it opens
// "libwyx_r.so" (the dynamic loader's search path applies), looks its 32 entry points up by name and keeps them in
// one table for the rest of the process; nothing is ever unloaded. An application normally has no need of this
// header: the classes go through the table themselves. A test may install a table of its own by pointing GSAPIRtns
// at it before the first operation.
//
// Threads: any thread may be first; one loads, the others wait. Once loaded, a call costs an acquire load and a
// test. Errors: when the library cannot be opened, "dlopen libwyx_r.so errno=N" goes to standard error and the
// process aborts. An entry point that the library lacks leaves its field null; the operations that need it return
// WYX_NOT_SUPPORTED.
//
// The classes that use the table: examples/member.cpp.
#ifndef GSCL_GSLIB_DLI_H
#define GSCL_GSLIB_DLI_H

#include <pthread.h>
#include <stdint.h>

#include "gscl/export.h"
#include "gscl/wyx_api.h"

// One pointer type for each entry point. A token is passed by value; a pointer to a constant record is read, any
// other is filled. Nothing that is passed is kept after the call returns, but what wyx_setup registers.

/// version, count of the arguments that follow, descriptor, socket control, responsiveness, deactivate script,
/// responsiveness, delayed-error and query callbacks; then, with a count of 8, the domain-control callback.
typedef wyx_rc_t (*wyx_setup_func_t)(int, int, wyx_descriptor_t*, wyx_socket_ctrl_t, const wyx_responsiveness_t*,
                                     const char*, wyx_responsiveness_cb_t*, wyx_delayed_error_cb_t*,
                                     wyx_query_cb_t*, ...);
typedef wyx_rc_t (*wyx_get_node_number_func_t)(int*);
typedef wyx_rc_t (*wyx_get_limits_func_t)(wyx_limits*);
typedef wyx_rc_t (*wyx_get_adapter_info_func_t)(wyx_adapter_info*);
typedef wyx_rc_t (*wyx_get_adapter_info_by_addr_func_t)(const wyx_ip_addr*, wyx_adapter_info*);
typedef wyx_rc_t (*wyx_get_adapter_info_by_id_func_t)(wyx_token_t, const wyx_provider_t*, wyx_adapter_info*);
typedef wyx_rc_t (*wyx_get_ipaddr_by_id_func_t)(wyx_token_t, const wyx_provider_t*, wyx_ip_addr*);
typedef wyx_rc_t (*wyx_dispatch_func_t)(wyx_dispatch_flag_t);
typedef wyx_rc_t (*wyx_join_func_t)(wyx_token_t*, const wyx_proposal_info_t*);
typedef wyx_rc_t (*wyx_change_state_value_func_t)(wyx_token_t, const wyx_proposal_info_t*);
typedef wyx_rc_t (*wyx_send_message_func_t)(wyx_token_t, const wyx_proposal_info_t*);
typedef wyx_rc_t (*wyx_leave_func_t)(wyx_token_t, const wyx_proposal_info_t*);
typedef wyx_rc_t (*wyx_expel_func_t)(wyx_token_t, const wyx_proposal_info_t*);
typedef wyx_rc_t (*wyx_change_attributes_func_t)(wyx_token_t, const wyx_proposal_info_t*);
typedef wyx_rc_t (*wyx_goodbye_func_t)(wyx_token_t);
/// token, vote, proposed state value or null, message or null, default vote.
typedef wyx_rc_t (*wyx_vote_func_t)(wyx_token_t, wyx_vote_value_t, const wyx_state_value_t*,
                                    const wyx_provider_message_t*, wyx_vote_value_t);
typedef wyx_rc_t (*wyx_quit_func_t)();
typedef wyx_rc_t (*wyx_subscribe_func_t)(wyx_token_t*, const wyx_proposal_info_t*);
typedef wyx_rc_t (*wyx_unsubscribe_func_t)(wyx_token_t);
typedef wyx_rc_t (*wyx_get_ffdc_id_func_t)(char*);
typedef wyx_rc_t (*wyx_change_responsiveness_func_t)(const wyx_responsiveness_t*);
typedef wyx_rc_t (*wyx_dissolve_domain_func_t)(const wyx_domain_spec_t*);
typedef wyx_rc_t (*wyx_dissolve_site_func_t)(const wyx_site_spec_t*, wyx_site_dissolve_action_t);
typedef wyx_rc_t (*wyx_get_zelt_active_version_func_t)(wyx_zelt_version_t*);
typedef wyx_rc_t (*wyx_get_zelt_installed_version_func_t)(wyx_zelt_version_t*);
typedef wyx_rc_t (*wyx_migrate_to_pell_prep_func_t)();
typedef wyx_rc_t (*wyx_migrate_to_pell_commit_func_t)();
typedef wyx_rc_t (*wyx_migrate_to_pell_abort_func_t)();
typedef wyx_rc_t (*wyx_migrate_vote_func_t)(wyx_migration_vote_t);
typedef wyx_rc_t (*wyx_get_domain_master_node_number_func_t)(int*);
/// type, data, length of the data in bytes.
typedef wyx_rc_t (*wyx_internal_send_domain_msg_to_gsd_func_t)(wyx_priv_channel_msg_type_t, void*, uint64_t);
typedef wyx_rc_t (*wyx_dissolve_subcluster_func_t)(const wyx_subcluster_dissolution_info_t*);

/// The entry points, each field named after the one that it holds. The order is fixed: fields are addressed by
/// position.
typedef struct GSAPIRtnCollection {
  wyx_setup_func_t wyx_setup;
  wyx_get_node_number_func_t wyx_get_node_number;
  wyx_get_limits_func_t wyx_get_limits;
  wyx_get_adapter_info_func_t wyx_get_adapter_info;
  wyx_get_adapter_info_by_addr_func_t wyx_get_adapter_info_by_addr;
  wyx_get_adapter_info_by_id_func_t wyx_get_adapter_info_by_id;
  wyx_get_ipaddr_by_id_func_t wyx_get_ipaddr_by_id;
  wyx_dispatch_func_t wyx_dispatch;
  wyx_join_func_t wyx_join;
  wyx_change_state_value_func_t wyx_change_state_value;
  wyx_send_message_func_t wyx_send_message;
  wyx_leave_func_t wyx_leave;
  wyx_expel_func_t wyx_expel;
  wyx_change_attributes_func_t wyx_change_attributes;
  wyx_goodbye_func_t wyx_goodbye;
  wyx_vote_func_t wyx_vote;
  wyx_quit_func_t wyx_quit;
  wyx_subscribe_func_t wyx_subscribe;
  wyx_unsubscribe_func_t wyx_unsubscribe;
  wyx_get_ffdc_id_func_t wyx_get_ffdc_id;
  wyx_change_responsiveness_func_t wyx_change_responsiveness;
  wyx_dissolve_domain_func_t wyx_dissolve_domain;
  wyx_dissolve_site_func_t wyx_dissolve_site;
  wyx_get_zelt_active_version_func_t wyx_get_zelt_active_version;
  wyx_get_zelt_installed_version_func_t wyx_get_zelt_installed_version;
  wyx_migrate_to_pell_prep_func_t wyx_migrate_to_pell_prep;
  wyx_migrate_to_pell_commit_func_t wyx_migrate_to_pell_commit;
  wyx_migrate_to_pell_abort_func_t wyx_migrate_to_pell_abort;
  wyx_migrate_vote_func_t wyx_migrate_vote;
  wyx_get_domain_master_node_number_func_t wyx_get_domain_master_node_number;
  wyx_internal_send_domain_msg_to_gsd_func_t wyx_internal_send_domain_msg_to_gsd;
  wyx_dissolve_subcluster_func_t wyx_dissolve_subcluster;
} GSAPIRtnCollection_t;

/// Null until every field of the table behind it is filled, then non-null for the rest of the process. Written
/// with release order; to be read with acquire order.
extern ZN_GSCL_EXPORT GSAPIRtnCollection_t* GSAPIRtns;

/// Guards the loader: Load_GSAPI_Routines runs only through pthread_once with it.
extern ZN_GSCL_EXPORT pthread_once_t GSAPIOnceInit;

/// Fills the table and sets GSAPIRtns; returns at once when GSAPIRtns is set already. Aborts the process when the
/// base API library cannot be opened.
ZN_GSCL_EXPORT void Load_GSAPI_Routines();

#endif
