// Clients' texts may hold any bytes.
#pragma once

#include <algorithm>
#include <string>

namespace gs::daemon {

/// A client's text as it may stand in a line of log or status, in quotes or not.
inline std::string printable(std::string text) {
  constexpr std::size_t kLongest = 64;
  if (text.size() > kLongest) text.resize(kLongest);
  std::replace_if(
      text.begin(), text.end(), [](unsigned char c) { return c < 0x20 || c > 0x7e || c == '"'; }, '?');
  return text;
}

}  // namespace gs::daemon
