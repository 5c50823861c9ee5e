#include "gscl/KPLDriver.h"

#include <errno.h>
#include <sched.h>
#include <signal.h>
#include <stdarg.h>
#include <string.h>
#include <unistd.h>

#include <atomic>

#include "gscl/scopes_internal.h"
#include "gscl/trace.h"

namespace zelt_gscl_V1 {

namespace {

using gscl_internal::ReadScope;
using gscl_internal::WriteScope;

constexpr dae_parent_t kParents = DAE_P_KPL | DAE_P_OTHER;
constexpr int kInitFailed = 1000;

/// Where dae_init stores the request descriptor, also when it is called once more: it outlives InitKPL.
int request_descriptor = -1;

/// Not 0 while this thread is inside stopCancel. The TLS model makes the access safe in a signal handler.
__attribute__((tls_model("initial-exec"))) thread_local volatile sig_atomic_t in_stop_cancel = 0;

class InStopCancel {
 public:
  InStopCancel() : saved_errno_(errno) { in_stop_cancel = in_stop_cancel + 1; }
  ~InStopCancel() {
    in_stop_cancel = in_stop_cancel - 1;
    errno = saved_errno_;
  }
  InStopCancel(const InStopCancel&) = delete;
  InStopCancel& operator=(const InStopCancel&) = delete;

