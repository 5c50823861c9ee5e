#include "common/service_manager.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <ctime>

#include "common/settings.h"

namespace platform {
namespace {

constexpr timeval kPatience = {1, 0};

std::string take_variable(const char* name) {
  const char* value = getenv(name);
  std::string text = value == nullptr ? "" : value;
  unsetenv(name);
  return text;
}

/// Half of what the manager waits: one that is late does no harm.
std::optional<std::chrono::milliseconds> half_of(const std::string& microseconds) {
  std::uint64_t limit = 0;
  constexpr std::uint64_t kLongest = std::uint64_t{1} << 40;
  if (!set_number(microseconds, 1, kLongest, &limit).empty()) return std::nullopt;
  return std::chrono::milliseconds(std::max<std::uint64_t>(1, limit / 2000));
}

}  // namespace

ServiceManager::ServiceManager()
    : address_(take_variable("NOTIFY_SOCKET")), socket_(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
  const std::string process = take_variable("WATCHDOG_PID");
  const std::string limit = take_variable("WATCHDOG_USEC");
  if (process.empty() || process == std::to_string(getpid())) alive_every_ = half_of(limit);
  if (address_.size() >= sizeof(sockaddr_un::sun_path)) address_.clear();
  if (!address_.empty() && address_.front() == '@') address_.front() = '\0';
  setsockopt(socket_.get(), SOL_SOCKET, SO_SNDTIMEO, &kPatience, sizeof kPatience);
}

void ServiceManager::reloading() const {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  tell("RELOADING=1\nMONOTONIC_USEC=" + std::to_string(now.tv_sec * 1'000'000 + now.tv_nsec / 1000));
}

/// One that the manager has no room for is followed by the next.
void ServiceManager::alive() const { tell("WATCHDOG=1", MSG_DONTWAIT); }

void ServiceManager::tell(const std::string& what, int flags) const {
  if (address_.empty()) return;
  sockaddr_un to{};
  to.sun_family = AF_UNIX;
  memcpy(to.sun_path, address_.data(), address_.size());
  const auto length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + address_.size());
  sendto(socket_.get(), what.data(), what.size(), flags | MSG_NOSIGNAL, reinterpret_cast<sockaddr*>(&to), length);
}

}  // namespace platform
