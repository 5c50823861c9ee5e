#include "client/fork.h"

#include <fcntl.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <new>

namespace gs::client {
namespace {

/// Other threads may still use it while the process ends.
template <typename T>
union NeverDestroyed {
  constexpr NeverDestroyed() : value() {}
  ~NeverDestroyed() {}
  T value;
};

constinit NeverDestroyed<Mutex> the_mutex;
constinit std::atomic<unsigned> generation = 0;

}  // namespace

constinit Mutex& process_mutex = the_mutex.value;

namespace {

constinit Descriptor* first_descriptor GS_GUARDED_BY(process_mutex) = nullptr;

void hold() ZN_ANNOTATION(no_thread_safety_analysis) { process_mutex.lock(); }
void release() ZN_ANNOTATION(no_thread_safety_analysis) { process_mutex.unlock(); }

int above_standard(int fd) {
  if (fd < 0 || fd > STDERR_FILENO) return fd;
  const int moved = fcntl(fd, F_DUPFD_CLOEXEC, STDERR_FILENO + 1);
  const int error = errno;
  close(fd);
  errno = error;
  return moved;
}

}  // namespace

/// Runs in the child, whose only thread holds the mutex.
void let_go_in_child() ZN_ANNOTATION(no_thread_safety_analysis) {
  generation.fetch_add(1, std::memory_order_relaxed);
  while (Descriptor* descriptor = first_descriptor) {
    descriptor->silence();
    first_descriptor = descriptor->next_;
    descriptor->link_ = nullptr;
  }
  process_mutex.unlock();
}

namespace {

const bool forks_watched = pthread_atfork(hold, release, let_go_in_child) == 0;

}  // namespace

unsigned fork_generation() { return generation.load(std::memory_order_relaxed); }

Descriptor::Descriptor(int fd) : fd_(above_standard(fd)) {
  if (!forks_watched) {
    if (fd_ >= 0) close(fd_);
    throw std::bad_alloc();
  }
  MutexLock lock(process_mutex);
  next_ = first_descriptor;
  link_ = &first_descriptor;
  if (next_ != nullptr) next_->link_ = &next_;
  first_descriptor = this;
}

/// An ancestor's number is left alone: the application may have put something of its own there. Closed under the
/// lock, or a fork would hand on what no list knows any more.
Descriptor::~Descriptor() {
  MutexLock lock(process_mutex);
  if (link_ == nullptr) return;
  *link_ = next_;
  if (next_ != nullptr) next_->link_ = link_;
  if (fd_ >= 0) close(fd_);
}

void Descriptor::silence() {
  if (fd_ < 0) return;
  const int quiet = eventfd(0, EFD_CLOEXEC);
  if (quiet < 0) {
    close(fd_);  // no descriptor is left: letting go comes first
    return;
  }
  dup3(quiet, fd_, O_CLOEXEC);
  close(quiet);
}

}  // namespace gs::client
