// Queries, and what is not supported.

#include <zn_cu.h>

#include <cstring>

#include "client/adapters.h"
#include "client/entry.h"
#include "client/failure_log.h"
#include "client/wyx_entry_points.h"
#include "gscl/gslib_dli.h"

namespace gs::client {
namespace {

constexpr int kNoProvider = -1;

wyx_rc_t fill(wyx_zelt_version_t* version) {
  if (version == nullptr) return WYX_BAD_PARAMETER;
  cu_vrmf_t* installed = nullptr;
  if (cu_get_version_1(0, &installed) != 0 || installed == nullptr) return WYX_NOT_OK;
  version->vrmf = *installed;
  version->quick_version = static_cast<std::uint32_t>(installed->version & 0xff) << 24 |
                           static_cast<std::uint32_t>(installed->release & 0xff) << 16 |
                           static_cast<std::uint32_t>(installed->modlevel & 0xff) << 8 |
                           static_cast<std::uint32_t>(installed->fixlevel & 0xff);
  return WYX_OK;
}

int node_number_or_none() {
  const auto session = current_session();
  if (session) return static_cast<int>(session->node_number());
  wire::NodeInfo node;
  return query_node(&node) == WYX_OK ? static_cast<int>(node.node_number) : WYX_node_number;
}

wyx_rc_t fill(wyx_adapter_info* info, const std::optional<AdapterRecord>& adapter, int node_number,
              int provider_id) {
  if (!adapter) return WYX_ADAPTER_INFO_NOT_FOUND;
  *info = {};
  info->ip_addr = adapter->address;
  info->node_number = static_cast<short>(node_number);
  info->interface_name = adapter->name;
  info->gs_member_id.gs_provider_id = provider_id;
  info->gs_group_name = "";
  info->hb_network_name = "";
  info->hb_network_type = "";
  return WYX_OK;
}

/// Of a provider's host; none where it is no member of the domain.
wyx_rc_t find_adapters(Session& session, const wyx_provider_t& provider, std::vector<AdapterRecord>* found) {
  const short node = provider._gs_provider_info._gs_node_number;
  if (node == static_cast<short>(session.node_number())) {
    *found = adapters();
    return WYX_OK;
  }
  if (node < 0) return WYX_OK;
  wire::NodeAdapters there;
  const wyx_rc_t rc = session.query_adapters({static_cast<std::uint32_t>(node), {}}, &there);
  *found = records_of(there.adapters);
  return rc;
}

}  // namespace

// The entry points are what the client classes' table takes them for.
#define GS_CHECK_ENTRY(name) static_assert(std::is_same_v<decltype(&::name), name##_func_t>)
GS_CHECK_ENTRY(wyx_setup);
GS_CHECK_ENTRY(wyx_get_node_number);
GS_CHECK_ENTRY(wyx_get_limits);
GS_CHECK_ENTRY(wyx_get_adapter_info);
GS_CHECK_ENTRY(wyx_get_adapter_info_by_addr);
GS_CHECK_ENTRY(wyx_get_adapter_info_by_id);
GS_CHECK_ENTRY(wyx_get_ipaddr_by_id);
GS_CHECK_ENTRY(wyx_dispatch);
GS_CHECK_ENTRY(wyx_join);
GS_CHECK_ENTRY(wyx_change_state_value);
GS_CHECK_ENTRY(wyx_send_message);
GS_CHECK_ENTRY(wyx_leave);
GS_CHECK_ENTRY(wyx_expel);
GS_CHECK_ENTRY(wyx_change_attributes);
GS_CHECK_ENTRY(wyx_goodbye);
GS_CHECK_ENTRY(wyx_vote);
GS_CHECK_ENTRY(wyx_quit);
GS_CHECK_ENTRY(wyx_subscribe);
GS_CHECK_ENTRY(wyx_unsubscribe);
GS_CHECK_ENTRY(wyx_get_ffdc_id);
GS_CHECK_ENTRY(wyx_change_responsiveness);
GS_CHECK_ENTRY(wyx_dissolve_domain);
GS_CHECK_ENTRY(wyx_dissolve_site);
GS_CHECK_ENTRY(wyx_get_zelt_active_version);
GS_CHECK_ENTRY(wyx_get_zelt_installed_version);
GS_CHECK_ENTRY(wyx_migrate_to_pell_prep);
GS_CHECK_ENTRY(wyx_migrate_to_pell_commit);
GS_CHECK_ENTRY(wyx_migrate_to_pell_abort);
GS_CHECK_ENTRY(wyx_migrate_vote);
GS_CHECK_ENTRY(wyx_get_domain_master_node_number);
GS_CHECK_ENTRY(wyx_internal_send_domain_msg_to_gsd);
GS_CHECK_ENTRY(wyx_dissolve_subcluster);
#undef GS_CHECK_ENTRY

}  // namespace gs::client

using namespace gs;
using namespace gs::client;

wyx_rc_t wyx_get_node_number(int* node_number) {
  return entry([&] {
    if (node_number == nullptr) return WYX_BAD_PARAMETER;
    const auto session = current_session();
    wire::NodeInfo node;
    if (session && !session->gone()) {
      node.node_number = session->node_number();
    } else if (const wyx_rc_t rc = query_node(&node); rc != WYX_OK) {
      return rc;
    }
    *node_number = static_cast<int>(node.node_number);
    return WYX_OK;
  });
}

