// KPLDriver: a daemon that the KPL master can start, ask and stop, by subclassing one class.
//
// Example: examples/tiny_daemon.cpp; for operators: docs/daemons.md.
#ifndef GSCL_KPLDRIVER_H
#define GSCL_KPLDRIVER_H

#include <sys/ipc.h>

#include "dae/dae.h"
#include "gscl/GSLockPrim.h"
#include "gscl/GSString.h"
#include "gscl/export.h"

namespace zelt_gscl_V1 {

/// Starts the process as a daemon, routes each request of the KPL master to a virtual method, and keeps the reason
/// to stop. Construct one (derived) object per process, call InitKPL once, then: wait until getKPLDescriptor() is
/// readable, call doKPLreq(), and end when getStopCode() is not 0. Started by something else than KPL there is no
/// request descriptor, and only SIGTERM (stopCancel) asks to stop.
///
/// Handlers run inside doKPLreq, on its thread, one at a time, and may call everything here but doKPLreq;
/// stopCancel alone is a signal handler. A handler that is not overridden does nothing and its request is answered
/// as a success. A handler lets no exception out.
///
/// Threads: InitKPL belongs to the single thread of a starting program, doKPLreq and the output calls to the
/// thread that serves requests; the stop code's operations may be called by any thread. Ownership: the object owns
/// the request descriptor; it copies texts, but the file name given to InitKPL lives as long as the process.
/// Lifetime: the object outlives the last request and the last SIGTERM, since destroying it does not take it out
/// of the handlers; in practice it lives as long as the process. It cannot be copied.
class ZN_GSCL_EXPORT KPLDriver {
 public:
  /// Makes this object the process's driver, in place of any other.
  KPLDriver();
  /// Closes the request descriptor.
  virtual ~KPLDriver();
  KPLDriver(const KPLDriver&) = delete;
  KPLDriver& operator=(const KPLDriver&) = delete;

  /// Starts the daemon (see dae_init): under KPL, where inherited descriptors stay open, or under anything but
  /// inetd. Children are reaped. `syscall_restarts`: non-zero restarts system calls that SIGTERM or SIGCHLD
  /// interrupt. With `excl_file` (null: not), an existing file by its absolute path, and the low 8 bits of
  /// `excl_id` (not 0) only one instance runs at a time. `sigdanger_handler` (may be null) is recorded only.
  /// Returns 0, or 1000 plus the code of dae_init, with the detail in err_detail: 1001 on a second call, 1003
  /// under inetd, 1011 without a working request channel, 1017 when another instance runs. Traces at
  /// GSCL_TRC_WARNING.
  virtual int InitKPL(int syscall_restarts, const char* excl_file, int excl_id, void (*sigdanger_handler)(int));

  /// The request socket, -1 before InitKPL and when KPL is not the parent.
  int getKPLDescriptor();

  /// Serves at most one request that waits; does not block. Returns 0.
  static int doKPLreq();

  /// 0, or the first code that was recorded. Takes no lock; also in a signal handler.
  int getStopCode();

  /// The text recorded with the code, null after clearStopCode. Good until the next setStopCode or clearStopCode.
  /// Takes the stop lock for reading. Not for signal handlers.
  const char* getStopMsg();

  /// Records why to stop, unless a code is recorded already; a code of 0 counts as 1. Takes the stop lock.
  ///
  /// Inside stopCancel it takes no lock and allocates nothing, so that it works whatever the interrupted thread
  /// was doing: the code counts at once, the text (its first 127 characters) from the next getStopMsg on. An
  /// override that may be reached from stopCancel keeps to what signal handlers may do.
  virtual void setStopCode(int cd, const char* msg);

  /// Forgets code and text. Takes the stop lock. Not for signal handlers.
  void clearStopCode();

  /// Stop requests, after they were answered. Unless the handler sets a stop code, -1 "stopNormal" or
  /// -2 "stopForced" is recorded after it. The output channels are closed.
  virtual void stopNormal();
  virtual void stopForced();

  /// SIGTERM. A signal handler, on whatever thread the signal interrupts: only async-signal-safe calls,
  /// setStopCode and getStopCode. Unless it sets a stop code, -3 "stopCancel" is recorded after it.
  virtual void stopCancel(int dae_signo);

  /// Trace on (`dae_long` 1: a long trace) and off, reading the configuration again, and a report of the daemon's
  /// state through the status channel (dae_status_printf, dae_margin_printf).
  virtual void traceBegin(int dae_long);
  virtual void traceEnd();
  virtual void refresh();
  virtual void longStatus();

  /// A request of the daemon's own, 256 and above, with its data (null and 0 when there is none), which ends with
  /// the call. Returns 0 when it was accepted; anything else answers "not supported" and drops the error text.
  virtual int otherReq(short dae_request, short dae_parm1, short dae_parm2, const void* dae_parm3,
                       int dae_parm3_size);

  /// Output while a request is served (see dae/dae.h): message text, and error text that makes the request fail.
  /// They return the length written, -1 when no request is served.
  static int inform_printf(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
  static int error_printf(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
  /// Sends the message text now. Returns 0 or -1.
  static int inform_flush();
  /// For longStatus: writes the master's short status of this daemon and sends all lines so far. Returns 0 or -1.
  static int print_short_status();

  /// The process's driver: the last one constructed, null before.
  static KPLDriver* theKPLDriver();

 protected:
  static void stub_stopNormal();
  static void stub_stopForced();
  static void stub_stopCancel(int dae_sig);
  static void stub_traceBegin(int trace_level);
  static void stub_traceEnd();
  static void stub_refresh();
  static void stub_longStatus();
  static int stub_otherReq(short dae_request, short dae_parm1, short dae_parm2, const void* dae_parm3,
                           int dae_parm3_size);

  int _kpl_fd;
  int _stopCode;   ///< read without the lock; changes from 0 by one atomic step, back to 0 under _stopLocker
  key_t sema_key;  ///< of the single-instance lock, after a failed InitKPL; else -1
  dae_error_detail_t err_detail;
  GSString _stopMsg;  ///< guarded by _stopLocker; empty where the code came from stopCancel: see getStopMsg
  GSRWLock _stopLocker;

  static KPLDriver* _theKPLDriver;

 private:
  // The text of a code recorded inside stopCancel, in place of _stopMsg while that code stands. It belongs to the
  // handler that changed _stopCode from 0, then to whoever has _stopLocker; _signalWriters is not 0 in between.
  enum SignalMsgState { kNoSignalMsg, kSignalMsgReady };
  ZN_GSCL_HIDDEN bool claimStopCode(int cd);
  ZN_GSCL_HIDDEN void recordInSignal(int cd, const char* msg);

  int _signalWriters;   // handlers now recording
  int _signalMsgState;  // set by a handler; cleared under _stopLocker
  char _signalMsg[128];
};

}  // namespace zelt_gscl_V1

#endif
