// This host's network interfaces, for the adapter queries. Read from the system at every call; any thread.
#pragma once

#include <optional>
#include <vector>

#include "gscl/wyx_api.h"

namespace gs::client {

struct Adapter {
  const char* name = "";  // lives as long as the process
  wyx_ip_addr address = {};
  bool ipv4 = false;  // `address` is an IPv4 address in ipv4_in_6.ip4x, filler zero
  bool loopback = false;
};

/// The interfaces that are up, one entry for each of their addresses.
std::vector<Adapter> adapters();

/// The one that stands for this host: not loopback before loopback, IPv4 before IPv6. Nothing: there is none at
/// all.
std::optional<Adapter> main_adapter(const std::vector<Adapter>& all);
std::optional<Adapter> adapter_with(const std::vector<Adapter>& all, const wyx_ip_addr& address);

/// False: no interface can have this address (unspecified, broadcast or multicast). An IPv4 address has a filler
/// of zeros, or is IPv6-mapped.
bool is_interface_address(const wyx_ip_addr& address);

}  // namespace gs::client
