// This host's network interfaces, read from the system at every call; any thread.
#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <vector>

namespace platform {

struct Interface {
  std::string name;
  std::array<std::uint8_t, 16> address{};  // IPv6, or an IPv4 address as IPv6 has it
  bool loopback = false;
};

/// Those that are up, one entry for each of their addresses.
std::vector<Interface> interfaces();

}  // namespace platform
