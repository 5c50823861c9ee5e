#include <span>
#include <unordered_map>

#include "engine/snapshot.h"
#include "snapshot_generated.h"

namespace gs {
namespace {

namespace fb = snapshot::fb;
using Builder = flatbuffers::FlatBufferBuilder;
template <typename T>
using Offset = flatbuffers::Offset<T>;
template <typename T>
using Offsets = std::vector<Offset<T>>;

/// Leaves room for what is not charged, such as the table of every provider, below the 2 GiB of a FlatBuffer.
constexpr std::size_t kMostKept = std::size_t{3} << 29;
constexpr std::size_t kFirstSize = 64 * 1024;

fb::ProviderId pack(ProviderId id) { return {id.instance, id.node}; }
fb::Session pack(const SessionId& session) { return {session.number, session.node}; }

auto put(Builder& b, const Bytes& bytes) {
  return b.CreateVector(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size());
}

Offset<fb::Attributes> put(Builder& b, const GroupAttributes& a) {
  const auto source_name = b.CreateString(a.source_group_name);
  return fb::CreateAttributes(b, a.client_version, a.batch_control, a.num_phases, a.source_reflection_num_phases,
                              a.default_vote, a.merge_control, a.time_limit, a.source_reflection_time_limit,
                              source_name);
}
Offset<fb::Attributes> put(Builder& b, const std::shared_ptr<const GroupAttributes>& a) {
  return a ? put(b, *a) : Offset<fb::Attributes>();
}

Offset<fb::Limits> put(Builder& b, const Limits& l) {
  return fb::CreateLimits(b, l.slice, l.session_bytes, l.user_bytes, l.total_bytes, l.max_phase_time);
}

Offset<fb::Announcement> put(Builder& b, const Announcement& a) {
  const auto about = pack(a.about);
  std::vector<fb::ProviderId> ids;
  for (const ProviderId id : *a.ids) ids.push_back(pack(id));
  const auto providers = b.CreateVectorOfStructs(ids);
  return fb::CreateAnnouncement(b, &about, a.summary, providers);
}

Offset<fb::Subscriptions> put(Builder& b, const std::string& group, const SubscriberTable::OfGroup& subscribers) {
  Offsets<fb::Subscriber> all;
  for (const auto& [number, s] : subscribers) {
    const auto session = pack(s.to.session);
    all.push_back(fb::CreateSubscriber(b, number, &session, s.to.token, s.charge.payer().user, s.control));
  }
  const auto offsets = b.CreateVector(all);
  const auto name = b.CreateString(group);
  return fb::CreateSubscriptions(b, name, offsets);
}

Offset<fb::Host> put(Builder& b, std::uint32_t node, const DomainHost& host) {
  Offsets<fb::Adapter> adapters;
  for (const Adapter& adapter : host.adapters) {
    const auto name = b.CreateString(adapter.name);
    const auto address = b.CreateVector(adapter.address.data(), adapter.address.size());
    adapters.push_back(fb::CreateAdapter(b, name, address));
  }
  const auto offsets = b.CreateVector(adapters);
  return fb::CreateHost(b, node, host.epoch, offsets);
}

}  // namespace

/// One group. Indices are given out in an order that follows from the state alone.
class GroupWriter {
 public:
  /// Puts the values that it comes to behind `values`.
  GroupWriter(Builder& b, std::vector<SharedBytes>& values, const Group& group)
      : b_(b), all_values_(values), group_(group) {
    for (const MemberPtr& m : group.members_) add(m);
    if (group.run_)
      for (const MemberPtr& m : group.run_->changing) add(m);
    for (const MemberPtr& m : group.failures_) add(m);
    for (const auto& [place, queued] : group.queue_) add(queued.who);
  }

  Offset<fb::Group> write() {
    const std::uint32_t state = index_of(group_.state_value_);
    const auto run = group_.run_ ? put(*group_.run_) : Offset<fb::Run>();
    Offsets<fb::Provider> providers;
    for (const Member* m : providers_) providers.push_back(put(*m));
    Offsets<fb::Queued> queue;
    for (const auto& [place, queued] : group_.queue_) queue.push_back(put(place, queued));
    Offsets<fb::Announcement> announcements;
    for (const Announcement& a : group_.announcements_) announcements.push_back(gs::put(b_, a));

    const auto name = b_.CreateString(group_.name_);
    const auto attributes = gs::put(b_, group_.attributes_);
    const auto provider_offsets = b_.CreateVector(providers);
    const auto values = b_.CreateVector(values_);
    const auto failures = indices_of(group_.failures_);
    const auto queue_offsets = b_.CreateVector(queue);
    const auto announcement_offsets = b_.CreateVector(announcements);
    return fb::CreateGroup(b_, name, attributes, provider_offsets,
                           static_cast<std::uint32_t>(group_.members_.size()), values, state, group_.seqnum_, run,
                           failures, queue_offsets, group_.last_place_, announcement_offsets);
  }

 private:
  void add(const MemberPtr& member) {
    const auto index = static_cast<std::uint32_t>(providers_.size());
    if (provider_indices_.emplace(member.get(), index).second) providers_.push_back(member.get());
  }

  template <typename List>
  Offset<flatbuffers::Vector<std::uint32_t>> indices_of(const List& members) {
    std::vector<std::uint32_t> indices;
    for (const MemberPtr& m : members) indices.push_back(provider_indices_.at(m.get()));
    return b_.CreateVector(indices);
  }

