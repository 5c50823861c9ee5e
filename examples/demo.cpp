// The demonstration, in three acts. It ends with status 0 only when all that was seen is as it must be.
#include "examples/demo.h"

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>

#include "examples/processes.h"

namespace {

bool is_coloured() {
  static const bool coloured = std::getenv(zn::kColoured) || (isatty(STDOUT_FILENO) && !std::getenv("NO_COLOR"));
  return coloured;
}

/// The root of a chroot is a folder like any other: nothing is mounted on it.
bool in_chroot() {
  std::ifstream mounts("/proc/self/mountinfo");
  for (std::string line; std::getline(mounts, line);) {
    std::istringstream words(line);
    std::string id, parent, device, root, where;
    if (words >> id >> parent >> device >> root >> where && where == "/") return false;
  }
  return true;
}

}  // namespace

const char* zn::colour(const char* code) {
  static std::string escape;
  escape = std::string("\033[") + code + "m";
  return is_coloured() ? escape.c_str() : "";
}

const char* zn::colour_off() { return is_coloured() ? "\033[0m" : ""; }

void zn::say_skipped(const std::string& why) {
  if (in_chroot()) {
    std::printf(
        "skipped: you are in a chroot, where this act cannot be kept apart from your other processes; outside\n"
        "of it, or in a container, it can\n");
  } else {
    std::printf("skipped: %s\n", why.c_str());
  }
}

void zn::relay(Process& part, Clock::time_point deadline) {
  for (bool more = true; more;) {
    wait_readable({part.output()}, deadline);
    more = part.read_some();
    while (auto line = part.next_line()) {
      const bool is_command = line->rfind("$ ", 0) == 0;
      std::printf("%s%s%s\n", is_command ? colour("2") : "", line->c_str(), is_command ? colour_off() : "");
    }
    std::fflush(stdout);
  }
}

int main(int argc, char** argv) {
  const std::string part = argc == 3 ? argv[1] : "";
  if (argc != 1 && part != zn::kInside && part != zn::kOnHosts) return std::fprintf(stderr, "usage: demo\n"), 2;
  zn::catch_interrupts();
  try {
    if (part == zn::kInside) {
      zn::demo_inside(argv[2]);
    } else if (part == zn::kOnHosts) {
      zn::demo_hosts(argv[2]);
    } else {
      zn::demo_group();
      zn::demo_master();
      zn::demo_cluster();
    }
    return 0;
  } catch (const zn::Failure& failure) {
    std::fflush(stdout);
    std::fprintf(stderr, "demo: %s\n", failure.text.c_str());
    return 1;
  }
}
