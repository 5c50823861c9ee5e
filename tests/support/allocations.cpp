#include "tests/support/allocations.h"

#include <cstdlib>
#include <new>

namespace {

thread_local long made = 0;
thread_local int left = -1;  // allocations that still succeed; negative: no limit

}  // namespace

namespace allocations {

long count() { return made; }

Refuse::Refuse(int after) { left = after; }

Refuse::~Refuse() { left = -1; }

}  // namespace allocations

#if !ZN_THREAD_SANITIZER

namespace {

void* take(size_t size) noexcept {
  if (left == 0) return nullptr;
  if (left > 0) left--;
  made++;
  return std::malloc(size == 0 ? 1 : size);
}

void* take_or_throw(size_t size) {
  void* area = take(size);
  if (area == nullptr) throw std::bad_alloc();
  return area;
}

}  // namespace

void* operator new(size_t size) { return take_or_throw(size); }
void* operator new[](size_t size) { return take_or_throw(size); }
void* operator new(size_t size, const std::nothrow_t&) noexcept { return take(size); }
void* operator new[](size_t size, const std::nothrow_t&) noexcept { return take(size); }
void operator delete(void* area) noexcept { std::free(area); }
void operator delete[](void* area) noexcept { std::free(area); }
void operator delete(void* area, size_t) noexcept { std::free(area); }
void operator delete[](void* area, size_t) noexcept { std::free(area); }

#endif
