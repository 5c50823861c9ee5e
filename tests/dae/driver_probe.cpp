// A KPLDriver daemon for the tests. Usage: driver_probe REPORT-ADDRESS plain|own [EXCL-PATH]
//
// Reports how it started, "stop CODE TEXT" for each stop code, which it then clears, and what its handlers got.
// Commands: again, exit.
#include <signal.h>
#include <stdlib.h>

#include <memory>
#include <optional>
#include <sstream>

#include "datagram.h"
#include "gscl/GSDebug.h"
#include "gscl/KPLDriver.h"

namespace {

std::string report_to;
std::string traced;

void report(const std::string& text) { Datagram().send(report_to, text); }

/// Lets the probe see what a driver keeps to itself.
class PlainDriver : public zelt_gscl_V1::KPLDriver {
 public:
  int key() const { return sema_key; }
  const char* error() const { return err_detail.dae_error_string; }
};

class OwnDriver : public PlainDriver {
 public:
  void stopForced() override { setStopCode(7, "own reason"); }
  void stopCancel(int signo) override { setStopCode(signo, "own cancel"); }
  void traceBegin(int dae_long) override { report("traceBegin " + std::to_string(dae_long)); }
  void traceEnd() override { report("traceEnd"); }
  void refresh() override { report("refresh"); }
  void longStatus() override {
    dae_status_puts("own line\n");
    print_short_status();
  }
  int otherReq(short request, short parm1, short parm2, const void* data, int size) override {
    inform_printf("%d %d %d %.*s", request, parm1, parm2, size, static_cast<const char*>(data));
    inform_flush();
    if (parm1 == 1) error_printf("refused by %s", "me");
    return parm2;
  }
};

/// Starts, and reports under `label`; the socket for commands is opened afterwards, since start-up closes
/// descriptors.
int start(PlainDriver* driver, const std::string& label, const char* excl_path,
          std::optional<Datagram>* commands) {
  const int code = driver->InitKPL(1, excl_path, 'd', nullptr);
  if (!commands->has_value()) commands->emplace();
  std::ostringstream text;
  text << label << " code=" << code << " fd=" << driver->getKPLDescriptor() << " key=" << driver->key()
       << " commands=" << (*commands)->name() << " error=" << traced << driver->error();
  report(text.str());
  return code;
}

[[noreturn]] void run(PlainDriver* driver, const char* excl_path, std::optional<Datagram>* commands) {
  sigset_t term;
  sigset_t none;
  sigemptyset(&none);
  sigemptyset(&term);
  sigaddset(&term, SIGTERM);
  sigprocmask(SIG_BLOCK, &term, nullptr);
  for (;;) {
    if (driver->getStopCode() != 0) {
      report("stop " + std::to_string(driver->getStopCode()) + " " + driver->getStopMsg());
      driver->clearStopCode();
    }
    pollfd entries[] = {{driver->getKPLDescriptor(), POLLIN, 0}, {(*commands)->fd(), POLLIN, 0}};
    if (ppoll(entries, 2, nullptr, &none) < 0) continue;
    if (entries[0].revents != 0) PlainDriver::doKPLreq();
    if (entries[1].revents == 0) continue;
    const std::string command = (*commands)->receive();
    if (command == "again") start(driver, "again", excl_path, commands);
    if (command == "exit") exit(0);
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) return 2;
  report_to = argv[1];
  const char* excl_path = argc > 3 ? argv[3] : nullptr;
  GSSetDebugLevel(GSCL_TRC_WARNING);
  GSSetTraceRtn([](int, char* text) { traced = text; });
  std::unique_ptr<PlainDriver> driver;
  if (std::string(argv[2]) == "own") {
    driver = std::make_unique<OwnDriver>();
  } else {
    driver = std::make_unique<PlainDriver>();
  }
  std::optional<Datagram> commands;
  if (const int code = start(driver.get(), "init", excl_path, &commands); code != 0) return code - 1000;
  run(driver.get(), excl_path, &commands);
}
