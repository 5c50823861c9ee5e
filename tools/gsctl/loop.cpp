#include "tools/gsctl/loop.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cmath>
#include <csignal>
#include <utility>

#include "common/event_ptr.h"
#include "tools/gsctl/status.h"

namespace gsctl {

class Loop::Registration : public std::enable_shared_from_this<Registration> {
 public:
  Registration(Loop& loop, Callback callback) : loop_(loop), callback_(std::move(callback)) {}

  void watch(int fd, short what, const timeval* time) {
    event_.reset(event_new(loop_.base_.get(), fd, what, &Registration::happened, this));
    if (!event_ || event_add(event_.get(), time) != 0) {
      throw Error(kRefused, "cannot wait for what is to come: too many open files, or no memory");
    }
  }

 private:
  static void happened(evutil_socket_t, short, void* self) {
    const auto kept = static_cast<Registration*>(self)->shared_from_this();  // the callback may drop the handle
    kept->loop_.guard(kept->callback_);
  }

  Loop& loop_;
  Callback callback_;
  platform::EventPtr event_;
};

Loop::Loop() {
  const std::unique_ptr<event_config, decltype(&event_config_free)> config(event_config_new(), &event_config_free);
  if (config && event_config_require_features(config.get(), EV_FEATURE_FDS) == 0) {  // files, too
    base_.reset(event_base_new_with_config(config.get()));
  }
  if (!base_) throw Error(kRefused, "cannot make an event loop: too many open files, or no memory");
}

Loop::Handle Loop::add(int fd, short what, Callback callback, const timeval* time) {
  auto registration = std::make_shared<Registration>(*this, std::move(callback));
  registration->watch(fd, what, time);
  return registration;
}

Loop::Handle Loop::on_readable(int fd, Callback callback) {
  return add(fd, EV_READ | EV_PERSIST, std::move(callback), nullptr);
}

Loop::Handle Loop::on_signal(int number, Callback callback) {
  return add(number, EV_SIGNAL | EV_PERSIST, std::move(callback), nullptr);
}

Loop::Handle Loop::after(std::chrono::duration<double> time, Callback callback) {
  double seconds = 0;
  const double fraction = std::modf(std::max(time.count(), 0.0), &seconds);
  const timeval wanted{static_cast<time_t>(seconds), static_cast<suseconds_t>(fraction * 1e6)};
  return add(-1, EV_TIMEOUT, std::move(callback), &wanted);
}

void Loop::run() {
  if (!std::exchange(stopped_, false)) event_base_loop(base_.get(), EVLOOP_NO_EXIT_ON_EMPTY);
  stopped_ = false;
  if (error_) std::rethrow_exception(std::exchange(error_, nullptr));
}

void Loop::stop() {
  stopped_ = true;
  event_base_loopbreak(base_.get());
}

void Loop::fail(std::exception_ptr error) noexcept {
  if (!error_) error_ = std::move(error);
  stop();
}

std::vector<Loop::Handle> on_interrupt(Loop& loop, std::function<void(int signal)> callback) {
  std::vector<Loop::Handle> handles;
  for (const int number : {SIGINT, SIGTERM, SIGHUP}) {
    struct sigaction now {};
    sigaction(number, nullptr, &now);
    if (number == SIGHUP && now.sa_handler == SIG_IGN) continue;
    handles.push_back(loop.on_signal(number, [callback, number] { callback(number); }));
  }
  return handles;
}

/// A pipe is readable at its writing end when nobody reads it any more.
Loop::Handle when_unread(Loop& loop, Loop::Callback callback) {
  struct stat output {};
  if (fstat(STDOUT_FILENO, &output) != 0 || !S_ISFIFO(output.st_mode)) return nullptr;
  return loop.on_readable(STDOUT_FILENO, std::move(callback));
}

}  // namespace gsctl
