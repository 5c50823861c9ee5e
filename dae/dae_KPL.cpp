// The request channel of a daemon under the KPL master: setting it up, and serving one request.
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/msg.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "dae/dae_failure_internal.h"

namespace {

constexpr int kTypeSize = offsetof(kplreq, kplhdr);  ///< the queue's type word before the header
constexpr int kRequestSize = static_cast<int>(sizeof(kplreq)) - kTypeSize;  ///< header and sub-request
constexpr int kLargeBuffer = 2000;                                          ///< when requests may carry data
constexpr int kLastReservedAction = KPL_ACTION_SUBSYSTEM - 1;

const dae_profile_t& profile = dae_prof__INTERNAL__;

int KPL_d = -1;
char* KPL_reqbuf = nullptr;
int KPL_reqbuf_len = 0;

// ---- Setting up ----

void exit_at_once(int) { _exit(0); }

int install_cancel() {
  return dae::set_signal(SIGTERM, profile.stop_cancel_hdl, profile.stop_restart != 0 ? SA_RESTART : 0, DAE_E_KPL);
}

int bad_signals() { return dae::fail(DAE_E_KPL, "DAE_EM_KPL_SIG"); }

bool is_stop_signal(int signo) { return signo >= 0 && signo <= 30; }

struct sigaction stop_action() {
  struct sigaction action = {};
  sigemptyset(&action.sa_mask);
  if (profile.sig_stop_normal != 0) sigaddset(&action.sa_mask, profile.sig_stop_normal);
  if (profile.sig_stop_forced != 0) sigaddset(&action.sa_mask, profile.sig_stop_forced);
  action.sa_flags = profile.stop_restart != 0 ? SA_RESTART : 0;
  return action;
}

int install_stop(int signo, void (*handler)(int)) {
  struct sigaction action = stop_action();
  action.sa_handler = handler;
  return sigaction(signo, &action, nullptr) == 0 ? DAE_OK : dae::fail_call(DAE_E_KPL, "sigaction");
}

int install_stop_or_exit(int signo, void (*handler)(int)) {
  return install_stop(signo, handler != nullptr ? handler : exit_at_once);
}

int setup_stop_normal() {
  const int signo = profile.sig_stop_normal;
  void (*const handler)(int) = profile.stop_normal_hdl;
  if (signo == 0) return handler == nullptr ? DAE_OK : bad_signals();
  if (signo == SIGTERM) return handler == profile.stop_cancel_hdl ? DAE_OK : bad_signals();
  if (signo == profile.sig_stop_forced) return handler == profile.stop_forced_hdl ? DAE_OK : bad_signals();
  return install_stop_or_exit(signo, handler);
}

int setup_stop_forced() {
  const int signo = profile.sig_stop_forced;
  void (*const handler)(int) = profile.stop_forced_hdl;
  if (signo == 0) return handler == nullptr ? DAE_OK : bad_signals();
  if (signo == SIGTERM) return handler == profile.stop_cancel_hdl ? DAE_OK : bad_signals();
  return install_stop_or_exit(signo, handler);
}

int setup_signals() {
  if (!is_stop_signal(profile.sig_stop_normal) || !is_stop_signal(profile.sig_stop_forced)) return bad_signals();
  int code = setup_stop_normal();
  if (code == DAE_OK) code = setup_stop_forced();
  if (code == DAE_OK) code = install_stop(SIGTERM, profile.stop_cancel_hdl);
  return code;
}

/// Whether the process may talk to the master: either effective id is enough.
bool is_privileged() { return geteuid() == 0 || getegid() == 0; }

int allocate_buffer() {
  const bool with_data = profile.other_req != nullptr;
  KPL_reqbuf_len = with_data ? kLargeBuffer : static_cast<int>(sizeof(kplreq));
  free(KPL_reqbuf);  // of an earlier set-up
  KPL_reqbuf = static_cast<char*>(malloc(with_data ? kLargeBuffer + 1 : sizeof(kplreq)));
  return KPL_reqbuf != nullptr ? DAE_OK : dae::fail_call(DAE_E_KPL, "malloc");
}

int setup_queue() {
  if (!is_privileged()) return dae::fail(DAE_E_KPL, "DAE_EM_KPL_MSQ_PERM");
  if (const int code = allocate_buffer(); code != DAE_OK) return code;
  KPL_d = msgget(profile.msqkey, 0660);
  if (KPL_d == -1) return dae::fail_call(DAE_E_KPL, "msgget");
  return install_cancel();
}

enum FlagSet { kFileFlags = 0, kDescriptorFlags = 1 };

/// Adds a flag to one of a descriptor's two sets.
int set_file_flags(int fd, int flag_set, int flag) {
  if (flag_set != kFileFlags && flag_set != kDescriptorFlags) return dae::fail(DAE_E_KPL, "DAE_EM_FLAGSET");
  const int flags = fcntl(fd, flag_set == kFileFlags ? F_GETFL : F_GETFD);
  if (flags == -1) return dae::fail_call(DAE_E_KPL, "fcntl");
  if (fcntl(fd, flag_set == kFileFlags ? F_SETFL : F_SETFD, flags | flag) == -1) {
    return dae::fail_call(DAE_E_KPL, "fcntl");
  }
  return DAE_OK;
}

/// Moves descriptor 0 to the lowest free place from 3 up, or to the one wanted. *moved becomes the copy, also when
/// a later step fails. Returns a DAE_ code.
int move_socket(int* moved) {
  const int wanted = profile.KPL_sockd;
  if (wanted >= 0 && wanted < 3) return dae::fail(DAE_E_KPL, "DAE_EM_KPL_SOCK_FD");
  const int copy = fcntl(0, F_DUPFD, wanted >= 0 ? wanted : 3);
  if (copy == -1) return dae::fail_call(DAE_E_KPL, "fcntl");
  *moved = copy;
  if (wanted >= 0 && copy != wanted) return dae::fail(DAE_E_KPL, "DAE_EM_KPL_SOCK_DUP");
  return close(0) == 0 ? DAE_OK : dae::fail_call(DAE_E_KPL, "close");
}

int setup_socket() {
  if (!is_privileged()) return dae::fail(DAE_E_KPL, "DAE_EM_KPL_SOCK_PERM");
  if (const int code = allocate_buffer(); code != DAE_OK) return code;
  sockaddr_un name;
  socklen_t length = sizeof name;
  if (getsockname(0, reinterpret_cast<sockaddr*>(&name), &length) != 0) {
    return dae::fail_call(DAE_E_KPL, "getsockname");
  }
  int moved = -1;
  int code = move_socket(&moved);
  if (code == DAE_OK && !profile.KPL_sockd_block) code = set_file_flags(moved, kFileFlags, O_NONBLOCK);
  if (code == DAE_OK) code = set_file_flags(moved, kDescriptorFlags, FD_CLOEXEC);
  if (code != DAE_OK) {
    if (moved >= 0) close(moved);
    return code;
  }
  KPL_d = moved;
  return install_cancel();
}

int setup_transport() {
  switch (profile.KPL_comm) {
    case DAE_C_SIG:
      return setup_signals();
    case DAE_C_MSQ:
      return setup_queue();
    case DAE_C_SOCK:
      return setup_socket();
    default:
      return dae::fail(DAE_E_KPL, "DAE_EM_KPL_COMM");
  }
}

// ---- Serving ----

/// A request being served. The header is what every reply quotes.
struct Request {
  kplhdr* header;
  subreq what;
  const void* data;
  int data_len;
};

template <size_t Size>
void copy_text(char (&field)[Size], const char* text) {
  memcpy(field, text, strnlen(text, Size - 1));
}

void KPL_reply(const Request& request, int code, const char* message) {
  kplrep reply = {};
  reply.svrreply.rtncode = static_cast<short>(code);
  reply.svrreply.objtype = request.what.object;
  copy_text(reply.svrreply.objname, request.what.objname);
  if (message != nullptr) copy_text(reply.svrreply.rtnmsg, message);
  const size_t text_at = offsetof(kplrep, svrreply) + offsetof(svrreply, rtnmsg);
  const int length = static_cast<int>(text_at + strlen(reply.svrreply.rtnmsg) + 2);
  kplsrpy(request.header, reinterpret_cast<char*>(&reply), length, KPL_CONT_END);
}

void refuse(const Request& request, int code) { KPL_reply(request, code, nullptr); }

/// Runs a routine with the output channels open; returns its error text, null when it wrote none.
template <class Routine>
const char* collect_output(const Request& request, bool status, Routine run) {
  const char* error_text = nullptr;
  dae_output_open__INTERNAL__(request.header, status);
  run();
  dae_output_close__INTERNAL__(&error_text);
  return error_text;
}

void reply_collected(const Request& request, const char* error_text) {
  KPL_reply(request, error_text != nullptr ? KPL_RC_ERROR : KPL_RC_OK, error_text);
}

bool is_for_us(const Request& request) { return request.what.object == KPL_OBJECT_SUBSYSTEM; }

void serve_stop(const Request& request) {
  if (!is_for_us(request)) return refuse(request, KPL_RC_NOT_SUPPORTED);
  if (request.what.parm1 != 0 && request.what.parm1 != 1) return refuse(request, KPL_RC_BAD_REQUEST);
  void (*const stop)() = request.what.parm1 == 0 ? profile.stop_normal : profile.stop_forced;
  KPL_reply(request, KPL_RC_OK, nullptr);  // first, since there may be nobody to reply afterwards
  if (stop == nullptr) exit(0);
  stop();
}

void serve_status(const Request& request) {
  const bool is_long = request.what.parm1 == 1;
  if (!is_for_us(request) || !is_long || profile.long_status == nullptr)
    return refuse(request, KPL_RC_NOT_SUPPORTED);
  reply_collected(request, collect_output(request, true, profile.long_status));
}

void serve_trace(const Request& request) {
  if (!is_for_us(request)) return refuse(request, KPL_RC_NOT_SUPPORTED);
  if (request.what.parm2 == 1) {
    if (profile.trace_begin == nullptr) return refuse(request, KPL_RC_NOT_SUPPORTED);
    const int long_trace = request.what.parm1 == 1;
    reply_collected(request, collect_output(request, false, [=] { profile.trace_begin(long_trace); }));
  } else if (request.what.parm2 == 0) {
    if (profile.trace_end == nullptr) return refuse(request, KPL_RC_NOT_SUPPORTED);
    reply_collected(request, collect_output(request, false, profile.trace_end));
  } else {
    refuse(request, KPL_RC_BAD_REQUEST);
  }
}

void serve_refresh(const Request& request) {
  if (!is_for_us(request) || profile.refresh == nullptr) return refuse(request, KPL_RC_NOT_SUPPORTED);
  reply_collected(request, collect_output(request, false, profile.refresh));
}

void serve_other(const Request& request) {
  if (!is_for_us(request) || profile.other_req == nullptr) return refuse(request, KPL_RC_NOT_SUPPORTED);
  int result = 0;
  const char* error_text = collect_output(request, false, [&] {
    const subreq& what = request.what;
    result = profile.other_req(what.action, what.parm1, what.parm2, request.data, request.data_len);
  });
  if (result != 0) return refuse(request, KPL_RC_NOT_SUPPORTED);
  reply_collected(request, error_text);
}

void dispatch(const Request& request) {
  if (request.what.action > kLastReservedAction) return serve_other(request);
  switch (request.what.action) {
    case 0:
      return refuse(request, KPL_RC_NOT_SUPPORTED);
    case KPL_ACTION_STOP:
      return serve_stop(request);
    case KPL_ACTION_STATUS:
      return serve_status(request);
    case KPL_ACTION_TRACE:
      return serve_trace(request);
    case KPL_ACTION_REFRESH:
      return serve_refresh(request);
    default:
      return refuse(request, KPL_RC_BAD_REQUEST);
  }
}

/// Receives behind the type word; returns the bytes received, 0 or less when there is nothing.
int receive() {
  if (KPL_d < 0) return 0;
  const int room = KPL_reqbuf_len - kTypeSize;
  if (profile.KPL_comm == DAE_C_MSQ) {
    return static_cast<int>(msgrcv(KPL_d, KPL_reqbuf, room, profile.msqtype, IPC_NOWAIT | MSG_NOERROR));
  }
  if (profile.KPL_comm != DAE_C_SOCK) return 0;
  sockaddr_un sender;
  socklen_t length = sizeof sender;
  auto* sender_address = reinterpret_cast<sockaddr*>(&sender);
  return static_cast<int>(recvfrom(KPL_d, KPL_reqbuf + kTypeSize, room, 0, sender_address, &length));
}

}  // namespace

int dae_KPL_init__INTERNAL__(int* return_KPL_d) {
  KPL_d = -1;
  const int code = setup_transport();
  if (return_KPL_d != nullptr) *return_KPL_d = KPL_d;
  return code == DAE_OK ? dae_output_init__INTERNAL__() : code;
}

void dae_KPL_req() {
  dae::KeepErrno keep_errno;
  dae_detail_init__INTERNAL__(nullptr, "dae_KPL_req");
  if (!dae_process_is_the_daemon()) return;
  const int count = receive();
  if (count < kRequestSize) return;

  Request request = {};
  request.header = kplrrqs(KPL_reqbuf + kTypeSize);
  memcpy(&request.what, KPL_reqbuf + offsetof(kplreq, subreq), sizeof request.what);
  if (count > kRequestSize) {
    request.data = KPL_reqbuf + sizeof(kplreq);
    request.data_len = count - kRequestSize;
    KPL_reqbuf[kTypeSize + count] = '\0';  // there is a spare byte whenever data is taken
  }
  dispatch(request);
}
