#include "client/adapters.h"

#include <arpa/inet.h>

#include <algorithm>
#include <cstring>
#include <set>
#include <string>

#include "client/fork.h"
#include "common/interfaces.h"

namespace gs::client {
namespace {

/// The names that adapter records point at: few, and kept for good.
const char* keep_name(const std::string& name) {
  static std::set<std::string>* kept GS_GUARDED_BY(process_mutex) = nullptr;
  MutexLock lock(process_mutex);
  if (kept == nullptr) kept = new std::set<std::string>;
  return kept->insert(name).first->c_str();
}

AdapterRecord record_of(const std::string& name, const Adapter::Address& address, bool loopback) {
  constexpr std::array<std::uint8_t, 12> kMapped{0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xff, 0xff};
  AdapterRecord record;
  record.name = keep_name(name);
  record.loopback = loopback;
  record.ipv4 = std::equal(kMapped.begin(), kMapped.end(), address.begin());
  if (record.ipv4)
    std::memcpy(&record.address.ipv4_in_6.ip4x, &address[kMapped.size()], sizeof(in_addr));
  else
    std::memcpy(&record.address.ip6, address.data(), address.size());
  return record;
}

bool may_be_ipv4(const wyx_ip_addr& address) {
  const auto& filler = address.ipv4_in_6.filler;
  return filler[0] == 0 && filler[1] == 0 && (filler[2] == 0 || filler[2] == htonl(0xffff));
}

bool same(const AdapterRecord& adapter, const wyx_ip_addr& address) {
  if (!adapter.ipv4) return std::memcmp(&adapter.address.ip6, &address.ip6, sizeof(address.ip6)) == 0;
  return may_be_ipv4(address) && adapter.address.ipv4_in_6.ip4x.s_addr == address.ipv4_in_6.ip4x.s_addr;
}

}  // namespace

std::vector<AdapterRecord> adapters() {
  std::vector<AdapterRecord> records;
  for (const auto& one : platform::interfaces()) records.push_back(record_of(one.name, one.address, one.loopback));
  return records;
}

std::vector<AdapterRecord> records_of(const Adapters& adapters) {
  std::vector<AdapterRecord> records;
  for (const Adapter& one : adapters) records.push_back(record_of(one.name, one.address, false));
  return records;
}

std::optional<AdapterRecord> main_adapter(const std::vector<AdapterRecord>& all) {
  const auto rank = [](const AdapterRecord& a) { return (a.loopback ? 2 : 0) + (a.ipv4 ? 0 : 1); };
  const auto best =
      std::min_element(all.begin(), all.end(),
                       [&rank](const AdapterRecord& a, const AdapterRecord& b) { return rank(a) < rank(b); });
  if (best == all.end()) return std::nullopt;
  return *best;
}

std::optional<AdapterRecord> adapter_with(const std::vector<AdapterRecord>& all, const wyx_ip_addr& address) {
  const auto found =
      std::find_if(all.begin(), all.end(), [&](const AdapterRecord& a) { return same(a, address); });
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

Adapter::Address address_of(const wyx_ip_addr& address) {
  Adapter::Address result{};
  std::memcpy(result.data(), &address, result.size());
  if (may_be_ipv4(address)) result[10] = result[11] = 0xff;
  return result;
}

}  // namespace gs::client
