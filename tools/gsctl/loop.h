// Descriptors, signals and times that a command waits for, on one thread.
#pragma once

#include <event2/event.h>

#include <chrono>
#include <exception>
#include <functional>
#include <memory>
#include <vector>

namespace gsctl {

struct FreeBase {
  void operator()(event_base* base) const { event_base_free(base); }
};

/// Callbacks run inside run(), one at a time. What one throws ends run(), which throws it on: between the two are
/// only C functions, which must not see it.
class Loop {
 public:
  using Callback = std::function<void()>;
  class Registration;
  /// The callback is called for as long as this lives; it may end in the callback itself, and before the loop.
  using Handle = std::shared_ptr<Registration>;

  Loop();
  Loop(const Loop&) = delete;
  Loop& operator=(const Loop&) = delete;

  /// Whenever the descriptor is readable, at its end, or in error; it must outlive the handle.
  [[nodiscard]] Handle on_readable(int fd, Callback callback);
  [[nodiscard]] Handle on_signal(int number, Callback callback);
  /// Once.
  [[nodiscard]] Handle after(std::chrono::duration<double> time, Callback callback);

  /// Until stop(), which may have been called already. Throws what a callback threw.
  void run();
  void stop();

  /// Calls `callback` and keeps what it throws for run(): for functions that a library calls, which must not
  /// throw.
  template <typename F>
  void guard(F&& callback) noexcept {
    try {
      callback();
    } catch (...) {
      fail(std::current_exception());
    }
  }

 private:
  Handle add(int fd, short what, Callback callback, const timeval* time);
  void fail(std::exception_ptr error) noexcept;

  std::unique_ptr<event_base, FreeBase> base_;
  bool stopped_ = false;  // since the last run()
  std::exception_ptr error_;
};

/// Calls `callback` when standard output is a pipe that nobody reads any more; null where it is none.
[[nodiscard]] Loop::Handle when_unread(Loop& loop, Loop::Callback callback);

/// SIGINT, SIGTERM and SIGHUP (unless it was ignored from the start, as nohup has it) call `callback` with the
/// number instead of ending the process.
std::vector<Loop::Handle> on_interrupt(Loop& loop, std::function<void(int signal)> callback);

}  // namespace gsctl
