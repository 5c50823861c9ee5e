// Daemon environment: one call that turns a started process into a daemon, whoever started it, and the channels
// through which a daemon under the KPL master answers requests. Plain functions with C linkage, for C and C++.
//
//   dae_parent_t parent = DAE_P_KPL | DAE_P_OTHER;  // who may start us
//   dae_error_detail_t detail;
//   dae_init_exclusive(parent, "/etc/mydaemon.conf", 'd');
//   dae_init_KPL_sock(&request_fd, &routines, 1);
//   if (dae_init(&parent, &detail) != 0) return complain(detail.dae_error_string);
//   for (;;) { wait until request_fd is readable; dae_KPL_req(); }
//
// Order: the option setters in any order, then dae_init, once, then the rest. Setters after dae_init are ignored.
// Threads: everything up to dae_init belongs to the single thread of a starting program. dae_KPL_req and the
// output calls belong to one thread at a time, the one that serves requests; nothing here takes a lock. Ownership:
// texts, vectors and variables given to setters are not copied and stay the caller's; they live until the last
// call of dae_init has returned. Routine records are copied. Errors: int codes, 0 for success; no text goes to a
// log or to standard error.
//
// In C++ the class KPLDriver (gscl/KPLDriver.h) does all of this for a daemon. Example: examples/tiny_daemon.cpp.
#ifndef DAE_DAE_H
#define DAE_DAE_H

#include <stdarg.h>
#include <stdint.h>
#include <sys/types.h>

#include "gscl/export.h"

