#include <algorithm>
#include <cstring>

#include "engine/snapshot.h"
#include "engine/snapshot_input.h"
#include "engine/text.h"

namespace gs {

namespace fb = snapshot::fb;

bool SnapshotInput::attributes(const fb::Attributes* from, const std::string& group, GroupAttributes& into) {
  into.client_version = from->client_version();
  into.time_limit = from->time_limit();
  into.source_reflection_time_limit = from->source_reflection_time_limit();
  into.group_name = group;
  return take_table() && enumeration(from->batch_control(), into.batch_control) &&
         enumeration(from->num_phases(), into.num_phases) &&
         enumeration(from->source_reflection_num_phases(), into.source_reflection_num_phases) &&
         enumeration(from->default_vote(), into.default_vote) &&
         enumeration(from->merge_control(), into.merge_control) &&
         name(from->source_group_name(), kMaxGroupName, into.source_group_name) &&
         require(check_attributes(into) == WYX_OK, "attributes that no group can have");
}

bool enter_client(SnapshotInput& in, EngineState& state, const Endpoint& who, Client client) {
  if (!in.require(who.token >= 0, "a token below 0") ||
      !in.require(!state.hosts.is_gone(who.session.node), "a client of a host that is gone") ||
      !in.require(state.clients.find(who) == nullptr, "a token that is in use already") ||
      !in.require(state.clients.of(who.session).size() < kMaxSessionClients, "a session with too many clients"))
    return false;
  state.clients.add(who, std::move(client));
  return true;
}

namespace {

bool same_limits(const fb::Limits& a, const Limits& b) {
  return a.slice() == b.slice && a.session_bytes() == b.session_bytes && a.user_bytes() == b.user_bytes &&
         a.total_bytes() == b.total_bytes && a.max_phase_time() == b.max_phase_time;
}

bool read_adapters(SnapshotInput& in, const fb::Host& from, Adapters& into) {
  if (!in.require(from.adapters()->size() <= kMaxAdapters, "a host with too many adapters")) return false;
  for (const fb::Adapter* adapter : *from.adapters()) {
    Adapter& read = into.emplace_back();
    if (!in.take_table() || !in.name(adapter->name(), kMaxAdapterName, read.name) ||
        !in.require(is_adapter_name(read.name), "a name that no adapter has") ||
        !in.require(adapter->address()->size() == read.address.size(), "an address that is none"))
      return false;
    std::copy(adapter->address()->begin(), adapter->address()->end(), read.address.begin());
  }
  return true;
}

bool read_hosts(SnapshotInput& in, const fb::Snapshot& from, EngineState& into) {
  std::set<std::uint32_t> gone;
  for (const std::uint32_t node : *from.gone_hosts()) {
    if (!in.take(sizeof node)) return false;
    if (!gone.insert(node).second) return in.fail("a host that is gone twice");
  }
  HostTable::Hosts here;
  for (const fb::Host* host : *from.hosts()) {
    if (!in.take_table() || !in.require(here.size() < kMaxHosts, "more hosts than there may be") ||
        !in.require(!gone.contains(host->node()), "a host that is here and gone"))
      return false;
    const auto [entry, is_new] = here.try_emplace(host->node(), DomainHost{host->epoch(), {}});
    if (!in.require(is_new, "a host that is here twice") || !read_adapters(in, *host, entry->second.adapters))
      return false;
  }
  into.hosts = HostTable(std::move(here), std::move(gone), from.hosts_seqnum());
  return true;
}

bool read_groups(SnapshotInput& in, const fb::Snapshot& from, EngineState& into) {
  std::set<std::uint64_t> protocols;
  for (const fb::Group* group : *from.groups()) {
    std::string name;
    if (!in.take_table() || !in.name(group->name(), kMaxGroupName, name)) return false;
    in.set_where(printable(name));
    if (!in.require(!name.empty(), "no name")) return false;
    const auto [entry, is_new] = into.groups.try_emplace(name, name, 0);
    if (!in.require(is_new, "is there twice") || !GroupReader(in, *group, into, entry->second).read())
      return false;
    if (group->run() && !protocols.insert(group->run()->number()).second)
      return in.fail("a protocol of the same number as another group's");
    in.set_where({});
  }
  return true;
}

/// Whoever has work left stands in line, and who has nothing left is there only until its turn comes.
bool read_line(SnapshotInput& in, const fb::Snapshot& from, EngineState& into) {
  for (const std::uint32_t index : *from.line()) {
    if (!in.take(sizeof index)) return false;
    if (index >= from.groups()->size()) return in.fail("a group in the line that does not exist");
    Group& group = into.groups.at(from.groups()->Get(index)->name()->str());
    if (group.in_line()) return in.fail("a group that is in the line twice");
    group.set_in_line(true);
    into.line.push_back(group.name());
  }
  for (const auto& [name, group] : into.groups) {
    in.set_where(printable(name));
    if (group.in_line()) continue;
    if (!in.require(!group.unfinished(), "has work left and is not in the line") ||
        !in.require(!group.finished(), "has neither members nor work"))
      return false;
  }
  in.set_where({});
  return true;
}

bool read_subscriber(SnapshotInput& in, const fb::Subscriber& from, const std::string& name, EngineState& into,
                     SubscriberTable::OfGroup& all) {
  const Endpoint to{value_of(from.session()), from.token()};
  const SubscribeRequest request{to.token, from.control(), name};
  const auto group = into.groups.find(name);
  const bool born = group != into.groups.end() && group->second.born();
  if (!in.take_table() || !in.require(check_values(request) == WYX_OK, "a subscription that nobody can ask for") ||
      !in.require(born || (from.control() & WYX_SUBSCRIBE_PERSISTENCE), "a subscriber that should be dismissed") ||
      !in.require(all.empty() || all.rbegin()->first < from.number(), "subscribers out of order") ||
      !in.require(from.number() <= into.subscribers.last_subscription(), "a subscription not yet numbered") ||
      !enter_client(in, into, to, {name, nullptr, from.number()}))
    return false;
  Ledger::Charge charge(into.ledger, {to.session, from.user()}, room_for(request));
  all.emplace(from.number(), Subscriber{to, from.control(), std::move(charge)});
  return true;
}

bool read_subscriptions(SnapshotInput& in, const fb::Snapshot& from, EngineState& into) {
  SubscriberTable::Groups groups;
  into.subscribers = SubscriberTable({}, from.last_subscription());
  for (const fb::Subscriptions* of_group : *from.subscriptions()) {
    std::string name;
    if (!in.take_table() || !in.name(of_group->group_name(), kMaxGroupName, name)) return false;
    in.set_where(printable(name));
    const auto [entry, is_new] = groups.try_emplace(name);
    const std::size_t count = of_group->subscribers()->size();
    if (!in.require(is_new, "has two lists of subscribers") ||
        !in.require(count > 0 && count <= kMaxSubscribers, "no subscribers or too many"))
      return false;
    for (const fb::Subscriber* subscriber : *of_group->subscribers())
      if (!read_subscriber(in, *subscriber, name, into, entry->second)) return false;
    in.set_where({});
  }
  into.subscribers = SubscriberTable(std::move(groups), from.last_subscription());
  return true;
}

/// Null: it is none of this version.
const fb::Snapshot* verified_root(SnapshotInput& in, std::span<const std::byte> snapshot) {
  constexpr std::size_t kNameOfId = 2;  // characters before the version
  constexpr std::size_t kLeast = sizeof(flatbuffers::uoffset_t) + flatbuffers::kFileIdentifierLength;
  constexpr flatbuffers::uoffset_t kMaxDepth = 8;  // of tables in tables; the schema needs four
  constexpr std::size_t kLeastTable = 2 * sizeof(flatbuffers::uoffset_t);  // bytes
  const auto* data = reinterpret_cast<const std::uint8_t*>(snapshot.data());
  if (snapshot.size() < kLeast || snapshot.size() >= FLATBUFFERS_MAX_BUFFER_SIZE) {
    in.fail("too short or too long to be one");
    return nullptr;
  }
  const std::string id(flatbuffers::GetBufferIdentifier(data), flatbuffers::kFileIdentifierLength);
  if (id.compare(0, kNameOfId, kSnapshotId, kNameOfId) == 0 && id != kSnapshotId) {
    in.fail("of version " + printable(id.substr(kNameOfId)) + ", where " + (kSnapshotId + kNameOfId) +
            " is understood: run the same release on all hosts");
    return nullptr;
  }
  const auto max_tables = static_cast<flatbuffers::uoffset_t>(snapshot.size() / kLeastTable);
  flatbuffers::Verifier verifier(data, snapshot.size(), kMaxDepth, max_tables);
  if (verifier.VerifyBuffer<fb::Snapshot>(kSnapshotId)) return flatbuffers::GetRoot<fb::Snapshot>(data);
  in.fail("not well-formed");
  return nullptr;
}

}  // namespace

bool read_snapshot(const SnapshotBytes& snapshot, EngineState& into, std::string* error) {
  SnapshotInput in(snapshot, error);
  const fb::Snapshot* from = verified_root(in, snapshot.head());
  if (from == nullptr) return false;
  if (!same_limits(*from->limits(), into.limits))
    return in.fail("made under other limits: set the same on all hosts");
  into.last_protocol = from->last_protocol();
  into.numbers_above = from->numbers_above();
  into.ended_number = from->ended_number();
  return read_hosts(in, *from, into) && read_groups(in, *from, into) && read_line(in, *from, into) &&
         read_subscriptions(in, *from, into) && in.no_more_values() &&
         in.require(into.ledger.within_limits(), "more than its limits allow to be kept");
}

}  // namespace gs
