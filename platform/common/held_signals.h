// Signals that come while a daemon starts.
#pragma once

#include <pthread.h>

#include <csignal>
#include <initializer_list>

namespace platform {

/// SIGTERM, SIGINT and SIGHUP wait for as long as it lives: what they would end is not yet there, and what they
/// would leave behind is half made.
class HeldSignals {
 public:
  HeldSignals() {
    sigset_t held;
    sigemptyset(&held);
    for (const int signal : {SIGTERM, SIGINT, SIGHUP}) sigaddset(&held, signal);
    pthread_sigmask(SIG_BLOCK, &held, &before_);
  }
  ~HeldSignals() { pthread_sigmask(SIG_SETMASK, &before_, nullptr); }
  HeldSignals(const HeldSignals&) = delete;
  HeldSignals& operator=(const HeldSignals&) = delete;

 private:
  sigset_t before_;
};

}  // namespace platform
