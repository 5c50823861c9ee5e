#include "daemon/memory_reserve.h"

#include <atomic>
#include <cstddef>
#include <cstdlib>
#include <new>
#include <utility>

namespace gs::daemon::memory_reserve {
namespace {

// Together far more than any one event needs. In small parts: what clients give back lies scattered, and where the
// address space is limited nothing else is to be had.
struct Part {
  Part* next;
  std::byte unused[32 * 1024 - sizeof(Part*)];
};
constexpr int kParts = 512;
std::atomic<Part*> reserve = nullptr;  // any thread may run out of memory

void release(Part* parts) {
  while (parts != nullptr) free(std::exchange(parts, parts->next));
}

void give_way() {
  Part* const taken = reserve.exchange(nullptr);
  if (taken == nullptr) throw std::bad_alloc();
  release(taken);
}

}  // namespace

void hold() {
  refill();
  std::set_new_handler(give_way);
}

bool taken() { return reserve == nullptr; }

bool refill() {
  if (!taken()) return true;
  Part* parts = nullptr;
  for (int i = 0; i < kParts; ++i) {
    auto* part = static_cast<Part*>(malloc(sizeof(Part)));
    if (part == nullptr) {
      release(parts);
      return false;
    }
    part->next = parts;
    parts = part;
  }
  release(reserve.exchange(parts));
  return true;
}

}  // namespace gs::daemon::memory_reserve
