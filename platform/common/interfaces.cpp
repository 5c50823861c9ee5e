#include "common/interfaces.h"

#include <ifaddrs.h>
#include <net/if.h>
#include <netinet/in.h>

#include <cstring>

namespace platform {
namespace {

bool read_address(const sockaddr* from, std::array<std::uint8_t, 16>& into) {
  if (from == nullptr) return false;
  if (from->sa_family == AF_INET) {
    into[10] = into[11] = 0xff;
    std::memcpy(&into[12], &reinterpret_cast<const sockaddr_in*>(from)->sin_addr, 4);
    return true;
  }
  if (from->sa_family != AF_INET6) return false;
  std::memcpy(into.data(), &reinterpret_cast<const sockaddr_in6*>(from)->sin6_addr, into.size());
  return true;
}

}  // namespace

std::vector<Interface> interfaces() {
  std::vector<Interface> found;
  ifaddrs* list = nullptr;
  if (getifaddrs(&list) != 0) return found;
  for (const ifaddrs* entry = list; entry != nullptr; entry = entry->ifa_next) {
    Interface one;
    if ((entry->ifa_flags & IFF_UP) == 0 || !read_address(entry->ifa_addr, one.address)) continue;
    one.name = entry->ifa_name;
    one.loopback = (entry->ifa_flags & IFF_LOOPBACK) != 0;
    found.push_back(std::move(one));
  }
  freeifaddrs(list);
  return found;
}

}  // namespace platform
