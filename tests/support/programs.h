// Programs as tests run them: what they say goes to files, and every wait has a bound.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

#include "examples/processes.h"

namespace test_support {

/// What a program that ended left.
struct Outcome {
  int status = -1;  // exit status; -1: killed by a signal
  std::string out;
  std::string err;
};
Outcome run(const std::vector<std::string>& command);

/// Output is appended to the files. `given`, where there is one, becomes descriptor `as` of the program.
pid_t spawn(std::vector<std::string> command, const std::string& out, const std::string& err, int given = -1,
            int as = -1);
/// Its exit status; -1: a signal ended it, or this call did.
int wait_for_exit(pid_t pid);

using zn::content_of;

/// False: still not after a long time.
bool wait_until(const std::function<bool()>& done);

}  // namespace test_support
