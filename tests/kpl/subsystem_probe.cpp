// A subsystem for the tests. Usage: subsystem_probe LOG socket|queue=KEY,TYPE|signals [silent]
//
// Appends a line to LOG for its start and for everything it is asked; silent: never reads its requests.
// Its own requests: 256 crashes, 257 echoes its data, 258 fails, 259 is not supported, 300 sets the number of
// lines (first parameter) of its long status.
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include "dae/dae.h"

namespace {

int log_fd = -1;
int request_fd = -1;
int status_lines = 0;

/// Also in signal handlers.
void note(const char* text) {
  if (write(log_fd, text, strlen(text)) < 0) _exit(9);
}

template <bool Forced>
void stop_now() {
  note(Forced ? "stop forced\n" : "stop normal\n");
  exit(0);
}
template <bool Forced>
void on_stop_signal(int) {
  note(Forced ? "stop forced\n" : "stop normal\n");
  _exit(0);
}
void on_cancel(int) {
  note("cancel\n");
  _exit(0);
}

void long_status() {
  dae_margin_puts(8, "lines");
  dae_status_printf("%d are 100%%\n", status_lines);
  for (int i = 1; i < status_lines; ++i) dae_status_printf("line %d\n", i);
}

int other_request(short request, short parm1, short parm2, const void* data, int data_len) {
  if (request == 256) kill(getpid(), SIGKILL);
  if (request == 257) dae_inform_printf("%d %d %.*s", parm1, parm2, data_len, static_cast<const char*>(data));
  if (request == 258) dae_error_puts("50% failed");
  if (request == 300) status_lines = parm1;
  return request == 259 ? 1 : 0;
}

constexpr dae_req_sock_t kRoutines = {
    stop_now<false>,
    stop_now<true>,
    on_cancel,
    [](int is_long) { note(is_long != 0 ? "trace on long\n" : "trace on\n"); },
    [] { note("trace off\n"); },
    [] { note("refresh\n"); },
    long_status,
    other_request,
};

void set_transport(const std::string& transport) {
  if (transport == "socket") return dae_init_KPL_sock(&request_fd, &kRoutines, 1);
  if (transport == "signals") {
    const dae_req_sig_t routines = {on_stop_signal<false>, on_stop_signal<true>, on_cancel};
    return dae_init_KPL_sig(SIGUSR1, SIGUSR2, &routines, 1);
  }
  const std::string place = transport.substr(strlen("queue="));
  dae_init_KPL_msq(&request_fd, std::stoi(place), std::stoi(place.substr(place.find(',') + 1)), &kRoutines, 1);
}

/// A queue cannot be waited for: it is looked at again and again.
[[noreturn]] void serve(const std::string& transport, bool silent) {
  for (;;) {
    if (silent || transport == "signals") pause();
    pollfd entry = {transport == "socket" ? request_fd : -1, POLLIN, 0};
    poll(&entry, 1, transport == "socket" ? -1 : 2);
    if (!silent) dae_KPL_req();
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) return 2;
  const std::string transport = argv[2];
  set_transport(transport);
  dae_parent_t parent = DAE_P_KPL;
  dae_error_detail_t detail;
  const int code = dae_init(&parent, &detail);
  log_fd = open(argv[1], O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
  if (code != 0) {
    note(detail.dae_error_string);
    return code;
  }
  char* name = dae_subsysname();
  const std::string start = "started as " + std::string(name != nullptr ? name : "nobody") + "\n";
  free(name);
  note(start.c_str());
  serve(transport, argc > 3);
}
