#include "daemon/inspection.h"

#include <arpa/inet.h>
#include <unistd.h>

#include <algorithm>
#include <limits>

namespace gs::daemon {
namespace {

constexpr std::size_t kGroupsAtOnce = 256;
constexpr std::size_t kEntriesAtOnce = 1024;
constexpr std::size_t kContentsAtOnce = 512 * 1024;  // bytes of state values, members and voters

using inspect::ReportT;
template <typename T>
using List = std::vector<std::unique_ptr<T>>;

std::int64_t age(Moment since, const Facts& facts) { return since == 0 ? -1 : facts.now.count() - since; }
std::int64_t age(Time since, const Facts& facts) { return (facts.now - since).count(); }

const char* name_of(wyx_num_phases_t phases) { return phases == WYX_N_PHASE ? "n" : "1"; }

const char* name_of(wyx_vote_value_t vote) {
  if (vote == WYX_VOTE_APPROVE) return "approve";
  return vote == WYX_VOTE_REJECT ? "reject" : "none";
}

const SessionStatus* session_of(SessionId id, const Facts& facts) {
  if (facts.domain == nullptr || id.node != facts.domain->self) return nullptr;
  const auto found = std::ranges::lower_bound(facts.sessions, id.number, {}, &SessionStatus::number);
  return found == facts.sessions.end() || found->number != id.number ? nullptr : &*found;
}

std::unique_ptr<inspect::ProcessT> process_of(const SessionStatus& session) {
  auto process = std::make_unique<inspect::ProcessT>();
  process->program = session.program;
  process->pid = static_cast<std::uint32_t>(session.pid);
  process->uid = session.uid;
  return process;
}

// -------------------------------------------------------------------------------------------------- the daemon

class Counts {
 public:
  explicit Counts(List<inspect::CountT>& to) : to_(to) {}
  void counter(const char* name, std::uint64_t value, const char* help) { add(name, value, help, "", false); }
  void gauge(const char* name, std::uint64_t value, const char* help, const char* unit = "") {
    add(name, value, help, unit, true);
  }