  /// Writes the value where it is met first. One without a charge is the empty one of a new group.
  std::uint32_t index_of(const Value& value) {
    if (!value.charge) return 0;
    const auto index = static_cast<std::uint32_t>(values_.size() + 1);
    const auto [found, is_new] = value_indices_.emplace(value.charge.get(), index);
    if (!is_new) return found->second;
    all_values_.push_back(value.bytes);
    const auto session = pack(value.charge->payer().session);
    values_.push_back(fb::CreateValue(b_, &session, value.charge->payer().user));
    return index;
  }

  Offset<fb::Ballot> put(const Ballot& ballot) {
    if (ballot.unused()) return {};
    const std::uint32_t state = index_of(ballot.proposed_state), message = index_of(ballot.message);
    return fb::CreateBallot(b_, ballot.open, ballot.vote, ballot.default_vote, ballot.summary, state, message);
  }

  Offset<fb::Provider> put(const Member& m) {
    const auto session = pack(m.to.session);
    const auto local_name = b_.CreateString(m.local_name);
    const auto ballot = put(m.ballot);
    return fb::CreateProvider(b_, &session, m.to.token, m.user, m.id.instance, local_name, m.leaving, m.gone_code,
                              ballot);
  }

  Offset<fb::Queued> put(std::uint64_t place, const Group::Queued& queued) {
    const std::uint32_t who = provider_indices_.at(queued.who.get());
    if (const auto* join = std::get_if<JoinRequest>(&queued.request)) {
      const auto attributes = gs::put(b_, join->attributes);
      return fb::CreateQueued(b_, place, who, attributes);
    }
    const auto& request = std::get<LeaveRequest>(queued.request);
    const auto leave = fb::CreateLeave(b_, request.terms.num_phases, request.terms.time_limit, request.leave_code);
    return fb::CreateQueued(b_, place, who, 0, leave);
  }

  Offset<fb::Expel> put_expel(const Group::Run& run) {
    if (!run.expel_info) return {};
    const auto flag = gs::put(b_, run.expel_info->flag);
    const auto session = pack(run.charge.payer().session);
    return fb::CreateExpel(b_, run.expel_info->deactivate_phase, flag, &session, run.charge.payer().user);
  }

  /// The leave codes of what takes members out by itself follow from the protocol.
  Offset<flatbuffers::Vector<std::uint32_t>> voluntary_codes(const Group::Run& run) {
    std::vector<std::uint32_t> codes;
    if (run.traits->type == WYX_LEAVE)
      for (const LeaveCode& code : *run.leave_codes) codes.push_back(code.voluntary_code);
    return b_.CreateVector(codes);
  }

  Offset<fb::Run> put(const Group::Run& run) {
    const auto proposed_by = pack(run.proposed_by);
    const auto changing = indices_of(run.changing);
    const auto leave_codes = voluntary_codes(run);
    const auto expel = put_expel(run);
    const auto new_attributes = gs::put(b_, run.new_attributes);
    const std::uint32_t state = index_of(run.proposed_state), message = index_of(run.message);
    const std::uint32_t voted_message = index_of(run.voted_message);
    const auto voters = indices_of(run.voters);
    return fb::CreateRun(b_, run.traits->type, run.number, run.terms.time_limit, run.phase, &proposed_by, changing,
                         leave_codes, expel, new_attributes, state, message, voted_message, voters, run.defaults);
  }

  Builder& b_;
  std::vector<SharedBytes>& all_values_;
  const Group& group_;
  std::vector<const Member*> providers_;
  Offsets<fb::Value> values_;
  // For looking up only: their order is not that of any other replica.
  std::unordered_map<const Member*, std::uint32_t> provider_indices_;
  std::unordered_map<const Ledger::Charge*, std::uint32_t> value_indices_;
};

SnapshotBytes write_snapshot(const EngineState& state) {
  if (state.ledger.total() > kMostKept) return {};
  Builder b(kFirstSize);
  std::vector<SharedBytes> values;
  Offsets<fb::Group> groups;
  std::map<std::string_view, std::uint32_t> indices;
  for (const auto& [name, group] : state.groups) {
    indices.emplace(name, static_cast<std::uint32_t>(groups.size()));
    groups.push_back(GroupWriter(b, values, group).write());
  }
  std::vector<std::uint32_t> line;
  for (const std::string& name : state.line) line.push_back(indices.at(name));
  Offsets<fb::Subscriptions> subscriptions;
  for (const auto& [name, subscribers] : state.subscribers.groups())
    subscriptions.push_back(put(b, name, subscribers));

  const auto limits = put(b, state.limits);
  const auto group_offsets = b.CreateVector(groups);
  const auto line_offset = b.CreateVector(line);
  const auto subscription_offsets = b.CreateVector(subscriptions);
  const auto& gone = state.hosts.gone();
  const auto gone_hosts = b.CreateVector(std::vector<std::uint32_t>(gone.begin(), gone.end()));
  Offsets<fb::Host> hosts;
  for (const auto& [node, host] : state.hosts.here()) hosts.push_back(put(b, node, host));
  const auto host_offsets = b.CreateVector(hosts);
  b.Finish(fb::CreateSnapshot(b, limits, group_offsets, line_offset, subscription_offsets,
                              state.subscribers.last_subscription(), gone_hosts, host_offsets,
                              state.hosts.seqnum(), state.last_protocol, state.numbers_above, state.ended_number),
           kSnapshotId);
  const auto head = std::as_bytes(std::span(b.GetBufferPointer(), b.GetSize()));
  return {{head.begin(), head.end()}, std::move(values)};
}

}  // namespace gs
