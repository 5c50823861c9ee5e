// Network interfaces, for the adapter queries: this host's, read from the system at every call, and those that a
// daemon knows of other hosts. Any thread.
#pragma once

#include <optional>
#include <vector>

#include "engine/types.h"

namespace gs::client {

struct AdapterRecord {
  const char* name = "";  // lives as long as the process
  wyx_ip_addr address = {};
  bool ipv4 = false;  // `address` is an IPv4 address in ipv4_in_6.ip4x, filler zero
  bool loopback = false;
};

/// This host's interfaces that are up, one entry for each of their addresses.
std::vector<AdapterRecord> adapters();
/// As a daemon has told of them.
std::vector<AdapterRecord> records_of(const Adapters& adapters);

/// The one that stands for its host: not loopback before loopback, IPv4 before IPv6. Nothing: there is none at
/// all.
std::optional<AdapterRecord> main_adapter(const std::vector<AdapterRecord>& all);
std::optional<AdapterRecord> adapter_with(const std::vector<AdapterRecord>& all, const wyx_ip_addr& address);

/// False: no interface can have this address (unspecified, broadcast or multicast). An IPv4 address has a filler
/// of zeros, or is IPv6-mapped.
bool is_interface_address(const wyx_ip_addr& address);
/// As daemons have it.
Adapter::Address address_of(const wyx_ip_addr& address);

}  // namespace gs::client
