// What every entry point does around its work: no cancellation inside, the caller's errno back at the end.
#pragma once

#include <pthread.h>

#include <cerrno>

namespace gs::client {

/// For the whole of an entry point.
class EntryGuard {
 public:
  EntryGuard() : errno_(errno) { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &cancel_state_); }
  ~EntryGuard() {
    pthread_setcancelstate(cancel_state_, nullptr);
    errno = errno_;
  }
  EntryGuard(const EntryGuard&) = delete;
  EntryGuard& operator=(const EntryGuard&) = delete;

  int cancel_state() const { return cancel_state_; }

 private:
  int errno_;
  int cancel_state_ = PTHREAD_CANCEL_ENABLE;
};

/// Inside an entry point: a stretch in which the caller's own cancel state holds. Nothing may be held here that a
/// cancellation would leave behind.
class CancelWindow {
 public:
  explicit CancelWindow(int cancel_state) { pthread_setcancelstate(cancel_state, nullptr); }
  ~CancelWindow() { pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, nullptr); }
  CancelWindow(const CancelWindow&) = delete;
  CancelWindow& operator=(const CancelWindow&) = delete;
};

}  // namespace gs::client
