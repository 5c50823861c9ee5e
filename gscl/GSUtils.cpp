#include "gscl/GSUtils.h"

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <memory>
#include <new>

#include "zn_cu.h"

namespace {

struct ThreadBuffer {
  int size;   // bytes allocated, 0 when none
  char* buf;  // from malloc, null when none
};

/// A thread's buffers. Their number is kept with them, so that a later initialisation does not change what a
/// thread's end has to free.
struct ThreadBuffers {
  unsigned int count;
  ThreadBuffer* slots;
};

int thr_buf_entries = 0;
pthread_key_t thr_buf_key;
int thr_buf_ok = 0;

void release(ThreadBuffer& slot) {
  free(slot.buf);
  slot = ThreadBuffer{0, nullptr};
}

/// The calling thread's buffer, null when there is no such one or no memory for the slots.
ThreadBuffer* find_slot(unsigned int idx) {
  if (thr_buf_ok == 0 || idx >= static_cast<unsigned int>(thr_buf_entries)) return nullptr;
  auto* buffers = static_cast<ThreadBuffers*>(pthread_getspecific(thr_buf_key));
  if (buffers != nullptr) return &buffers->slots[idx];

  const auto count = static_cast<unsigned int>(thr_buf_entries);
  std::unique_ptr<ThreadBuffer[]> slots(new (std::nothrow) ThreadBuffer[count]());
  std::unique_ptr<ThreadBuffers> made(new (std::nothrow) ThreadBuffers{count, slots.get()});
  if (slots == nullptr || made == nullptr || pthread_setspecific(thr_buf_key, made.get()) != 0) return nullptr;
  slots.release();
  return &made.release()->slots[idx];
}

}  // namespace

namespace zelt_gscl {

int gscl_find_membership(const wyx_membership_t* mbrship, const wyx_provider_t& id) {
  if (mbrship == nullptr || mbrship->gs_providers == nullptr) return -1;
  for (unsigned int i = 0; i < mbrship->gs_count; i++) {
    if (mbrship->gs_providers[i] == id) return static_cast<int>(i);
  }
  return -1;
}

wyx_membership_t* gscl_clone_membership(const wyx_membership_t* mbrship) {
  auto clone = std::make_unique<wyx_membership_t>();
  if (mbrship == nullptr || mbrship->gs_count == 0 || mbrship->gs_providers == nullptr) return clone.release();
  clone->gs_providers = new wyx_provider_t[mbrship->gs_count];
  std::copy_n(mbrship->gs_providers, mbrship->gs_count, clone->gs_providers);
  clone->gs_count = mbrship->gs_count;
  return clone.release();
}

void gscl_delete_membership(wyx_membership_t* mbrship) {
  if (mbrship == nullptr) return;
  delete[] mbrship->gs_providers;
  mbrship->gs_providers = nullptr;
  mbrship->gs_count = 0;
}

int gscl_thr_specific_init_buffer(int max_entries) {
  pthread_key_t key;
  if (max_entries < 0 || pthread_key_create(&key, gscl_thr_buf_cleanup) != 0) return 0;
  thr_buf_entries = max_entries;
  thr_buf_key = key;
  thr_buf_ok = 1;
  return 1;
}

char* gscl_thr_specific_realloc_buffer(unsigned int idx, unsigned int size) {
  ThreadBuffer* slot = find_slot(idx);
  if (slot == nullptr || size > static_cast<unsigned int>(INT_MAX)) return nullptr;
  if (size == 0) {
    release(*slot);
    return nullptr;
  }
  if (static_cast<unsigned int>(slot->size) >= size) return slot->buf;
  char* grown = static_cast<char*>(realloc(slot->buf, size));
  if (grown == nullptr) return nullptr;
  *slot = ThreadBuffer{static_cast<int>(size), grown};
  return grown;
}

int gscl_thr_specific_free_buffer(unsigned int idx) {
  if (idx >= static_cast<unsigned int>(thr_buf_entries)) return -1;
  ThreadBuffer* slot = find_slot(idx);
  if (slot != nullptr) release(*slot);
  return 0;
}

void gscl_thr_buf_cleanup(void* area) {
  auto* buffers = static_cast<ThreadBuffers*>(area);
  if (buffers == nullptr) return;
  for (unsigned int i = 0; i < buffers->count; i++) release(buffers->slots[i]);
  delete[] buffers->slots;
  delete buffers;
}

gscl_thread_t gscl_thread_self() { return pthread_self(); }

timespec* GSGetAbsTime(timespec* abstime, int secs, int usecs) {
  if (secs == -1) {
    abstime->tv_sec = 0xffffffffL;
    abstime->tv_nsec = 0;
    return nullptr;
  }
  constexpr long kSecond = 1000000000;  // in nanoseconds
  cu_get_current_time_1(abstime);
  const long nanoseconds = abstime->tv_nsec + usecs * 1000L;
  long carry = nanoseconds / kSecond;
  if (nanoseconds % kSecond < 0) carry--;
  abstime->tv_sec += secs + carry;
  abstime->tv_nsec = nanoseconds - carry * kSecond;
  return abstime;
}

}  // namespace zelt_gscl

namespace zelt_gscl_V1 {

int gscl_find_membership(const wyx_membership_t* mbrship, const wyx_provider_t& id) {
  return zelt_gscl::gscl_find_membership(mbrship, id);
}

wyx_membership_t* gscl_clone_membership(const wyx_membership_t* mbrship) {
  return zelt_gscl::gscl_clone_membership(mbrship);
}

void gscl_delete_membership(wyx_membership_t* mbrship) { zelt_gscl::gscl_delete_membership(mbrship); }

timespec* GSGetAbsTime(timespec* abstime, int secs, int usecs) {
  return zelt_gscl::GSGetAbsTime(abstime, secs, usecs);
}

}  // namespace zelt_gscl_V1
