// The option setters, and the process-wide state of the daemon environment.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include "dae/dae_failure_internal.h"

dae_profile_t dae_prof__INTERNAL__;
pid_t dae_pid__INTERNAL__ = 0;

namespace {

bool is_open() { return dae_pid__INTERNAL__ == 0; }

/// Lets `set` change the options of each kind in `parent`, while options may still be set.
template <class Setter>
void for_each_kind(dae_parent_t parent, Setter set) {
  if (!is_open()) return;
  for (int kind = DAE_I_MIN; kind <= DAE_I_MAX; ++kind) {
    if ((parent & (1 << kind)) != 0) set(dae_prof__INTERNAL__.per_parent[kind]);
  }
}

void reap_children(int) {
  dae::KeepErrno keep_errno;
  pid_t pid;
  do {
    pid = waitpid(-1, nullptr, WNOHANG);
  } while (pid > 0 || (pid == -1 && errno == EINTR));
}

/// What all transports have in common; whatever belongs to one of them is cleared.
void start_transport(dae_KPL_comm_t comm, const dae_req_sock_t& routines, int restart) {
  dae_profile_t& prof = dae_prof__INTERNAL__;
  prof.KPL_comm = comm;
  prof.sig_stop_normal = 0;
  prof.sig_stop_forced = 0;
  prof.stop_normal_hdl = nullptr;
  prof.stop_forced_hdl = nullptr;
  prof.stop_cancel_hdl = routines.dae_stop_cancel;
  prof.stop_restart = restart;
  prof.stop_normal = routines.dae_stop_normal;
  prof.stop_forced = routines.dae_stop_forced;
  prof.trace_begin = routines.dae_trace_begin;
  prof.trace_end = routines.dae_trace_end;
  prof.refresh = routines.dae_refresh;
  prof.long_status = routines.dae_long_status;
  prof.other_req = routines.dae_other_req;
  prof.msqkey = 0;
  prof.msqtype = 0;
  prof.KPL_sockd = 0;
  prof.KPL_d_ptr = nullptr;
}

dae_req_sock_t or_none(const dae_req_sock_t* routines) {
  return routines != nullptr ? *routines : dae_req_sock_t{};
}

}  // namespace

void dae_init_psalloc(dae_parent_t parent, dae_psalloc_t ps_policy, const char* prog_path, const char** argv) {
  for_each_kind(parent, [=](dae_per_parent_t& options) {
    options.psalloc_call = 1;
    options.ps_policy = ps_policy;
    options.prog_path = prog_path;
    options.argv = argv;
  });
}

void dae_init_lowps(dae_parent_t parent, void (*lowps)(int), int restart) {
  for_each_kind(parent, [=](dae_per_parent_t& options) {
    options.lowps_call = 1;
    options.lowps_hdl = lowps;
    options.lowps_restart = restart != 0;
  });
}

void dae_init_prevent_zombies(dae_parent_t parent, int restart) {
  for_each_kind(parent, [=](dae_per_parent_t& options) {
    options.pzomb_call = 1;
    options.pzomb_hdl = reap_children;
    options.pzomb_restart = restart != 0;
  });
}

void dae_init_exclusive(dae_parent_t parent, const char* excl_path, char excl_ID) {
  for_each_kind(parent, [=](dae_per_parent_t& options) {
    options.excl_call = 1;
    options.excl_path = excl_path;
    options.excl_ID = excl_ID;
  });
}

void dae_init_keep_files_open(dae_parent_t parent) {
  for_each_kind(parent, [](dae_per_parent_t& options) { options.keep_open_call = 1; });
}

void dae_init_KPL_sig(int sig_stop_normal, int sig_stop_forced, const dae_req_sig_t* KPL_rtns, int restart) {
  if (!is_open()) return;
  const dae_req_sig_t handlers = KPL_rtns != nullptr ? *KPL_rtns : dae_req_sig_t{};
  dae_req_sock_t routines = {};
  routines.dae_stop_cancel = handlers.dae_stop_cancel;
  start_transport(DAE_C_SIG, routines, restart);
  dae_prof__INTERNAL__.sig_stop_normal = sig_stop_normal;
  dae_prof__INTERNAL__.sig_stop_forced = sig_stop_forced;
  dae_prof__INTERNAL__.stop_normal_hdl = handlers.dae_stop_normal;
  dae_prof__INTERNAL__.stop_forced_hdl = handlers.dae_stop_forced;
}

void dae_init_term_sig(void (*term_rtn)(int), int restart) {
  const dae_req_sig_t handlers = {term_rtn, term_rtn, term_rtn};
  dae_init_KPL_sig(SIGTERM, SIGTERM, &handlers, restart);
}

void dae_init_KPL_msq(int* msqid, int msqkey, int msqtype, const dae_req_msq_t* KPL_rtns, int restart) {
  if (!is_open()) return;
  start_transport(DAE_C_MSQ, or_none(KPL_rtns), restart);
  dae_prof__INTERNAL__.msqkey = msqkey;
  dae_prof__INTERNAL__.msqtype = msqtype;
  dae_prof__INTERNAL__.KPL_d_ptr = msqid;
}

void dae_init_KPL_sock(int* KPL_sockd, const dae_req_sock_t* KPL_rtns, int restart) {
  if (!is_open()) return;
  start_transport(DAE_C_SOCK, or_none(KPL_rtns), restart);
  dae_prof__INTERNAL__.KPL_sockd = *KPL_sockd;
  dae_prof__INTERNAL__.KPL_d_ptr = KPL_sockd;
}

void dae_init_KPL_sock_block() {
  if (is_open()) dae_prof__INTERNAL__.KPL_sockd_block = 1;
}

int dae_process_is_the_daemon() { return getpid() == dae_pid__INTERNAL__; }