wyx_rc_t wyx_get_domain_master_node_number(int* node_number) {
  return entry([&] {
    if (node_number == nullptr) return WYX_BAD_PARAMETER;
    wire::NodeInfo node;
    const wyx_rc_t rc = query_node(&node);
    if (rc == WYX_OK) *node_number = static_cast<int>(node.domain_master_node);
    return rc;
  });
}

wyx_rc_t wyx_get_limits(wyx_limits* limits) {
  if (limits == nullptr) return WYX_BAD_PARAMETER;
  *limits = {static_cast<int>(kMaxProviderMessage), static_cast<int>(kMaxStateValue),
             static_cast<int>(kMaxGroupName)};
  return WYX_OK;
}

wyx_rc_t wyx_get_zelt_active_version(wyx_zelt_version_t* version) {
  return entry([&] { return fill(version); });
}

wyx_rc_t wyx_get_zelt_installed_version(wyx_zelt_version_t* version) {
  return entry([&] { return fill(version); });
}

wyx_rc_t wyx_get_ffdc_id(char* buffer) {
  return entry([&] {
    if (buffer == nullptr) return WYX_BAD_PARAMETER;
    std::strcpy(buffer, last_failure_id().c_str());
    return WYX_OK;
  });
}

wyx_rc_t wyx_get_adapter_info(wyx_adapter_info* info) {
  return entry([&] {
    if (info == nullptr) return WYX_NULL_ADAPTER_INFO;
    return fill(info, main_adapter(adapters()), node_number_or_none(), kNoProvider);
  });
}

wyx_rc_t wyx_get_adapter_info_by_addr(const wyx_ip_addr* address, wyx_adapter_info* info) {
  return entry([&] {
    if (info == nullptr) return WYX_NULL_ADAPTER_INFO;
    if (address == nullptr || !is_interface_address(*address)) return WYX_BAD_INPUT_IP_FORMAT;
    if (const auto here = adapter_with(adapters(), *address)) {
      return fill(info, here, node_number_or_none(), kNoProvider);
    }
    wire::NodeAdapters there;
    if (query_adapters({0, address_of(*address)}, &there) != WYX_OK) return WYX_ADAPTER_INFO_NOT_FOUND;
    return fill(info, main_adapter(records_of(there.adapters)), static_cast<int>(there.node), kNoProvider);
  });
}

wyx_rc_t wyx_get_adapter_info_by_id(wyx_token_t token, const wyx_provider_t* provider, wyx_adapter_info* info) {
  return client_entry(token, Client::Kind::kProvider, [&](Session& session) {
    if (info == nullptr) return WYX_NULL_ADAPTER_INFO;
    if (provider == nullptr) return WYX_BAD_PARAMETER;
    std::vector<AdapterRecord> all;
    const wyx_rc_t rc = find_adapters(session, *provider, &all);
    if (rc != WYX_OK) return rc;
    const int node_number = provider->_gs_provider_info._gs_node_number;
    return fill(info, main_adapter(all), node_number, provider->gs_provider_id);
  });
}

wyx_rc_t wyx_get_ipaddr_by_id(wyx_token_t token, const wyx_provider_t* provider, wyx_ip_addr* address) {
  return client_entry(token, Client::Kind::kProvider, [&](Session& session) {
    if (provider == nullptr || address == nullptr) return WYX_BAD_PARAMETER;
    std::vector<AdapterRecord> all;
    const wyx_rc_t rc = find_adapters(session, *provider, &all);
    if (rc != WYX_OK) return rc;
    std::erase_if(all, [](const AdapterRecord& adapter) { return !adapter.ipv4; });
    const auto adapter = main_adapter(all);
    if (!adapter) return WYX_NO_IPV4_ADDRESS_FOR_THE_ID;
    *address = adapter->address;
    return WYX_OK;
  });
}

wyx_rc_t wyx_dissolve_domain(const wyx_domain_spec_t*) { return WYX_NOT_SUPPORTED; }
wyx_rc_t wyx_dissolve_site(const wyx_site_spec_t*, wyx_site_dissolve_action_t) { return WYX_NOT_SUPPORTED; }
wyx_rc_t wyx_dissolve_subcluster(const wyx_subcluster_dissolution_info_t*) { return WYX_NOT_SUPPORTED; }
wyx_rc_t wyx_migrate_to_pell_prep() { return WYX_NOT_SUPPORTED; }
wyx_rc_t wyx_migrate_to_pell_commit() { return WYX_NOT_SUPPORTED; }
wyx_rc_t wyx_migrate_to_pell_abort() { return WYX_NOT_SUPPORTED; }
wyx_rc_t wyx_migrate_vote(wyx_migration_vote_t) { return WYX_NOT_SUPPORTED; }

wyx_rc_t wyx_internal_send_domain_msg_to_gsd(wyx_priv_channel_msg_type_t type, void* data, std::uint64_t length) {
  if (type != WYX_PRIV_MSG_OPQUORUM) return WYX_NOT_SUPPORTED;
  return session_entry([&](Session& session) {
    wyx_quorum_resp_t answer;
    if (data == nullptr || length != sizeof answer) return WYX_BAD_PARAMETER;
    std::memcpy(&answer, data, sizeof answer);
    return session.answer_quorum(answer.notification_sequence);
  });
}
