// What the processes of a storm share in memory, and the marks of the logs that they write for the verdict.
//
// A client's log is a line for each thing that it was told or that it asked for. A provider is named by its group
// and instance number: no instance number is given twice in a life of the daemon.
//
//   S LIFE                   a session with the daemon's LIFE has begun        X HOW  it has ended: "quit", "gone"
//   J GROUP INSTANCE         a join was answered WYX_OK                        G GROUP INSTANCE  so was a goodbye
//   R GROUP INSTANCE PROTOCOL  another request was
//   E GROUP INSTANCE BY SEQNUM KIND PROTOCOL MEMBERS CHANGING STATE UPDATED REST
//                            an event: KIND n, a or r (phase, approval, rejection), UPDATED 1: a new state value
//   A GROUP INSTANCE SUMMARY an announcement                  D GROUP INSTANCE PROTOCOL RC  a delayed error
//   B GROUP SUBSCRIBER       a subscription was answered WYX_OK
//   T GROUP SUBSCRIBER SEQNUM TYPE MEMBERS CHANGING STATE     a subscription notification
//
// MEMBERS and CHANGING are instance numbers with commas between them, "-": none; STATE is a hash, "-": none.
#pragma once

#include <fcntl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <atomic>
#include <string>

namespace storm {

constexpr int kGroups = 6;

/// In a file, mapped by every process; all zero at first.
struct Board {
  std::atomic<int> life;  // of the daemon: raised between the end of one and the start of the next
  std::atomic<int> last_instance[kGroups];
};

/// Null: it cannot be had. It stays mapped until the process ends.
inline Board* map_board(const std::string& folder) {
  const int file = ::open((folder + "/board").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  const bool sized = file >= 0 && ::ftruncate(file, sizeof(Board)) == 0;
  void* memory = sized ? ::mmap(nullptr, sizeof(Board), PROT_READ | PROT_WRITE, MAP_SHARED, file, 0) : MAP_FAILED;
  if (file >= 0) ::close(file);
  return memory == MAP_FAILED ? nullptr : static_cast<Board*>(memory);
}

}  // namespace storm
