#include "daemon/peer_process.h"

#include <sys/socket.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <fstream>
#include <sstream>
#include <string>

#include "common/peer.h"

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace gs::daemon {
namespace {

using platform::Descriptor;
using std::chrono::milliseconds;

/// Nothing: there is no such process.
std::optional<milliseconds> start_of(int pid) {
  std::ifstream file("/proc/" + std::to_string(pid) + "/stat");
  std::string line;
  if (!std::getline(file, line)) return std::nullopt;
  const auto name_end = line.rfind(')');  // the name may have anything in it
  if (name_end == std::string::npos) return std::nullopt;
  std::istringstream fields(line.substr(name_end + 1));
  constexpr int kFieldsBefore = 19;  // from the state to the start
  std::string skipped;
  for (int i = 0; i < kFieldsBefore; ++i) fields >> skipped;
  long long ticks = 0;
  if (!(fields >> ticks)) return std::nullopt;
  return milliseconds(ticks * 1000 / sysconf(_SC_CLK_TCK));
}

/// For kernels that know the process by its number only.
std::optional<Descriptor> process_by_number(int socket, milliseconds connected) {
  const auto peer = platform::peer_of(socket);
  if (!peer || peer->pid <= 0) return Descriptor();
  Descriptor process(static_cast<int>(syscall(SYS_pidfd_open, peer->pid, 0)));
  if (!process) return errno == ESRCH ? std::nullopt : std::optional<Descriptor>(std::in_place);
  // Asked after the descriptor was opened: while that names a process, no other one gets its number.
  const auto start = start_of(peer->pid);
  if (!start) return Descriptor();
  return *start > connected ? std::nullopt : std::optional(std::move(process));
}

}  // namespace

milliseconds time_since_boot() {
  timespec now{};
  clock_gettime(CLOCK_BOOTTIME, &now);
  return std::chrono::seconds(now.tv_sec) + milliseconds(now.tv_nsec / 1'000'000);
}

std::optional<Descriptor> process_of_peer(int socket, milliseconds connected) {
  int fd = -1;
  socklen_t length = sizeof fd;
  if (getsockopt(socket, SOL_SOCKET, SO_PEERPIDFD, &fd, &length) == 0) return Descriptor(fd);
  if (errno == ESRCH) return std::nullopt;
  return process_by_number(socket, connected);
}

}  // namespace gs::daemon