 private:
  void add(const char* name, std::uint64_t value, const char* help, const char* unit, bool gauge) {
    auto count = std::make_unique<inspect::CountT>();
    count->name = name;
    count->help = help;
    count->unit = unit;
    count->gauge = gauge;
    count->value = value;
    to_.push_back(std::move(count));
  }
  List<inspect::CountT>& to_;
};

void add_counts(const Facts& facts, List<inspect::CountT>& to) {
  Counts add(to);
  const Totals totals = facts.engine.totals();
  add.gauge("groups", totals.groups, "Groups that have members or wait for their first");
  add.gauge("members", totals.members, "Members of all groups");
  add.gauge("subscribers", totals.subscribers, "Subscribers of all groups");
  add.gauge("running_protocols", totals.running, "Protocols that wait for votes");
  add.gauge("sessions", facts.session_count, "Clients of this host that are connected");
  add.gauge("kept_bytes", facts.engine.kept_bytes(), "Memory that groups keep for their members", "bytes");
  add.gauge("waiting_bytes", facts.waiting_bytes, "What waits for clients to read it", "bytes");
  const Counters& counters = facts.counters;
  add.counter("connections_opened", counters.connections, "Connections that were taken");
  add.counter("sessions_opened", counters.sessions, "Sessions that were begun");
  add.counter("faults", counters.faults, "Clients closed for what they did or did not do");
  add.counter("requests", counters.requests, "Requests of clients of this host");
  add.counter("requests_refused", counters.refused, "Requests with another answer than WYX_OK");
  add.counter("notifications", counters.notifications, "Notifications to clients of this host");
  add.counter("pings", counters.pings, "Pings to clients");
  add.counter("tap_missed", counters.missed, "Happenings that slow taps have missed");
  const Tally& tally = facts.engine.tally();
  add.counter("protocols_begun", tally.begun, "Protocols that were started");
  add.counter("protocols_approved", tally.approved, "Protocols that were approved");
  add.counter("protocols_rejected", tally.rejected, "Protocols that were rejected");
  add.counter("votes", tally.votes, "Votes of members");
  add.counter("default_votes", tally.default_votes, "Votes counted for members that gave none");
  add.counter("failures", tally.failures, "Members that have died or said goodbye");
}

void report_daemon(const Facts& facts, ReportT& report) {
  report.daemon = std::make_unique<inspect::DaemonT>();
  inspect::DaemonT& daemon = *report.daemon;
  daemon.version = facts.version;
  daemon.pid = static_cast<std::uint32_t>(getpid());
  daemon.node = facts.domain != nullptr ? facts.domain->self : facts.node;
  daemon.ordering = facts.ordering;
  daemon.serving = facts.domain != nullptr;
  daemon.will_serve = daemon.serving || facts.will_serve;
  const bool alone = daemon.ordering == "local";
  daemon.quorum = alone ? "none" : (daemon.serving ? "has" : "lost");
  if (facts.domain != nullptr) daemon.nodes.assign(facts.domain->nodes.begin(), facts.domain->nodes.end());
  daemon.age_ms = age(facts.started, facts);
  add_counts(facts, daemon.counts);
}

// -------------------------------------------------------------------------------------------------- groups

std::unique_ptr<inspect::AttributesT> attributes_of(const GroupAttributes& from) {
  constexpr const char* kMerges[] = {"dissolve", "larger", "smaller", "dont-care", "any-order"};
  static_assert(std::size(kMerges) == WYX_LAST_MERGE_TYPE + 1);
  auto to = std::make_unique<inspect::AttributesT>();
  to->client_version = from.client_version;
  to->batch_control = from.batch_control;
  to->num_phases = name_of(from.num_phases);
  to->source_reflection_num_phases = name_of(from.source_reflection_num_phases);
  to->default_vote = name_of(from.default_vote);
  to->merge_control = kMerges[from.merge_control];
  to->time_limit = from.time_limit;
  to->source_reflection_time_limit = from.source_reflection_time_limit;
  to->source_group = from.source_group_name;
  return to;
}

/// What is too much for one page is left without a name: a report must not become more than its reader takes.
List<inspect::VoterT> voters_of(const std::vector<MissingVoter>& from, std::size_t& page) {
  List<inspect::VoterT> voters;
  for (const MissingVoter& voter : from) {
    voters.push_back(std::make_unique<inspect::VoterT>());
    voters.back()->id = std::make_unique<inspect::Id>(id_of(voter.id));
    if (page < kContentsAtOnce) voters.back()->name = voter.local_name;
    page += sizeof(inspect::VoterT) + voters.back()->name.size();
  }
  return voters;
}

std::unique_ptr<inspect::ProtocolT> protocol_of(const ProtocolStatus& from, const Facts& facts,
                                                std::size_t& page) {
  auto to = std::make_unique<inspect::ProtocolT>();
  to->kind = from.kind;
  to->number = from.number;
  to->proposed_by = std::make_unique<inspect::Id>(id_of(from.proposed_by));
  to->n_phase = from.terms.num_phases == WYX_N_PHASE;
  to->phase = from.phase;
  to->time_limit = from.terms.time_limit;
  to->age_ms = age(from.since, facts);
  to->phase_age_ms = age(from.phase_since, facts);
  to->missing = voters_of(from.missing, page);
  to->voted = voters_of(from.voted, page);
  to->changing = ids_of(from.changing);
  return to;
}

std::unique_ptr<inspect::GroupT> group_of(const GroupStatus& from, const Facts& facts, const inspect::AskT& ask,
                                          std::size_t& page) {
  auto to = std::make_unique<inspect::GroupT>();
  to->name = from.name;
  if (from.attributes && !ask.brief) to->attributes = attributes_of(*from.attributes);
  to->members = ids_of(from.members);
  to->state_size = from.state->size();
  if (ask.contents) to->state = *from.state;
  page += to->state.size() + to->members.size() * sizeof(inspect::Id);
  to->event_number = from.seqnum;
  to->age_ms = age(from.since, facts);
  to->subscribers = from.subscribers;
  to->waiting = from.waiting;
  if (from.running) to->running = protocol_of(*from.running, facts, page);
  return to;
}

/// The groups that are asked for, the next of them by name.
class WantedGroups {
 public:
  WantedGroups(const inspect::AskT& ask, const Engine& engine) : names_(ask.groups), engine_(engine) {
    std::ranges::sort(names_);
    after_ = ask.after;
  }
  std::optional<GroupStatus> next() {
    if (!names_.empty()) return next_of_names();
    if (at_ == page_.size()) {
      page_ = engine_.status(after_, kGroupsAtOnce);
      at_ = 0;
    }
    if (page_.empty()) return std::nullopt;
    after_ = page_[at_].name;
    return page_[at_++];
  }
  /// The name of the last one.
  const std::string& after() const { return after_; }