// In C++ the enumerations are as wide as in C, so that a value that has no name is still a value.
#ifdef __cplusplus
#define DAE_AS_INT : int
extern "C" {
#else
#define DAE_AS_INT
#endif

/// Who started the process.
enum dae_parent_index_t DAE_AS_INT {
  DAE_I_KPL = 0,    ///< the KPL master
  DAE_I_INETD = 1,  ///< the inet super-server
  DAE_I_OTHER = 2,  ///< anybody else: a shell, a script, systemd
  DAE_I_MIN = DAE_I_KPL,
  DAE_I_MAX = DAE_I_OTHER,
  DAE_I_INVALID = 3
};
typedef enum dae_parent_index_t dae_parent_index_t;

/// A set of parent kinds: bit 1 << dae_parent_index_t.
typedef int dae_parent_t;
enum { DAE_P_KPL = 1 << DAE_I_KPL, DAE_P_INETD = 1 << DAE_I_INETD, DAE_P_OTHER = 1 << DAE_I_OTHER };

/// Paging-space allocation policies. Only the first three can be had here, and change nothing.
enum dae_psalloc_t DAE_AS_INT {
  DAE_A_DONT_CARE = 0,
  DAE_A_LATE_TRY = 1,
  DAE_A_EARLY_TRY = 2,
  DAE_A_LATE = 3,
  DAE_A_EARLY = 4,
  DAE_A_INVALID = 5
};
typedef enum dae_psalloc_t dae_psalloc_t;

/// How requests of the KPL master arrive.
enum dae_KPL_comm_t DAE_AS_INT {
  DAE_C_SIG = 0,  ///< as signals, stop requests only
  DAE_C_MSQ = 1,  ///< on a System V message queue
  DAE_C_SOCK = 2  ///< on a datagram socket, handed over on descriptor 0
};
typedef enum dae_KPL_comm_t dae_KPL_comm_t;

/// Results of dae_init, with the texts that `dae_error_string` may have then. CALL stands for a system call: the
/// text is "CALL failed: " and the system's text for the error.
enum {
  DAE_OK = 0,
  DAE_E_NOTAGAIN = 1,    ///< called before, successfully or not: "DAE_EM_NOTAGAIN"
  DAE_E_PINVALID = 2,    ///< acceptable parents not in 1..7: "DAE_EM_PINVALID"
  DAE_E_PWRONG = 3,      ///< not an acceptable parent: "DAE_EM_PWRONG_KPL", "..._INETD", "..._OTHER"
  DAE_E_PUNKNOWN = 4,    ///< parent not identified: CALL, "DAE_EM_PPROCENTRYSTATE", "DAE_EM_PPROCENTRYPID"
  DAE_E_MIGRATE = 5,     ///< not detached from the parent: CALL
  DAE_E_SESSION = 6,     ///< leads neither a session nor a process group: "DAE_EM_SESSION"
  DAE_E_SIGNAL = 7,      ///< a signal's action could not be set: CALL
  DAE_E_CLOSE = 8,       ///< descriptor limit not known: CALL
  DAE_E_NULL = 9,        ///< descriptors 0 to 2 could not be filled: CALL, "DAE_EM_DEVNULLFD"
  DAE_E_CHDIR = 10,      ///< "/" could not become the working directory: CALL
  DAE_E_KPL = 11,        ///< request channel: CALL, "DAE_EM_KPL_COMM", "..._SIG", "..._MSQ_PERM", "..._SOCK_PERM",
                         ///< "..._SOCK_FD", "..._SOCK_DUP", "DAE_EM_FLAGSET"
  DAE_E_NOPSALLOC = 12,  ///< policy not available: "DAE_EM_NOPSALLOC"
  DAE_E_AINVALID = 13,   ///< no such policy: "DAE_EM_AINVALID"
  DAE_E_EXCLINVALID = 15,  ///< null path or zero id: "DAE_EM_EXCLINVALID"
  DAE_E_EXCLFAILED = 16,   ///< the lock's key or semaphore failed: CALL, or "DAE_EM_EXCLFOREIGN"
  DAE_E_EXCLBUSY = 17      ///< another instance runs: "DAE_EM_EXCLBUSY"
};

/// Which step of dae_init failed and why. The texts are always terminated; all empty after success.
typedef struct dae_error_detail_t {
  char dae_routine[20];       ///< the public routine that was running
  char dae_error_string[80];  ///< an identifier, or "CALL failed: " and the system's text
  char dae_filename[20];      ///< source file that found the error, without folders
  char dae_fileversion[10];   ///< that file's version
  long dae_fileline;          ///< line in that file; 0: no error
} dae_error_detail_t;

/// Stop routines of a daemon whose requests are signals. They are signal handlers; null where there is none.
typedef struct dae_req_sig_t {
  void (*dae_stop_normal)(int signo);
  void (*dae_stop_forced)(int signo);
  void (*dae_stop_cancel)(int signo);
} dae_req_sig_t;

/// Routines of a daemon whose requests are messages. A null routine means that the request is not supported, or,
/// for the stop requests, that the process ends with exit(0). They run inside dae_KPL_req, on its thread, except
/// dae_stop_cancel, which is the handler of SIGTERM; they return (no exception leaves them) or end the process, and
/// do not call dae_KPL_req. The output channels are open in all of them but the stop routines, whose reply has gone
/// out before.
typedef struct dae_req_sock_t {
  void (*dae_stop_normal)(void);
  void (*dae_stop_forced)(void);
  void (*dae_stop_cancel)(int signo);
  void (*dae_trace_begin)(int long_trace);  ///< 1: long trace
  void (*dae_trace_end)(void);
  void (*dae_refresh)(void);
  void (*dae_long_status)(void);  ///< the only one in which the status channel is open
  /// Requests of the daemon's own, `request` 256 and above. `data` is null when there is no data, else it is
  /// followed by a NUL that is not counted and lives until the routine returns. A result other than 0 answers "not
  /// supported".
  int (*dae_other_req)(short request, short parm1, short parm2, const void* data, int data_len);
} dae_req_sock_t;
typedef dae_req_sock_t dae_req_msq_t;

// ---- Options ---------------------------------------------------------------------------------------------------
//
// Each applies to the kinds of parent whose bit is set in `parent`; a later call overwrites an earlier one.
// `restart`: non-zero installs the handlers so that interrupted system calls are restarted.

/// Asks for a paging-space policy. `prog_path` and `argv` are recorded only.
ZN_GSCL_EXPORT void dae_init_psalloc(dae_parent_t parent, dae_psalloc_t ps_policy, const char* prog_path,
                                     const char** argv);
/// A handler for low paging space; recorded only, Linux has no such signal.
ZN_GSCL_EXPORT void dae_init_lowps(dae_parent_t parent, void (*lowps)(int), int restart);
/// Reaps children as they end, whatever their status.
ZN_GSCL_EXPORT void dae_init_prevent_zombies(dae_parent_t parent, int restart);
/// Lets one instance run at a time: of all processes with the same existing file and the same id, not 0. The path
/// is absolute: it is looked up when "/" is the working directory.
ZN_GSCL_EXPORT void dae_init_exclusive(dae_parent_t parent, const char* excl_path, char excl_ID);
/// Keeps inherited descriptors open.
ZN_GSCL_EXPORT void dae_init_keep_files_open(dae_parent_t parent);

/// Requests arrive as signals: 0 to 30, 0 for none. A stop signal without a routine ends the process with
/// _exit(0). SIGTERM always gets dae_stop_cancel. `KPL_rtns` may be null.
ZN_GSCL_EXPORT void dae_init_KPL_sig(int sig_stop_normal, int sig_stop_forced, const dae_req_sig_t* KPL_rtns,
                                     int restart);
/// Requests are SIGTERM alone, handled by `term_rtn` (null: the default action).
ZN_GSCL_EXPORT void dae_init_term_sig(void (*term_rtn)(int), int restart);
/// Requests arrive on the message queue `msqkey`, which the master made, with type `msqtype`. *msqid becomes the
/// queue's id in dae_init, -1 when there is no channel. `msqid` and `KPL_rtns` may be null.
ZN_GSCL_EXPORT void dae_init_KPL_msq(int* msqid, int msqkey, int msqtype, const dae_req_msq_t* KPL_rtns,
                                     int restart);
/// Requests arrive on a socket. *KPL_sockd is the descriptor wanted for it, 3 or more, or negative for any from 3
/// up; it becomes the descriptor in dae_init, -1 when there is no channel. `KPL_rtns` may be null, not so
/// `KPL_sockd`.
ZN_GSCL_EXPORT void dae_init_KPL_sock(int* KPL_sockd, const dae_req_sock_t* KPL_rtns, int restart);
/// Leaves the request socket in blocking mode, so that dae_KPL_req waits for a request.
ZN_GSCL_EXPORT void dae_init_KPL_sock_block(void);

// ---- Start -----------------------------------------------------------------------------------------------------

/// Makes the process a daemon. On entry *parent holds the kinds of parent that are acceptable; once the parent is
/// identified it holds the one bit of its kind, also when a later step fails, and 0 when it is not identified.
/// Null accepts no parent. `err_detail` may be null; else it stays in use until the next dae_init or dae_KPL_req.
///
/// Afterwards the process leads a session (or, where it led a process group before, still that) without terminal,
/// ignores SIGHUP, SIGINT, SIGQUIT,
/// SIGTSTP, SIGTTIN, SIGTTOU and SIGPIPE, has "/" as working directory and a umask of 0, descriptors 0 to 2 open
/// and, unless they were to be kept, no inherited descriptor below 2000 and the limit in force (under KPL and inetd
/// from 3 on). The debug file of gscl/GSDebug.h stays open under a number from there up (under its own where the hard
/// limit is no higher).
/// Started by anything else than these two and process 1, it is a child of the process that called, which has
/// ended with exit(0), its exit handlers included: failures after that are reported in the child. The child goes
/// on when the caller is no longer its parent, whether process 1 or a sub-reaper has adopted it.
///
/// Returns a DAE_ code. A second call returns DAE_E_NOTAGAIN and changes nothing, but stores -1 in the registered
/// descriptor variable. `errno` stays as it was.
ZN_GSCL_EXPORT int dae_init(dae_parent_t* parent, dae_error_detail_t* err_detail);

/// 1 in the process in which dae_init succeeded, else 0, also in its children. Any thread.
ZN_GSCL_EXPORT int dae_process_is_the_daemon(void);

/// Waits for a signal, SIGCONT included: a place for a debugger to attach.
ZN_GSCL_EXPORT void dae_pause_for_debugger(void);

/// Removes the single-instance lock of the daemon process; nothing in any other process. Registered to run at
/// exit.
ZN_GSCL_EXPORT void dae_release(void);

// ---- Requests --------------------------------------------------------------------------------------------------

/// Reads and serves at most one request: calls its routine and answers. Waits for one only with
/// dae_init_KPL_sock_block. Nothing happens outside the daemon process, or when there is no request channel. A
/// short request is dropped, one that makes no sense is refused. `errno` stays as it was.
ZN_GSCL_EXPORT void dae_KPL_req(void);

// ---- Output while a request is served --------------------------------------------------------------------------
//
// Status: lines of a margin column (at most 29 characters) and a body (at most 64), for long status only.
// Inform: lines of at most 137 characters, sent to the requester while the request runs.
// Error: at most 136 characters in all, which become the reply's message and make it a failure; more is dropped.
// All these are counted in bytes.
//
// Lines end with "\n"; longer ones are broken between characters of the locale. What has no line end is kept until
// more comes, a flush or the end of the request. In body and error text every "%" is sent as "%%".
// All return -1 and do nothing outside a request; otherwise the length of the text given, or -1 for text that
// cannot be written (see below, and characters that the locale rejects: what stood before them is taken).
// Formatted text is cut at 4095 bytes, before a character that does not fit whole. `errno` stays as it was.

ZN_GSCL_EXPORT int dae_status_printf(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
ZN_GSCL_EXPORT int dae_status_vprintf(const char* fmt, va_list args) __attribute__((format(printf, 1, 0)));
ZN_GSCL_EXPORT int dae_status_puts(const char* s);

/// Margin text, and with `new_width` of 0 or more the margin's width from here on. It may not hold "%", and
/// nothing but line ends while the margin is 0 wide.
ZN_GSCL_EXPORT int dae_margin_printf(int new_width, const char* fmt, ...) __attribute__((format(printf, 2, 3)));
ZN_GSCL_EXPORT int dae_margin_vprintf(int new_width, const char* fmt, va_list args)
    __attribute__((format(printf, 2, 0)));
ZN_GSCL_EXPORT int dae_margin_puts(int new_width, const char* s);

ZN_GSCL_EXPORT int dae_inform_printf(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
ZN_GSCL_EXPORT int dae_inform_vprintf(const char* fmt, va_list args) __attribute__((format(printf, 1, 0)));
ZN_GSCL_EXPORT int dae_inform_puts(const char* s);

ZN_GSCL_EXPORT int dae_error_printf(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
ZN_GSCL_EXPORT int dae_error_vprintf(const char* fmt, va_list args) __attribute__((format(printf, 1, 0)));
ZN_GSCL_EXPORT int dae_error_puts(const char* s);

/// Send what waits. Return 0, or -1.
ZN_GSCL_EXPORT int dae_status_flush(void);
ZN_GSCL_EXPORT int dae_inform_flush(void);

/// Adds the master's short status of this process to the status lines. Returns 0, also when the master does not
/// answer (it waits a few seconds for it), or -1 when the status channel is closed.
ZN_GSCL_EXPORT int dae_status_short(void);

/// The name under which the master knows this daemon, to be freed by the caller; null outside the daemon process
/// and when the master does not tell (it waits a few seconds for it). Needs no request. `errno` stays as it was.
ZN_GSCL_EXPORT char* dae_subsysname(void);

// ---- Process table ---------------------------------------------------------------------------------------------

/// State of a process.
enum dae_pstate_t DAE_AS_INT {
  DAE_PSTATE_NONE = 0,  ///< any other
  DAE_PSTATE_IDL = 1,   ///< never given
  DAE_PSTATE_ZOMB = 2,  ///< ended, not waited for
  DAE_PSTATE_STOP = 3,
  DAE_PSTATE_ACTIVE = 4,
  DAE_PSTATE_SWAP = 5  ///< never given
};
typedef enum dae_pstate_t dae_pstate_t;

/// One process.
typedef struct dae_procsinfo_t {
  uint32_t pi_pid;
  uint32_t pi_ppid;
  uint32_t pi_sid;
  uint32_t pi_pgrp;
  uint32_t pi_uid;  ///< real user id
  dae_pstate_t pi_state;
  uint32_t pi_flags;  ///< the kernel's
  uint32_t pi_ttyp;   ///< controlling terminal, 0 for none
  char pi_comm[40];   ///< command name, at most 15 characters
} dae_procsinfo_t;

/// Fills *dae_pip for process `pid`. Returns 1, or -1 when there is no such process or /proc cannot be read; then
/// the entry may be partly filled, and the reason goes to the error detail in use, if any (see dae_init).
ZN_GSCL_EXPORT int dae_getprocs(pid_t pid, dae_procsinfo_t* dae_pip);

#ifdef __cplusplus
}
#endif

#undef DAE_AS_INT

#endif
