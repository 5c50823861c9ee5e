#include "daemon/memory_reserve.h"

#include <cstdlib>
#include <new>
#include <utility>

namespace gs::daemon::memory_reserve {
namespace {

constexpr std::size_t kBytes = 16 * 1024 * 1024;  // far more than any one event needs; never touched
void* volatile reserve = nullptr;

void give_way() {
  if (reserve == nullptr) throw std::bad_alloc();
  free(reserve);
  reserve = nullptr;
}

}  // namespace

void hold() {
  refill();
  std::set_new_handler(give_way);
}

bool taken() { return reserve == nullptr; }

bool refill() {
  if (reserve == nullptr) reserve = malloc(kBytes);
  return reserve != nullptr;
}

}  // namespace gs::daemon::memory_reserve