 private:
  std::optional<GroupStatus> next_of_names() {
    for (auto at = std::ranges::upper_bound(names_, after_); at != names_.end(); ++at) {
      after_ = *at;
      if (auto status = engine_.status_of(*at)) return status;
    }
    return std::nullopt;
  }

  std::vector<std::string> names_;  // none: all
  const Engine& engine_;
  std::string after_;
  std::vector<GroupStatus> page_;
  std::size_t at_ = 0;
};

void report_groups(const inspect::AskT& ask, const Facts& facts, ReportT& report) {
  WantedGroups wanted(ask, facts.engine);
  std::size_t page = 0;
  while (const auto group = wanted.next()) {
    report.groups.push_back(group_of(*group, facts, ask, page));
    if (report.groups.size() < kGroupsAtOnce && page < kContentsAtOnce) continue;
    report.more = true;
    report.next_group = wanted.after();
    return;
  }
}

void report_members(const inspect::AskT& ask, const Facts& facts, ReportT& report) {
  if (ask.groups.empty()) return;
  for (const MemberStatus& from : facts.engine.members_of(ask.groups.front(), ask.from, kEntriesAtOnce)) {
    auto to = std::make_unique<inspect::MemberT>();
    to->id = std::make_unique<inspect::Id>(id_of(from.id));
    to->name = from.local_name;
    to->state = from.state;
    to->session = from.to.session.number;
    if (const SessionStatus* session = session_of(from.to.session, facts)) {
      to->process = process_of(*session);
      to->responsive = session->responding;
    }
    to->age_ms = age(from.since, facts);
    report.members.push_back(std::move(to));
  }
  report.more = report.members.size() == kEntriesAtOnce;
  report.next = ask.from + report.members.size();
}

// ------------------------------------------------------------------------------------- subscribers, sessions,
// nodes

std::vector<std::string> wants_of(std::uint32_t control) {
  constexpr std::pair<std::uint32_t, const char*> kNames[] = {{WYX_SUBSCRIBE_STATE, "state"},
                                                              {WYX_SUBSCRIBE_DELTA_JOINS, "joins"},
                                                              {WYX_SUBSCRIBE_DELTA_LEAVES, "leaves"},
                                                              {WYX_SUBSCRIBE_MEMBERSHIP, "membership"},
                                                              {WYX_SUBSCRIBE_PERSISTENCE, "persistence"}};
  std::vector<std::string> wants;
  for (const auto& [flag, name] : kNames)
    if (control & flag) wants.emplace_back(name);
  return wants;
}

std::unique_ptr<inspect::SubscriberT> subscriber_of(const SubscriberStatus& from, const Facts& facts) {
  auto to = std::make_unique<inspect::SubscriberT>();
  to->group = from.group;
  to->number = from.number;
  to->node = from.to.session.node;
  to->session = from.to.session.number;
  to->wants = wants_of(from.control);
  if (const SessionStatus* session = session_of(from.to.session, facts)) to->process = process_of(*session);
  return to;
}

/// Goes on in the group where the last page has ended, then with those after it.
void report_subscribers(const inspect::AskT& ask, const Facts& facts, ReportT& report) {
  std::vector<std::string> names = ask.groups;
  std::ranges::sort(names);
  const auto next_group = [&](const std::string& after) {
    if (names.empty()) return facts.engine.next_subscribed(after);
    const auto at = std::ranges::upper_bound(names, after);
    return at == names.end() ? std::string() : *at;
  };
  std::uint64_t above = ask.from;
  for (std::string group = ask.after.empty() ? next_group("") : ask.after; !group.empty(); above = 0) {
    const std::size_t room = kEntriesAtOnce - report.subscribers.size();
    for (const SubscriberStatus& from : facts.engine.subscribers_of(group, above, room))
      report.subscribers.push_back(subscriber_of(from, facts));
    if (report.subscribers.size() == kEntriesAtOnce) {
      report.more = true;
      report.next_group = group;
      report.next = report.subscribers.back()->number;
      return;
    }
    group = next_group(group);
  }
}

void report_sessions(const inspect::AskT& ask, const Facts& facts, ReportT& report) {
  auto from = std::ranges::upper_bound(facts.sessions, ask.from, {}, &SessionStatus::number);
  for (; from != facts.sessions.end() && report.sessions.size() < kEntriesAtOnce; ++from) {
    auto to = std::make_unique<inspect::SessionT>();
    to->number = from->number;
    to->process = process_of(*from);
    if (facts.domain != nullptr)
      std::tie(to->providers, to->subscribers) = facts.engine.clients_of({facts.domain->self, from->number});
    to->answer_bytes = from->answer_bytes;
    to->notification_bytes = from->notification_bytes;
    to->responsive = from->responding;
    to->age_ms = age(from->since, facts);
    report.next = from->number;
    report.sessions.push_back(std::move(to));
  }
  report.more = from != facts.sessions.end();
}

std::string text_of(const Adapter& adapter) {
  constexpr std::uint8_t kMapped[12] = {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xFF, 0xFF};
  const bool is_v4 = std::equal(std::begin(kMapped), std::end(kMapped), adapter.address.begin());
  char text[INET6_ADDRSTRLEN] = {};
  inet_ntop(is_v4 ? AF_INET : AF_INET6, adapter.address.data() + (is_v4 ? std::size(kMapped) : 0), text,
            sizeof text);
  return adapter.name + " " + text;
}

void report_nodes(const Facts& facts, ReportT& report) {
  if (facts.domain == nullptr) return;
  const auto& hosts = facts.engine.hosts();
  for (const auto& [node, host] : hosts) {
    auto to = std::make_unique<inspect::NodeT>();
    to->number = node;
    to->epoch = host.epoch;
    to->here = node == facts.domain->self;
    to->master = node == hosts.begin()->first;
    for (const Adapter& adapter : host.adapters) to->adapters.push_back(text_of(adapter));
    report.nodes.push_back(std::move(to));
  }
}

}  // namespace

std::vector<inspect::Id> ids_of(const SharedMembership& members) {
  std::vector<inspect::Id> ids;
  if (!members) return ids;
  ids.reserve(members->size());
  for (const ProviderId id : *members) ids.push_back(id_of(id));
  return ids;
}

inspect::ReportT report(const inspect::AskT& ask, const Facts& facts) {
  ReportT report;
  switch (ask.what) {
    case inspect::What::Daemon:
      report_daemon(facts, report);
      break;
    case inspect::What::Groups:
      report_groups(ask, facts, report);
      break;
    case inspect::What::Members:
      report_members(ask, facts, report);
      break;
    case inspect::What::Subscribers:
      report_subscribers(ask, facts, report);
      break;
    case inspect::What::Sessions:
      report_sessions(ask, facts, report);
      break;
    case inspect::What::Nodes:
      report_nodes(facts, report);
      break;
    case inspect::What::Tap:
      break;
  }
  return report;
}

}  // namespace gs::daemon
