// Runs a function in a forked process and collects what it writes: for state that a process sets only once.
#pragma once

#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>

struct FreshOutput {
  int status;       // as waitpid gives it; 0 when the function came to its end
  std::string out;  // standard output
  std::string err;  // standard error
};

namespace fresh_process_detail {

inline std::string contents(FILE* file) {
  std::string text;
  char part[4096];
  rewind(file);
  for (size_t n; (n = fread(part, 1, sizeof(part), file)) > 0;) text.append(part, n);
  fclose(file);
  return text;
}

}  // namespace fresh_process_detail

/// To be called while the process has one thread. The function answers by writing; GoogleTest's checks in it are
/// lost.
template <class Function>
FreshOutput in_fresh_process(Function function) {
  FILE* out = tmpfile();
  FILE* err = tmpfile();
  if (out == nullptr || err == nullptr) return {-1, "", "no temporary file"};
  fflush(nullptr);
  const pid_t child = fork();
  if (child == 0) {
    dup2(fileno(out), STDOUT_FILENO);
    dup2(fileno(err), STDERR_FILENO);
    function();
    fflush(nullptr);
    _exit(0);
  }
  int status = -1;
  waitpid(child, &status, 0);
  return {status, fresh_process_detail::contents(out), fresh_process_detail::contents(err)};
}
