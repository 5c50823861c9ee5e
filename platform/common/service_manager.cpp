#include "common/service_manager.h"

#include <dlfcn.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <ctime>

namespace platform {

ServiceManager::ServiceManager() {
  if (getenv("NOTIFY_SOCKET") == nullptr) return;
  void* library = dlopen("libsystemd.so.0", RTLD_NOW | RTLD_LOCAL);  // kept for as long as the process lives
  if (library == nullptr) return;
  using WatchdogEnabled = int (*)(int unset_environment, std::uint64_t* microseconds);
  notify_ = reinterpret_cast<Notify>(dlsym(library, "sd_notify"));
  const auto watchdog_enabled = reinterpret_cast<WatchdogEnabled>(dlsym(library, "sd_watchdog_enabled"));
  std::uint64_t limit = 0;
  if (watchdog_enabled == nullptr || watchdog_enabled(0, &limit) <= 0) return;
  // Half of what the manager waits: one that is late does no harm.
  alive_every_ = std::chrono::milliseconds(std::max<std::uint64_t>(1, limit / 2000));
}

void ServiceManager::reloading() const {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  tell("RELOADING=1\nMONOTONIC_USEC=" + std::to_string(now.tv_sec * 1'000'000 + now.tv_nsec / 1000));
}

void ServiceManager::tell(const std::string& what) const {
  if (notify_ != nullptr) notify_(0, what.c_str());
}

}  // namespace platform
