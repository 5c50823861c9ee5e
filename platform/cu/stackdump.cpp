// Stack dumps of the registered threads when a fatal signal ends the process.
//
// What runs in signal handlers touches only the slot table (atomics), the stack and write(2). A thread's stack can
// be walked only by the thread itself, so the one that got the signal asks the others, one at a time, through a
// real-time signal whose action it takes at that moment: until then the signal is the application's.
#include <errno.h>
#include <execinfo.h>
#include <poll.h>
#include <signal.h>
#include <stdint.h>
#include <string.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <array>
#include <atomic>

#include "zn_cu.h"

namespace {

constexpr size_t kAlternateStack = 64 * 1024;
constexpr int kMaxFrames = 64;
constexpr int64_t kAnswerMs = 1000;      // for one thread
constexpr int64_t kAllAnswersMs = 5000;  // for all of them, and for a second fatal signal in another thread
constexpr pid_t kFree = 0;
constexpr pid_t kBusy = -1;  // being filled or emptied

struct Slot {
  std::atomic<pid_t> tid{kFree};  // written last when filled, first when emptied
  std::atomic<pid_t> pid{0};      // a forked child has the table but not the threads
  std::atomic<pthread_t> thread{};
};

std::array<Slot, 4096> slots;
std::atomic<pid_t> dumper{0};    // the thread that dumps; the first fatal signal decides
std::atomic<pid_t> asked{0};     // the thread that is to answer now
std::atomic<pid_t> answered{0};  // the thread that has answered last

pid_t ownTid() { return static_cast<pid_t>(syscall(SYS_gettid)); }

int64_t nowMs() {
  timespec now = {};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return now.tv_sec * int64_t{1000} + now.tv_nsec / 1000000;
}

// ---------------------------------------------------------------------------------------------------------
// Inside the handlers

// A line put together without the heap; what does not fit is cut.
class Line {
 public:
  Line& text(const char* s) {
    while (*s != '\0' && _used < sizeof(_bytes)) _bytes[_used++] = *s++;
    return *this;
  }
  Line& number(long value) {
    char digits[24];
    size_t n = 0;
    do digits[n++] = static_cast<char>('0' + value % 10);
    while ((value /= 10) > 0);
    while (n > 0 && _used < sizeof(_bytes)) _bytes[_used++] = digits[--n];
    return *this;
  }
  void write() {
    for (size_t done = 0; done < _used;) {
      const ssize_t n = ::write(STDERR_FILENO, _bytes + done, _used - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return;
      done += static_cast<size_t>(n);
    }
  }

 private:
  char _bytes[160];
  size_t _used = 0;
};

const char* signalName(int sig) {
  switch (sig) {
    case SIGSEGV:
      return "SIGSEGV";
    case SIGBUS:
      return "SIGBUS";
    case SIGFPE:
      return "SIGFPE";
    case SIGILL:
      return "SIGILL";
    default:
      return "SIGABRT";
  }
}

void writeOwnBacktrace() {
  Line().text("stack of thread ").number(ownTid()).text(":\n").write();
  void* frames[kMaxFrames];
  backtrace_symbols_fd(frames, backtrace(frames, kMaxFrames), STDERR_FILENO);
}

void onAsked(int) {
  const int savedErrno = errno;
  const pid_t self = ownTid();
  if (asked.load() == self) {
    writeOwnBacktrace();
    answered.store(self);
  }
  errno = savedErrno;
}

bool waitForAnswer(pid_t tid, int64_t deadline) {
  while (answered.load() != tid) {
    if (nowMs() >= deadline) return false;
    poll(nullptr, 0, 2);
  }
  return true;
}

void askThread(pid_t tid, int64_t deadline) {
  asked.store(tid);
  if (syscall(SYS_tgkill, getpid(), tid, SIGRTMAX) != 0) return;
  if (waitForAnswer(tid, deadline)) return;
  Line().text("stack of thread ").number(tid).text(": no answer\n").write();
}

void dumpAll(int sig, pid_t self) {
  const int64_t start = nowMs();
  Line()
      .text("fatal signal ")
      .number(sig)
      .text(" (")
      .text(signalName(sig))
      .text(") in thread ")
      .number(self)
      .text("\n")
      .write();
  writeOwnBacktrace();

  struct sigaction action = {};
  action.sa_handler = onAsked;
  action.sa_flags = SA_ONSTACK | SA_RESTART;
  sigaction(SIGRTMAX, &action, nullptr);
  for (const Slot& slot : slots) {
    const pid_t tid = slot.tid.load();
    if (tid <= 0 || tid == self || slot.pid.load() != getpid()) continue;
    const int64_t now = nowMs();
    const int64_t left = start + kAllAnswersMs - now;
    askThread(tid, now + (left < kAnswerMs ? left : kAnswerMs));
  }
}

// A second fatal signal: in the dumping thread it came from the dump itself, which is then over; another thread
// lets the dump go on and meanwhile answers it.
void waitForDumper(pid_t self) {
  const int64_t deadline = nowMs() + 2 * kAllAnswersMs;
  while (dumper.load() != self && nowMs() < deadline) poll(nullptr, 0, 20);
}

void onFatal(int sig) {
  const pid_t self = ownTid();
  pid_t nobody = 0;
  if (dumper.compare_exchange_strong(nobody, self)) {
    dumpAll(sig, self);
  } else {
    waitForDumper(self);
  }
  struct sigaction action = {};
  action.sa_handler = SIG_DFL;
  sigaction(sig, &action, nullptr);
  raise(sig);  // blocked until this handler returns
}

// ---------------------------------------------------------------------------------------------------------
// Registration

bool takeOverFatalSignals() {
  // The first backtrace of a process loads the unwinder, which no handler should have to do.
  void* frame = nullptr;
  backtrace(&frame, 1);
  struct sigaction action = {};
  action.sa_handler = onFatal;
  action.sa_flags = SA_ONSTACK;
  for (const int sig : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT}) {
    struct sigaction present = {};
    if (sigaction(sig, nullptr, &present) != 0) continue;
    if ((present.sa_flags & SA_SIGINFO) == 0 && present.sa_handler == SIG_DFL) sigaction(sig, &action, nullptr);
  }
  return true;
}

// The alternate stack of one thread, only where the thread has none. Made and removed on that thread.
class AlternateStack {
 public:
  ~AlternateStack() { remove(); }

