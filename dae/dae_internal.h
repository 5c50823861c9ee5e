// What the files of the daemon environment share; not installed. The functions and the two variables have C
// linkage and are exported.
#ifndef DAE_DAE_INTERNAL_H
#define DAE_DAE_INTERNAL_H

#include "dae/dae.h"
#include "kpl.h"

#ifdef __cplusplus
extern "C" {
#endif

/// Options for one kind of parent. A `_call` flag says that the setter was called.
typedef struct dae_per_parent_t {
  dae_psalloc_t ps_policy;
  const char* prog_path;
  const char** argv;
  void (*lowps_hdl)(int);
  void (*pzomb_hdl)(int);
  const char* excl_path;
  char excl_ID;
  unsigned psalloc_call : 1;
  unsigned lowps_call : 1;
  unsigned lowps_restart : 1;
  unsigned pzomb_call : 1;
  unsigned pzomb_restart : 1;
  unsigned excl_call : 1;
  unsigned keep_open_call : 1;
} dae_per_parent_t;

/// What the daemon wishes, as the option setters recorded it.
typedef struct dae_profile_t {
  dae_parent_t parent;  ///< acceptable kinds
  dae_KPL_comm_t KPL_comm;
  int sig_stop_normal;
  int sig_stop_forced;
  void (*stop_normal_hdl)(int);
  void (*stop_forced_hdl)(int);
  void (*stop_cancel_hdl)(int);  ///< SIGTERM, for every transport and parent
  int stop_restart;
  void (*stop_normal)(void);
  void (*stop_forced)(void);
  void (*trace_begin)(int);
  void (*trace_end)(void);
  void (*refresh)(void);
  void (*long_status)(void);
  int (*other_req)(short, short, short, const void*, int);
  int msqkey;
  int msqtype;
  int KPL_sockd;   ///< wanted descriptor, negative for any
  int* KPL_d_ptr;  ///< the caller's variable for the request descriptor
  int KPL_sockd_block;
  dae_per_parent_t per_parent[DAE_I_MAX + 1];
} dae_profile_t;

ZN_GSCL_EXPORT extern dae_profile_t dae_prof__INTERNAL__;
/// 0 before dae_init, -1 after it failed, the daemon's process id after it succeeded.
ZN_GSCL_EXPORT extern pid_t dae_pid__INTERNAL__;

/// Checks the policy. Returns 0, DAE_E_NOPSALLOC or DAE_E_AINVALID.
ZN_GSCL_EXPORT int dae_set_psalloc__INTERNAL__(dae_psalloc_t ps_policy, const char* prog_path, const char** argv);

/// Sets up the request channel that the profile names, and the output channels. Stores the descriptor, or -1, in
/// *return_KPL_d when that is not null. Returns 0 or DAE_E_KPL.
ZN_GSCL_EXPORT int dae_KPL_init__INTERNAL__(int* return_KPL_d);

/// Allocates what the output channels need; nothing for the signal transport. Returns 0 or DAE_E_KPL.
ZN_GSCL_EXPORT int dae_output_init__INTERNAL__(void);
/// Opens inform and error channel, with `status` the status channel too, for the request with that header. The
/// header stays in use until the channels are closed.
ZN_GSCL_EXPORT void dae_output_open__INTERNAL__(struct kplhdr* header, int status);
/// Sends what waits and closes the channels. *emsg (when `emsg` is not null) becomes the error text, null when
/// there is none; it lives until the channels are opened again.
ZN_GSCL_EXPORT void dae_output_close__INTERNAL__(const char** emsg);

/// Takes the single-instance lock. Returns 0 or a DAE_E_EXCL code.
ZN_GSCL_EXPORT int dae_exclusive__INTERNAL__(const char* excl_path, char excl_ID);

/// Makes `error_detail` (null: none) the record of the public routine now running, and clears it.
ZN_GSCL_EXPORT void dae_detail_init__INTERNAL__(dae_error_detail_t* error_detail, const char* dae_routine);
/// Record an error; the last one stays. Nothing happens without a current record.
ZN_GSCL_EXPORT void dae_detail_error__INTERNAL__(const char* error_string, const char* filename,
                                                 const char* fileversion, long fileline);
ZN_GSCL_EXPORT void dae_detail_errno__INTERNAL__(const char* routine_name, int errno_value, const char* filename,
                                                 const char* fileversion, long fileline);
/// 1 when the current record holds an error.
ZN_GSCL_EXPORT int dae_detail_is_set__INTERNAL__(void);

#ifdef __cplusplus
}
#endif

#endif
