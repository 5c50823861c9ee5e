#include "daemon/memory_reserve.h"

#include <atomic>
#include <cstdlib>
#include <new>

namespace gs::daemon::memory_reserve {
namespace {

constexpr std::size_t kBytes = 16 * 1024 * 1024;  // far more than any one event needs; never touched
std::atomic<void*> reserve = nullptr;             // any thread may run out of memory

void give_way() {
  void* const taken = reserve.exchange(nullptr);
  if (taken == nullptr) throw std::bad_alloc();
  free(taken);
}

}  // namespace

void hold() {
  refill();
  std::set_new_handler(give_way);
}

bool taken() { return reserve == nullptr; }

bool refill() {
  if (taken()) free(reserve.exchange(malloc(kBytes)));
  return !taken();
}

}  // namespace gs::daemon::memory_reserve
