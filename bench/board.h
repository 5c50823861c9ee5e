// A page of memory that the processes of one benchmark share: each reports there what it has seen and when,
// without a message that would disturb what is measured.
#pragma once

#include <fcntl.h>
#include <stdint.h>
#include <sys/mman.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <string>

namespace zn {

inline int64_t now_ns() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return now.tv_sec * 1000000000LL + now.tv_nsec;
}

/// One process's report. Everything is written before `count`, with release order.
struct alignas(64) Slot {
  std::atomic<uint64_t> count;     // events seen
  std::atomic<uint64_t> seqnum;    // of the latest
  std::atomic<int64_t> time;       // of the latest, now_ns()
  std::atomic<uint64_t> digest;    // of everything seen, in order
  std::atomic<uint64_t> errors;    // a gap in the sequence, contents that are not what was sent
  std::atomic<uint64_t> failures;  // members seen to have failed
  std::atomic<uint32_t> ready;     // joined, subscribed or connected
};

class Board {
 public:
  static constexpr int kSlots = 512;

  explicit Board(const std::string& path) {
    const int file = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    const bool sized = file >= 0 && ::ftruncate(file, kSlots * sizeof(Slot)) == 0;
    void* memory =
        sized ? ::mmap(nullptr, kSlots * sizeof(Slot), PROT_READ | PROT_WRITE, MAP_SHARED, file, 0) : MAP_FAILED;
    if (file >= 0) ::close(file);
    if (memory != MAP_FAILED) slots_ = static_cast<Slot*>(memory);
  }
  ~Board() {
    if (slots_) ::munmap(slots_, kSlots * sizeof(Slot));
  }
  Board(const Board&) = delete;
  Board& operator=(const Board&) = delete;

  bool ok() const { return slots_ != nullptr; }
  Slot& operator[](int index) { return slots_[index]; }

 private:
  Slot* slots_ = nullptr;
};

}  // namespace zn
