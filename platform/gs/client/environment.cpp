#include "client/daemon_address.h"

#include <sys/un.h>

#include <cstdlib>
#include <string_view>

#include "wire/endpoint.h"

namespace gs::client {

std::optional<DaemonAddress> daemon_address_from_environment() {
  constexpr std::string_view kUnix = "unix:";
  const char* value = std::getenv("GSD_ENDPOINT");
  const std::string_view text = value == nullptr ? "" : value;
  if (text.empty()) return DaemonAddress{false, wire::kDefaultSocketPath};
  if (text == "embedded:") return DaemonAddress{true, ""};
  if (!text.starts_with(kUnix)) return std::nullopt;

  const std::string_view path = text.substr(kUnix.size());
  const bool usable = path.starts_with('/') && path.size() < sizeof(sockaddr_un::sun_path);
  if (!usable) return std::nullopt;
  return DaemonAddress{false, std::string(path)};
}

}  // namespace gs::client
