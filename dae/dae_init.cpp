// Start-up: who started us, and the steps that make the process a daemon of that parent.
#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

#include "dae/dae_failure_internal.h"
#include "gscl/GSDebugFile_internal.h"

namespace {

constexpr long kMaxDescriptors = 2000;  ///< descriptors from here on are not closed

const dae_profile_t& profile = dae_prof__INTERNAL__;

const dae_per_parent_t& options_of(dae_parent_index_t kind) { return profile.per_parent[kind]; }

// ---- Who started us ----

/// Sets *found when descriptors 0 to 2 are IPv4 sockets on one address and port. Returns a DAE_ code.
int is_parent_inetd(bool* found) {
  *found = false;
  in_addr_t first_address = 0;
  in_port_t first_port = 0;
  for (int fd = 0; fd <= 2; ++fd) {
    sockaddr_in name = {};
    socklen_t length = sizeof name;
    if (getsockname(fd, reinterpret_cast<sockaddr*>(&name), &length) != 0) {
      if (errno == EBADF || errno == ENOTSOCK) return DAE_OK;
      return dae::fail_call(DAE_E_PUNKNOWN, "getsockname");
    }
    if (name.sin_family != AF_INET) return DAE_OK;
    const in_addr_t address = ntohl(name.sin_addr.s_addr);
    const in_port_t port = ntohs(name.sin_port);
    if (fd == 0) {
      first_address = address;
      first_port = port;
    }
    if (address != first_address || port != first_port) return DAE_OK;
  }
  *found = true;
  return DAE_OK;
}

/// Points *info at the parent's entry, read at the first call. Returns a DAE_ code.
int get_parent_info(const dae_procsinfo_t** info) {
  static dae_procsinfo_t entry;
  static bool known = false;
  *info = &entry;
  if (known) return DAE_OK;
  const pid_t parent = getppid();
  if (dae_getprocs(parent, &entry) != 1) return DAE_E_PUNKNOWN;
  if (entry.pi_state == DAE_PSTATE_NONE || entry.pi_state == DAE_PSTATE_IDL || entry.pi_state == DAE_PSTATE_ZOMB) {
    return dae::fail(DAE_E_PUNKNOWN, "DAE_EM_PPROCENTRYSTATE");
  }
  if (entry.pi_pid != static_cast<uint32_t>(parent)) return dae::fail(DAE_E_PUNKNOWN, "DAE_EM_PPROCENTRYPID");
  known = true;
  return DAE_OK;
}

/// Sets *found when the parent looks as only the KPL master does: the name alone could be anybody's.
int is_parent_KPL(bool* found) {
  const dae_procsinfo_t* parent;
  if (const int code = get_parent_info(&parent); code != DAE_OK) return code;
  *found = strcmp(parent->pi_comm, "kplmstr") == 0 && parent->pi_uid == 0 && parent->pi_ppid == 1 &&
           parent->pi_pgrp == parent->pi_pid && parent->pi_sid == parent->pi_pid && parent->pi_ttyp == 0;
  return DAE_OK;
}

int accept(dae_parent_index_t kind, const char* refusal, dae_parent_index_t* result) {
  if ((profile.parent & (1 << kind)) == 0) return dae::fail(DAE_E_PWRONG, refusal);
  *result = kind;
  return DAE_OK;
}

int verify_parent(dae_parent_index_t* kind) {
  if (profile.parent < 1 || profile.parent > 7) return dae::fail(DAE_E_PINVALID, "DAE_EM_PINVALID");
  bool found;
  if (const int code = is_parent_inetd(&found); code != DAE_OK) return code;
  if (found) return accept(DAE_I_INETD, "DAE_EM_PWRONG_INETD", kind);
  if (const int code = is_parent_KPL(&found); code != DAE_OK) return code;
  if (found) return accept(DAE_I_KPL, "DAE_EM_PWRONG_KPL", kind);
  return accept(DAE_I_OTHER, "DAE_EM_PWRONG_OTHER", kind);
}

// ---- The steps ----

int ignore_terminal_signals() {
  for (const int signo : {SIGHUP, SIGINT, SIGQUIT, SIGTSTP, SIGTTIN, SIGTTOU}) {
    if (dae::set_signal(signo, SIG_IGN, 0, DAE_E_SIGNAL) != DAE_OK) return DAE_E_SIGNAL;
  }
  return DAE_OK;
}

/// In the child: waits until the caller has gone and somebody else is the parent: process 1 or a sub-reaper.
void wait_for_orphanhood(int read_end, pid_t caller) {
  char byte;
  while (read(read_end, &byte, 1) < 0 && errno == EINTR) {
  }
  close(read_end);
  while (getppid() == caller) sleep(1);
}

/// Goes on in a child of a process that ends.
int migrate_daemon() {
  if (getppid() == 1) return DAE_OK;
  int ends[2];  // not for programs that an exit handler of the caller starts: the child would wait for their end
  if (pipe2(ends, O_CLOEXEC) != 0) return dae::fail_call(DAE_E_MIGRATE, "pipe");
  fflush(nullptr);  // or the child would write it once more
  const pid_t caller = getpid();
  const pid_t child = fork();
  if (child == -1) {
    dae::fail_call(DAE_E_MIGRATE, "fork");
    close(ends[0]);
    close(ends[1]);
    return DAE_E_MIGRATE;
  }
  if (child != 0) {
    close(ends[0]);
    exit(0);
  }
  close(ends[1]);
  wait_for_orphanhood(ends[0], caller);
  return DAE_OK;
}

/// Opens the controlling terminal; -1 with errno. ENXIO means that there is none.
int open_terminal() {
  char name[L_ctermid];
  if (ctermid(name) == nullptr) {
    errno = ENOENT;
    return -1;
  }
  return open(name, O_RDWR | O_NOCTTY | O_CLOEXEC);
}

bool has_terminal() {
  const int fd = open_terminal();
  if (fd < 0) return errno != ENXIO;
  close(fd);
  return true;
}

int create_session() {
  setsid();  // fails for the leader of a process group, which is good enough
  const pid_t self = getpid();
  if (getsid(0) != self && getpgrp() != self) return dae::fail(DAE_E_SESSION, "DAE_EM_SESSION");
  if (!has_terminal()) return DAE_OK;
  const int fd = open_terminal();
  if (fd < 0) return DAE_OK;
  ioctl(fd, TIOCNOTTY);
  close(fd);
  return DAE_OK;
}

int setup_nonterminal_signals(dae_parent_index_t kind) {
  if (dae::set_signal(SIGPIPE, SIG_IGN, 0, DAE_E_SIGNAL) != DAE_OK) return DAE_E_SIGNAL;
  if (kind != DAE_I_KPL) {  // under KPL the request channel does it
    const int flags = profile.stop_restart != 0 ? SA_RESTART : 0;
    if (dae::set_signal(SIGTERM, profile.stop_cancel_hdl, flags, DAE_E_SIGNAL) != DAE_OK) return DAE_E_SIGNAL;
  }
  const dae_per_parent_t& options = options_of(kind);
  if (!options.pzomb_call) return DAE_OK;
  const int flags = SA_NOCLDSTOP | (options.pzomb_restart ? SA_RESTART : 0);
  return dae::set_signal(SIGCHLD, options.pzomb_hdl, flags, DAE_E_SIGNAL);
}

int close_files(dae_parent_index_t kind) {
  if (options_of(kind).keep_open_call) return DAE_OK;
  errno = 0;
  long limit = sysconf(_SC_OPEN_MAX);
  if (limit == -1 && errno != 0) return dae::fail_call(DAE_E_CLOSE, "sysconf");
  if (limit == -1) limit = kMaxDescriptors;
  const int end = static_cast<int>(std::min(limit, kMaxDescriptors));
  const int kept = gscl_internal::moveDebugFileUp(end);
  for (int fd = kind == DAE_I_OTHER ? 0 : 3; fd < end; ++fd) {
    if (fd != kept) close(fd);
  }
  return DAE_OK;
}

/// Opens what is missing of descriptors 0 to 2, so that nothing opened later becomes standard error by accident.
int null_files() {
  for (int fd = 0; fd <= 2; ++fd) {
    struct stat64 status;
    if (fstat64(fd, &status) == 0) continue;
    if (errno != EBADF) return dae::fail_call(DAE_E_NULL, "fstat64");
    const int got = open("/dev/null", O_RDWR);
    if (got < 0) return dae::fail_call(DAE_E_NULL, "open");
    if (got == fd) continue;
    close(got);
    return dae::fail(DAE_E_NULL, "DAE_EM_DEVNULLFD");
  }
  return DAE_OK;
}

int change_directory() {
  if (chdir("/") != 0) return dae::fail_call(DAE_E_CHDIR, "chdir");
  umask(0);
  return DAE_OK;
}

int check_psalloc(dae_parent_index_t kind) {
  const dae_per_parent_t& options = options_of(kind);
  if (!options.psalloc_call) return DAE_OK;
  return dae_set_psalloc__INTERNAL__(options.ps_policy, options.prog_path, options.argv);
}

int take_lock(dae_parent_index_t kind) {
  const dae_per_parent_t& options = options_of(kind);
  return options.excl_call ? dae_exclusive__INTERNAL__(options.excl_path, options.excl_ID) : DAE_OK;
}

/// All steps behind the identification of the parent, in their order; the first failure ends them.
int become_daemon(dae_parent_index_t kind) {
  int code = ignore_terminal_signals();
  if (code == DAE_OK && kind == DAE_I_OTHER) code = migrate_daemon();
  if (code == DAE_OK) code = check_psalloc(kind);
  if (code == DAE_OK) code = create_session();
  if (code == DAE_OK) code = setup_nonterminal_signals(kind);
  if (code == DAE_OK) code = close_files(kind);
  if (code == DAE_OK) code = null_files();
  if (code == DAE_OK) code = change_directory();
  if (code == DAE_OK && kind == DAE_I_KPL) code = dae_KPL_init__INTERNAL__(profile.KPL_d_ptr);
  if (code == DAE_OK) code = null_files();  // the socket transport has given up descriptor 0
  if (code == DAE_OK) code = take_lock(kind);
  return code;
}

int start(dae_parent_t* parent) {
  if (parent != nullptr) {
    dae_prof__INTERNAL__.parent = *parent;
    *parent = 0;
  }
  dae_parent_index_t kind = DAE_I_INVALID;
  if (const int code = verify_parent(&kind); code != DAE_OK) return code;
  if (parent != nullptr) *parent = 1 << kind;
  return become_daemon(kind);
}

void ignore_signal(int) {}

}  // namespace

int dae::set_signal(int signo, void (*handler)(int), int flags, int code) {
  struct sigaction action = {};
  action.sa_handler = handler;
  action.sa_flags = flags;
  sigemptyset(&action.sa_mask);
  return sigaction(signo, &action, nullptr) == 0 ? DAE_OK : dae::fail_call(code, "sigaction");
}

int dae_init(dae_parent_t* parent, dae_error_detail_t* err_detail) {
  dae::KeepErrno keep_errno;
  if (profile.KPL_d_ptr != nullptr) *profile.KPL_d_ptr = -1;
  dae_detail_init__INTERNAL__(err_detail, "dae_init");
  if (dae_pid__INTERNAL__ != 0) return dae::fail(DAE_E_NOTAGAIN, "DAE_EM_NOTAGAIN");
  const int code = start(parent);
  dae_pid__INTERNAL__ = code == DAE_OK ? getpid() : -1;
  return code;
}

void dae_pause_for_debugger() {
  struct sigaction action = {};
  struct sigaction previous;
  action.sa_handler = ignore_signal;
  sigemptyset(&action.sa_mask);
  sigaction(SIGCONT, &action, &previous);
  pause();
  sigaction(SIGCONT, &previous, nullptr);
}
