#include "client/environment.h"

#include <sys/un.h>

#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <string_view>

#include "client/failure_log.h"
#include "wire/endpoint.h"

namespace gs::client {
namespace {

/// Empty: not set.
std::string_view variable(const char* name) {
  const char* value = std::getenv(name);
  return value == nullptr ? "" : value;
}

}  // namespace

std::optional<DaemonAddress> daemon_address() {
  constexpr std::string_view kUnix = "unix:";
  const std::string_view text = variable("GSD_ENDPOINT");
  if (text.empty()) return DaemonAddress{false, wire::kDefaultSocketPath};
  if (text == "embedded:") return DaemonAddress{true, ""};

  const std::string_view path = text.starts_with(kUnix) ? text.substr(kUnix.size()) : "";
  if (path.starts_with('/') && path.size() < sizeof(sockaddr_un::sun_path)) {
    return DaemonAddress{false, std::string(path)};
  }
  record_failure("endpoint", EINVAL,
                 "GSD_ENDPOINT is neither unix:/PATH, with a path short enough for a socket, nor embedded:");
  return std::nullopt;
}

std::optional<int> request_limit() {
  const std::string_view text = variable("GSD_REQUEST_LIMIT");
  if (text.empty()) return kDefaultRequestLimit;
  int seconds = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), seconds);
  const bool whole = error == std::errc() && end == text.data() + text.size();
  if (whole && seconds >= 1 && seconds <= kMaxRequestLimit) return seconds;
  record_failure("request-limit", EINVAL,
                 "GSD_REQUEST_LIMIT is not a number of seconds from 1 to " + std::to_string(kMaxRequestLimit));
  return std::nullopt;
}

bool debug_wanted() {
  const std::string_view value = variable("GSD_DEBUG");
  return !value.empty() && value != "0";
}

}  // namespace gs::client
