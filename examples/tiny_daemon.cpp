// A whole daemon: counts ticks until it is asked to stop. Started from a shell or by systemd, SIGTERM stops it;
// under the KPL master it answers status, trace, refresh, a request of its own (256: adds its data's length) and
// stop.
//
//   tiny_daemon LOCK-FILE        one instance for each lock file, which must exist
#include <errno.h>
#include <poll.h>
#include <syslog.h>

#include <cstdio>

#include "gscl/KPLDriver.h"

class TinyDaemon : public zelt_gscl_V1::KPLDriver {
 public:
  void tick() { ticks_ += step_; }
  const char* why_not() const { return err_detail.dae_error_string; }

 private:
  void traceBegin(int dae_long) override { inform_printf("tracing%s\n", dae_long ? " everything" : ""); }
  void refresh() override { step_ = 1; }
  void longStatus() override {
    print_short_status();  // what the master knows of us comes first
    dae_margin_puts(10, "ticks");
    dae_status_printf("%ld, %ld at a time\n", ticks_, step_);
  }
  int otherReq(short request, short, short, const void*, int size) override {
    if (request != 256) return 1;
    if (size == 0) error_printf("nothing to add\n");
    step_ += size;
    return 0;
  }

  long ticks_ = 0;
  long step_ = 1;
};

int main(int argc, char** argv) {
  if (argc != 2) return std::fprintf(stderr, "usage: tiny_daemon LOCK-FILE\n"), 2;
  TinyDaemon daemon;
  openlog("tiny_daemon", LOG_PERROR, LOG_DAEMON);  // a daemon has no standard error, a refused one still may
  if (const int code = daemon.InitKPL(0, argv[1], 't', nullptr); code != 0) {
    syslog(LOG_ERR, "not started (%d): %s", code - 1000, daemon.why_not());
    return 1;
  }
  while (daemon.getStopCode() == 0) {
    pollfd request = {daemon.getKPLDescriptor(), POLLIN, 0};  // -1, and left out, when KPL is not the parent
    const int ready = poll(&request, 1, 100);                 // SIGTERM ends it, or is seen within a tick
    if (ready > 0) daemon.doKPLreq();
    if (ready == 0) daemon.tick();
    if (ready < 0 && errno != EINTR) return 1;
  }
  syslog(LOG_NOTICE, "stopped (%d): %s", daemon.getStopCode(), daemon.getStopMsg());
  return 0;
}
