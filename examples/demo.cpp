// The demonstration, in two acts. It ends with status 0 only when all that was seen is as it must be.
#include "examples/demo.h"

#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include "examples/processes.h"

namespace {

bool is_coloured() {
  static const bool coloured = isatty(STDOUT_FILENO) && !std::getenv("NO_COLOR");
  return coloured;
}

}  // namespace

const char* zn::colour(const char* code) {
  static std::string escape;
  escape = std::string("\033[") + code + "m";
  return is_coloured() ? escape.c_str() : "";
}

const char* zn::colour_off() { return is_coloured() ? "\033[0m" : ""; }

int main(int argc, char** argv) {
  const bool is_inside = argc == 3 && std::string(argv[1]) == zn::kInside;
  if (argc != 1 && !is_inside) return std::fprintf(stderr, "usage: demo\n"), 2;
  zn::catch_interrupts();
  try {
    if (is_inside) {
      zn::demo_inside(argv[2]);
      return 0;
    }
    zn::demo_group();
    zn::demo_master();
    return 0;
  } catch (const zn::Failure& failure) {
    std::fflush(stdout);
    std::fprintf(stderr, "demo: %s\n", failure.text.c_str());
    return 1;
  }
}
