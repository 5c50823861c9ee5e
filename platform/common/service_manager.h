// Tells a service manager how the daemon is, through libsystemd where it is: nothing depends on its being there.
#pragma once

#include <chrono>
#include <optional>
#include <string>

namespace platform {

/// Where there is no service manager, no libsystemd, or nobody that listens, nothing happens. The manager's variables
/// stay in the environment: whoever starts processes gives them one of their own.
class ServiceManager {
 public:
  ServiceManager();

  /// `status` is for people.
  void ready(const std::string& status) const { tell("READY=1\nSTATUS=" + status); }
  /// Until `ready` is told again.
  void reloading() const;
  void stopping() const { tell("STOPPING=1\nSTATUS=stopping"); }

  /// How often `alive` is to be told so that the manager does not take the daemon for hung; nothing: it does not
  /// ask.
  std::optional<std::chrono::milliseconds> alive_every() const { return alive_every_; }
  void alive() const { tell("WATCHDOG=1"); }

 private:
  using Notify = int (*)(int unset_environment, const char* state);

  void tell(const std::string& what) const;

  Notify notify_ = nullptr;  // null: there is nobody to tell
  std::optional<std::chrono::milliseconds> alive_every_;
};

}  // namespace platform
