#include "client/adapters.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <net/if.h>

#include <algorithm>
#include <cstring>
#include <set>
#include <string>

#include "client/fork.h"

namespace gs::client {
namespace {

/// The names that adapter records point at: few, and kept for good.
const char* keep_name(const char* name) {
  static std::set<std::string>* kept GS_GUARDED_BY(process_mutex) = nullptr;
  MutexLock lock(process_mutex);
  if (kept == nullptr) kept = new std::set<std::string>;
  return kept->insert(name).first->c_str();
}

bool read_address(const sockaddr* address, Adapter* adapter) {
  if (address == nullptr) return false;
  if (address->sa_family == AF_INET) {
    adapter->ipv4 = true;
    adapter->address.ipv4_in_6.ip4x = reinterpret_cast<const sockaddr_in*>(address)->sin_addr;
    return true;
  }
  if (address->sa_family != AF_INET6) return false;
  adapter->address.ip6 = reinterpret_cast<const sockaddr_in6*>(address)->sin6_addr;
  return true;
}

bool may_be_ipv4(const wyx_ip_addr& address) {
  const auto& filler = address.ipv4_in_6.filler;
  return filler[0] == 0 && filler[1] == 0 && (filler[2] == 0 || filler[2] == htonl(0xffff));
}

bool same(const Adapter& adapter, const wyx_ip_addr& address) {
  if (!adapter.ipv4) return std::memcmp(&adapter.address.ip6, &address.ip6, sizeof(address.ip6)) == 0;
  return may_be_ipv4(address) && adapter.address.ipv4_in_6.ip4x.s_addr == address.ipv4_in_6.ip4x.s_addr;
}

}  // namespace

std::vector<Adapter> adapters() {
  std::vector<Adapter> found;
  ifaddrs* list = nullptr;
  if (getifaddrs(&list) != 0) return found;
  for (const ifaddrs* entry = list; entry != nullptr; entry = entry->ifa_next) {
    Adapter adapter;
    if ((entry->ifa_flags & IFF_UP) == 0 || !read_address(entry->ifa_addr, &adapter)) continue;
    adapter.name = keep_name(entry->ifa_name);
    adapter.loopback = (entry->ifa_flags & IFF_LOOPBACK) != 0;
    found.push_back(adapter);
  }
  freeifaddrs(list);
  return found;
}

std::optional<Adapter> main_adapter(const std::vector<Adapter>& all) {
  const auto rank = [](const Adapter& a) { return (a.loopback ? 2 : 0) + (a.ipv4 ? 0 : 1); };
  const auto best = std::min_element(all.begin(), all.end(),
                                     [&rank](const Adapter& a, const Adapter& b) { return rank(a) < rank(b); });
  if (best == all.end()) return std::nullopt;
  return *best;
}

std::optional<Adapter> adapter_with(const std::vector<Adapter>& all, const wyx_ip_addr& address) {
  const auto found = std::find_if(all.begin(), all.end(), [&](const Adapter& a) { return same(a, address); });
  if (found == all.end()) return std::nullopt;
  return *found;
}

bool is_interface_address(const wyx_ip_addr& address) {
  if (may_be_ipv4(address)) {
    const std::uint32_t ip = ntohl(address.ipv4_in_6.ip4x.s_addr);
    return ip != INADDR_ANY && ip != INADDR_BROADCAST && !IN_MULTICAST(ip);
  }
  return !IN6_IS_ADDR_MULTICAST(&address.ip6);
}

}  // namespace gs::client
