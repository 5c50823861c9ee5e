// Tells a service manager how the daemon is, in the datagrams of sd_notify(3).
#pragma once

#include <chrono>
#include <optional>
#include <string>

#include "common/descriptor.h"

namespace platform {

/// Where there is no service manager, or it does not listen, nothing happens. One that is too busy to listen holds
/// up nothing but start, reload and stop, and these for a second at most.
class ServiceManager {
 public:
  /// Takes what the manager has put into the environment out of it: processes that this one starts shall not speak
  /// for it. Before there are other threads.
  ServiceManager();

  /// `status` is for people.
  void ready(const std::string& status) const { tell("READY=1\nSTATUS=" + status); }
  /// Until `ready` is told again.
  void reloading() const;
  void stopping() const { tell("STOPPING=1\nSTATUS=stopping"); }

  /// How often `alive` is to be told so that the manager does not take the daemon for hung; nothing: it does not
  /// ask.
  std::optional<std::chrono::milliseconds> alive_every() const { return alive_every_; }
  void alive() const;

 private:
  void tell(const std::string& what, int flags = 0) const;

  std::string address_;  // as in sun_path; empty: none
  Descriptor socket_;
  std::optional<std::chrono::milliseconds> alive_every_;
};

}  // namespace platform
