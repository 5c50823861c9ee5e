// One entry of the process table, from /proc.
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include "dae/dae_failure_internal.h"

namespace {

constexpr int kFailed = -1;
constexpr size_t kTextSize = 512;

/// Reads as much of the file as fits, and terminates it. Returns 0 or -1.
int read_text(const char* path, char (&text)[kTextSize]) {
  int fd;
  do {
    fd = open(path, O_RDONLY | O_NOCTTY | O_CLOEXEC);
  } while (fd < 0 && errno == EINTR);
  if (fd < 0) return dae::fail_call(kFailed, "open");

  int result = 0;
  size_t length = 0;
  while (length < kTextSize - 1) {
    const ssize_t got = read(fd, text + length, kTextSize - 1 - length);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) result = dae::fail_call(kFailed, "read");
    if (got <= 0) break;
    length += static_cast<size_t>(got);
  }
  text[length] = '\0';
  while (close(fd) != 0 && errno == EINTR) {
  }
  return result;
}

dae_pstate_t state_of(char letter) {
  switch (letter) {
    case 'D':
    case 'R':
    case 'S':
      return DAE_PSTATE_ACTIVE;
    case 'T':
      return DAE_PSTATE_STOP;
    case 'Z':
      return DAE_PSTATE_ZOMB;
    default:
      return DAE_PSTATE_NONE;
  }
}

int parse_stat(char* text, dae_procsinfo_t* entry) {
  // The name may itself hold parentheses and blanks: the last one ends it.
  char* name_end = strrchr(text, ')');
  if (name_end == nullptr) return dae::fail_call(kFailed, "strrchr", EINVAL);
  *name_end = '\0';
  const char* rest = name_end + 1;
  if (*rest != '\0') ++rest;

  int pid;
  memset(entry->pi_comm, 0, sizeof entry->pi_comm);  // %15c does not terminate
  if (sscanf(text, "%d (%15c", &pid, entry->pi_comm) != 2) return dae::fail_call(kFailed, "sscanf", EINVAL);
  entry->pi_pid = static_cast<uint32_t>(pid);

  char state;
  int ppid, pgrp, sid, tty;
  unsigned flags;
  if (sscanf(rest, "%c %d %d %d %d %*d %u", &state, &ppid, &pgrp, &sid, &tty, &flags) != 6) {
    return dae::fail_call(kFailed, "sscanf", EINVAL);
  }
  entry->pi_ppid = static_cast<uint32_t>(ppid);
  entry->pi_pgrp = static_cast<uint32_t>(pgrp);
  entry->pi_sid = static_cast<uint32_t>(sid);
  entry->pi_ttyp = static_cast<uint32_t>(tty);
  entry->pi_flags = flags;
  entry->pi_state = state_of(state);
  return 0;
}

int parse_status(const char* text, dae_procsinfo_t* entry) {
  const char* line = strstr(text, "\nUid:");
  if (line == nullptr) return dae::fail_call(kFailed, "strstr", EINVAL);
  int uid;
  if (sscanf(line, "\nUid:\t%d", &uid) != 1) return dae::fail_call(kFailed, "sscanf", EINVAL);
  entry->pi_uid = static_cast<uint32_t>(uid);
  return 0;
}

}  // namespace

int dae_getprocs(pid_t pid, dae_procsinfo_t* dae_pip) {
  char path[40];
  char text[kTextSize];
  snprintf(path, sizeof path, "/proc/%d/stat", pid);
  if (read_text(path, text) != 0 || parse_stat(text, dae_pip) != 0) return kFailed;
  snprintf(path, sizeof path, "/proc/%d/status", pid);
  if (read_text(path, text) != 0 || parse_status(text, dae_pip) != 0) return kFailed;
  return 1;
}
