// What a process has one of, and what becomes of it in the child of a fork: nothing there is the child's.
#pragma once

#include "client/mutex.h"

namespace gs::client {

/// Guards what the process has one of. Bookkeeping only, and nothing is taken under it. A fork holds it, so that
/// the child finds it free and what it guards whole; every other lock of the library may be lost in the child.
extern Mutex& process_mutex;

/// What was made in another generation than this process's is an ancestor's.
unsigned fork_generation();

/// A descriptor that the library owns, closed with the object, on exec, and never one of the standard ones. In the
/// child of a fork the number stays valid for good, but names nothing of the parent's: it is never readable.
class Descriptor {
 public:
  /// Takes `fd` over; negative: none, and errno is left as it is. Throws std::bad_alloc when forks cannot be
  /// watched.
  explicit Descriptor(int fd);
  ~Descriptor();
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;

  int get() const { return fd_; }
  /// Lets go of what it names: the number stays valid and is never readable.
  void silence();

 private:
  friend void let_go_in_child();

  const int fd_;
  Descriptor* next_ GS_GUARDED_BY(process_mutex) = nullptr;
  Descriptor** link_ GS_GUARDED_BY(process_mutex) = nullptr;  // what points at this one; null: an ancestor's
};

}  // namespace gs::client