 private:
  int saved_errno_;
};

key_t derive_sem_key(const char* excl_path, int excl_id) {
  return excl_path == nullptr || excl_id == 0 ? -1 : ftok(excl_path, excl_id);
}

}  // namespace

KPLDriver* KPLDriver::_theKPLDriver = nullptr;

KPLDriver::KPLDriver()
    : _kpl_fd(-1),
      _stopCode(0),
      sema_key(-1),
      err_detail(),
      _stopMsg(""),
      _signalWriters(0),
      _signalMsgState(kNoSignalMsg),
      _signalMsg() {
  _theKPLDriver = this;
}

KPLDriver::~KPLDriver() {
  if (_kpl_fd >= 0) close(_kpl_fd);
}

KPLDriver* KPLDriver::theKPLDriver() { return _theKPLDriver; }

// ---- Start ----

int KPLDriver::InitKPL(int syscall_restarts, const char* excl_file, int excl_id, void (*sigdanger_handler)(int)) {
  if (sigdanger_handler != nullptr) dae_init_lowps(kParents, sigdanger_handler, syscall_restarts);
  if (excl_file != nullptr) dae_init_exclusive(kParents, excl_file, static_cast<char>(excl_id));
  dae_init_prevent_zombies(kParents, syscall_restarts);
  dae_init_keep_files_open(DAE_P_KPL);
  const dae_req_sock_t routines = {stub_stopNormal, stub_stopForced, stub_stopCancel, stub_traceBegin,
                                   stub_traceEnd,   stub_refresh,    stub_longStatus, stub_otherReq};
  request_descriptor = -1;
  dae_init_KPL_sock(&request_descriptor, &routines, syscall_restarts);

  dae_parent_t parent = kParents;
  const int code = dae_init(&parent, &err_detail);
  if (code != DAE_OK) {
    sema_key = derive_sem_key(excl_file, excl_id);
    GS_TRACE(GSCL_TRC_WARNING, "dae_init failed with sema_key=%x\n", sema_key);
    return kInitFailed + code;
  }
  _kpl_fd = request_descriptor;
  GS_TRACE(GSCL_TRC_WARNING, "dae_init inited fd=%d, sema_key=%x\n", _kpl_fd, sema_key);
  return 0;
}

int KPLDriver::getKPLDescriptor() { return _kpl_fd; }

int KPLDriver::doKPLreq() {
  dae_KPL_req();
  return 0;
}

// ---- Stop code ----

int KPLDriver::getStopCode() { return std::atomic_ref(_stopCode).load(std::memory_order_acquire); }

bool KPLDriver::claimStopCode(int cd) {
  int none = 0;
  return std::atomic_ref(_stopCode).compare_exchange_strong(none, cd == 0 ? 1 : cd);
}

void KPLDriver::setStopCode(int cd, const char* msg) {
  if (in_stop_cancel != 0) return recordInSignal(cd, msg);
  WriteScope scope(_stopLocker);
  if (claimStopCode(cd)) _stopMsg = msg;
}

void KPLDriver::recordInSignal(int cd, const char* msg) {
  std::atomic_ref writers(_signalWriters);
  writers.fetch_add(1);
  if (claimStopCode(cd) && msg != nullptr) {
    const size_t length = strnlen(msg, sizeof _signalMsg - 1);
    memcpy(_signalMsg, msg, length);
    _signalMsg[length] = '\0';
    std::atomic_ref(_signalMsgState).store(kSignalMsgReady, std::memory_order_release);
  }
  writers.fetch_sub(1);
}

const char* KPLDriver::getStopMsg() {
  ReadScope scope(_stopLocker);
  const bool in_signal = std::atomic_ref(_signalMsgState).load(std::memory_order_acquire) == kSignalMsgReady;
  return in_signal ? _signalMsg : static_cast<const char*>(_stopMsg);
}

void KPLDriver::clearStopCode() {
  WriteScope scope(_stopLocker);
  if (getStopCode() != 0) {
    // While the code stands no handler records; one on another thread that has just recorded finishes first, so
    // that its text does not outlive its code.
    while (std::atomic_ref(_signalWriters).load() != 0) sched_yield();
    std::atomic_ref(_signalMsgState).store(kNoSignalMsg, std::memory_order_relaxed);
    std::atomic_ref(_stopCode).store(0);
  }
  _stopMsg = nullptr;
}

// ---- Handlers ----

void KPLDriver::stopNormal() {}
void KPLDriver::stopForced() {}
void KPLDriver::stopCancel(int) {}
void KPLDriver::traceBegin(int) {}
void KPLDriver::traceEnd() {}
void KPLDriver::refresh() {}
void KPLDriver::longStatus() {}
int KPLDriver::otherReq(short, short, short, const void*, int) { return 0; }

void KPLDriver::stub_stopNormal() {
  _theKPLDriver->stopNormal();
  if (_theKPLDriver->getStopCode() == 0) _theKPLDriver->setStopCode(-1, "stopNormal");
}

void KPLDriver::stub_stopForced() {
  _theKPLDriver->stopForced();
  if (_theKPLDriver->getStopCode() == 0) _theKPLDriver->setStopCode(-2, "stopForced");
}

void KPLDriver::stub_stopCancel(int dae_sig) {
  InStopCancel scope;
  _theKPLDriver->stopCancel(dae_sig);
  if (_theKPLDriver->getStopCode() == 0) _theKPLDriver->setStopCode(-3, "stopCancel");
}

void KPLDriver::stub_traceBegin(int trace_level) { _theKPLDriver->traceBegin(trace_level); }
void KPLDriver::stub_traceEnd() { _theKPLDriver->traceEnd(); }
void KPLDriver::stub_refresh() { _theKPLDriver->refresh(); }
void KPLDriver::stub_longStatus() { _theKPLDriver->longStatus(); }

int KPLDriver::stub_otherReq(short dae_request, short dae_parm1, short dae_parm2, const void* dae_parm3,
                             int dae_parm3_size) {
  return _theKPLDriver->otherReq(dae_request, dae_parm1, dae_parm2, dae_parm3, dae_parm3_size);
}

// ---- Output ----

int KPLDriver::inform_printf(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  const int result = dae_inform_vprintf(fmt, args);
  va_end(args);
  return result;
}

int KPLDriver::error_printf(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  const int result = dae_error_vprintf(fmt, args);
  va_end(args);
  return result;
}

int KPLDriver::inform_flush() { return dae_inform_flush(); }

int KPLDriver::print_short_status() {
  const int result = dae_status_short();
  dae_status_flush();
  return result;
}

}  // namespace zelt_gscl_V1
