// Where group services are found: the environment variable GSD_ENDPOINT, or the default path without it.
#pragma once

#include <optional>
#include <string>

namespace gs::client {

struct DaemonAddress {
  bool embedded = false;
  std::string path;  // of the daemon's socket, when not embedded
};

/// GSD_ENDPOINT is "unix:/path" (absolute, short enough for a socket's address) or "embedded:". Not set or empty:
/// the default path. Nothing: the value is none of these.
std::optional<DaemonAddress> daemon_address_from_environment();

}  // namespace gs::client
