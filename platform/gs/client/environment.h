// What the application's environment says.
#pragma once

#include <optional>
#include <string>

namespace gs::client {

struct DaemonAddress {
  bool embedded = false;
  std::string path;  // of the daemon's socket, when not embedded
};

inline constexpr int kDefaultRequestLimit = 30;     // seconds
inline constexpr int kMaxRequestLimit = 24 * 3600;  // seconds

/// GSD_ENDPOINT is "unix:/path" (absolute, short enough for a socket's address) or "embedded:". Not set or empty:
/// the default path. Nothing: the value is none of these, and the failure is recorded.
std::optional<DaemonAddress> daemon_address();

/// GSD_REQUEST_LIMIT: seconds, 1 to kMaxRequestLimit. Not set or empty: the default. Nothing: as above.
std::optional<int> request_limit();

/// GSD_DEBUG: set, not empty and not "0".
bool debug_wanted();

}  // namespace gs::client