  void install() {
    stack_t present = {};
    if (_base != nullptr || sigaltstack(nullptr, &present) != 0 || (present.ss_flags & SS_DISABLE) == 0) return;
    void* base = mmap(nullptr, kAlternateStack, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (base == MAP_FAILED) return;
    stack_t own = {};
    own.ss_sp = base;
    own.ss_size = kAlternateStack;
    if (sigaltstack(&own, nullptr) == 0) {
      _base = base;
    } else {
      munmap(base, kAlternateStack);
    }
  }

  void remove() {
    if (_base == nullptr) return;
    stack_t present = {};
    stack_t none = {};
    none.ss_flags = SS_DISABLE;
    if (sigaltstack(nullptr, &present) == 0 && present.ss_sp == _base) sigaltstack(&none, nullptr);
    munmap(_base, kAlternateStack);
    _base = nullptr;
  }

 private:
  void* _base = nullptr;
};

bool vacate(Slot& slot, pthread_t thread) {
  pid_t tid = slot.tid.load();
  if (tid <= 0 || !pthread_equal(slot.thread.load(), thread) || slot.pid.load() != getpid()) return false;
  if (!slot.tid.compare_exchange_strong(tid, kBusy)) return false;
  slot.tid.store(kFree);
  return true;
}

bool occupy(Slot& slot) {
  pid_t present = slot.tid.load();
  const bool stale = present > 0 && slot.pid.load() != getpid();
  if ((present != kFree && !stale) || !slot.tid.compare_exchange_strong(present, kBusy)) return false;
  slot.pid.store(getpid());
  slot.thread.store(pthread_self());
  slot.tid.store(ownTid());
  return true;
}

bool isRegistered(const Slot* slot) {
  return slot != nullptr && slot->tid.load() == ownTid() && slot->pid.load() == getpid();
}

// What one thread has registered; its end takes the thread out.
struct Registration {
  Slot* slot = nullptr;
  AlternateStack stack;
  ~Registration() {
    if (isRegistered(slot)) vacate(*slot, pthread_self());
  }
};

thread_local Registration registration;

}  // namespace

int cu_stackdump_thread_enable_1(void) {
  static const bool tookOver = takeOverFatalSignals();
  (void)tookOver;
  Registration& own = registration;
  if (isRegistered(own.slot)) return 0;
  for (Slot& slot : slots) {
    if (!occupy(slot)) continue;
    own.slot = &slot;
    own.stack.install();
    return 0;
  }
  return ENOMEM;
}

int cu_stackdump_thread_disable_1(pthread_t thread) {
  for (Slot& slot : slots) {
    if (!vacate(slot, thread)) continue;
    if (pthread_equal(thread, pthread_self())) registration.stack.remove();
    return 0;
  }
  return ESRCH;
}
