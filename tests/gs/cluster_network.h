// Hosts, the rings that they form, and a process group over them with extended virtual synchrony.
//
// A ring has one order of messages, which each member receives at its own pace. When a ring ends, those who go on
// together first receive what any of them has; what they say from then on goes into the next ring. A ring may be
// given up before all members, or any, have been shown it; who came through such a ring together is apart from
// those who did not, though none may notice.
#pragma once

#include <algorithm>
#include <deque>

#include "cluster/replication.h"
#include "gs/random.h"

namespace gs::cluster::test {

using gs::test::Random;

struct Joins {};
struct Leaves {
  std::uint32_t code = 0;
};
struct Sent {
  Process from;
  std::uint64_t connection = 0;  // of a daemon to its Corosync
  std::variant<Joins, Leaves, std::shared_ptr<const Message>> what;
};
struct Received {
  Process from;
  std::shared_ptr<const Message> message;
};
using Input = std::variant<View, RingId, Received>;

struct Ring {
  RingId id;
  std::vector<Node> members;
  std::vector<Sent> order;
};

/// A host's Corosync.
struct Station {
  Node node = 0;
  bool up = false;
  int side = 0;                  // of the cut
  std::shared_ptr<Ring> ring;    // the last that was shown
  std::size_t position = 0;      // received of its order
  bool gathering = true;         // the ring is over, the next one is not there
  std::uint64_t companions = 0;  // differs from that of those who were not in the rings that were not shown
  std::uint64_t sequence = 0;    // of the last ring; survives
  std::set<Process> group;       // as it was shown
  std::set<Process> local;       // of the group
  std::deque<Sent> outbox;
  std::optional<Sent> owed;  // the leave of a daemon that died, not yet sent
  // Its daemon's.
  std::uint64_t connection = 0;
  bool listening = false;  // is in the group
  std::deque<Input> inbox;
  std::deque<Verdict> verdicts;
  std::optional<Verdict> latest;
};

class Network {
 public:
  explicit Network(int hosts) : stations_(static_cast<std::size_t>(hosts) + 1) {
    for (Node node = 1; node < stations_.size(); ++node) stations_[node].node = node;
  }
  Station& at(Node node) { return stations_[node]; }
  const Station& at(Node node) const { return stations_[node]; }
  Node hosts() const { return static_cast<Node>(stations_.size() - 1); }
  bool connected(Node a, Node b) const {
    return stations_[a].up && stations_[b].up && stations_[a].side == stations_[b].side;
  }

  bool is_quorate(const RingId& ring) const { return 2 * rings_.at(ring).size() > hosts(); }
  const std::vector<Node>& members(const RingId& ring) const { return rings_.at(ring); }

  // ---------------------------------------------------------------------------------------------- of a daemon

  void start(Node node) {
    Station& host = at(node);
    if (host.latest) host.verdicts.push_back(*host.latest);
  }
  void join(const Process& self) {
    Station& host = at(self.node);
    host.connection = ++connections_;
    host.outbox.push_back({self, host.connection, Joins{}});
    send_owed(host);
  }
  void leave(const Process& self, std::uint32_t code) {
    disconnect(at(self.node));
    at(self.node).outbox.push_back({self, 0, Leaves{code}});
  }
  /// `late`: the next daemon may be there before this one has left.
  void died(const Process& self, bool late) {
    Station& host = at(self.node);
    disconnect(host);
    host.verdicts.clear();
    send_owed(host);
    host.owed = Sent{self, 0, Leaves{WYX_PROVIDER_FAILURE}};
    if (!late) send_owed(host);
  }
  void send(const Process& self, const Message& message) {
    Station& host = at(self.node);
    host.outbox.push_back({self, host.connection, std::make_shared<const Message>(message)});
  }

  // ------------------------------------------------------------------------------------------------ of a host

  void host_up(Node node) { at(node).up = true; }
  void host_down(Node node) {
    Station off;
    off.node = node;
    off.side = at(node).side;
    off.sequence = at(node).sequence;
    at(node) = std::move(off);
  }
  /// The host's ring is there at all its members.
  bool is_whole(const Station& host) const {
    if (!host.up || host.gathering) return false;
    return std::ranges::all_of(host.ring->members, [&](Node node) {
      const Station& other = stations_[node];
      return connected(host.node, node) && other.ring == host.ring && !other.gathering;
    });
  }
  /// Its members have formed none after it, though not all may have been shown it: who has may say something in
  /// it.
  bool is_latest(const Station& host) const {
    if (!host.up || host.gathering) return false;
    return std::ranges::all_of(host.ring->members, [&](Node node) {
      return connected(host.node, node) && stations_[node].sequence == host.ring->id.sequence;
    });
  }
  bool is_to_reform(const Station& host) const {
    return host.up && !(is_whole(host) && component(host.node) == host.ring->members);
  }
  bool can_order(const Station& host) const { return (!host.outbox.empty() || host.owed) && is_latest(host); }
  bool can_receive(const Station& host) const { return host.position < received_around(host); }

  /// The next message of this host goes into the order; who sends has received all before it.
  void order(Node node) {
    Station& host = at(node);
    if (!can_order(host)) return;
    if (host.outbox.empty()) send_owed(host);
    host.ring->order.push_back(std::move(host.outbox.front()));
    host.outbox.pop_front();
    receive(host, host.ring->order.size());
  }
  void receive(Node node, std::size_t count) {
    Station& host = at(node);
    receive(host, std::min(host.position + count, received_around(host)));
  }

  /// It is cut off for so short that nobody is shown a ring of it: what the others receive meanwhile it may miss.
  void blip(Node node) {
    Station& host = at(node);
    if (!host.up) return;
    host.sequence += 4;
    host.companions = host.sequence * 16 + 8 + node;
    host.gathering = true;
  }
  /// A new ring of the hosts that this one can reach. `random`: it may be given up, or leave somebody out.
  /// `lost`: more often than not.
  void reform(Node node, Random* random, bool lost = false) {
    if (!at(node).up) return;
    auto members = component(node);
    if (random && random->chance(lost ? 60 : 20))
      std::erase_if(members, [&](Node m) { return m != node && random->chance(lost ? 60 : 40); });
    auto ring = std::make_shared<Ring>(Ring{{0, members.front()}, members, {}});
    for (const Node m : members) ring->id.sequence = std::max(ring->id.sequence, at(m).sequence + 4);
    rings_[ring->id] = members;
    const auto apart = equalise(members, ring->id);
    const int percent = !random || random->chance(lost ? 20 : 60) ? 100 : random->chance(60) ? 0 : 50;
    std::set<Node> shown;
    for (const Node m : members)
      if (percent == 100 || random->chance(percent)) shown.insert(m);
    std::set<Process> group;
    for (const Node m : members) group.insert(at(m).local.begin(), at(m).local.end());
    for (const Node m : members) {
      Station& host = at(m);
      host.sequence = ring->id.sequence;
      host.gathering = !shown.contains(m);
      if (!host.gathering)
        install(host, ring, group, random && random->chance(30) ? apart.at(m) : std::set<Node>());
      judge(host, *ring, shown.size() < members.size() ? random : nullptr);
    }
  }

 private:
  void disconnect(Station& host) {
    host.connection = 0;
    host.listening = false;
    host.inbox.clear();
  }
  void send_owed(Station& host) {
    if (host.owed) host.outbox.push_back(*std::exchange(host.owed, {}));
  }
  std::vector<Node> component(Node node) const {
    std::vector<Node> members;
    for (const Station& other : stations_)
      if (other.node != 0 && connected(node, other.node)) members.push_back(other.node);
    return members;
  }
  /// How far anybody has received whom this host can have it from.
  std::size_t received_around(const Station& host) const {
    std::size_t position = host.position;
    if (!host.up || !host.ring || host.gathering) return position;
    for (const Station& other : stations_)
      if (connected(host.node, other.node) && other.ring == host.ring && other.companions == host.companions)
        position = std::max(position, other.position);
    return position;
  }

  /// Who comes from the same ring the same way receives the same of it. Says who does not come with each.
  std::map<Node, std::set<Node>> equalise(const std::vector<Node>& members, const RingId& next) {
    std::map<std::pair<RingId, std::uint64_t>, std::set<Node>> together;
    std::map<Node, std::set<Node>> apart;
    for (const Node m : members)
      together[{at(m).ring ? at(m).ring->id : RingId{0, m}, at(m).companions}].insert(m);
    std::uint64_t number = next.sequence * 16;
    for (const auto& [from, nodes] : together) {
      std::size_t position = 0;
      for (const Node m : nodes) position = std::max(position, at(m).position);
      ++number;
      for (const Node m : nodes) {
        receive(at(m), position);
        at(m).companions = number;
        std::ranges::set_difference(members, nodes, std::inserter(apart[m], apart[m].end()));
      }
    }
    return apart;
  }

  /// Processes of hosts that are `apart` are shown as gone and come, the others only where something has changed.
  void install(Station& host, const std::shared_ptr<Ring>& ring, const std::set<Process>& group,
               const std::set<Node>& apart) {
    View view{{group.begin(), group.end()}, {}, {}};
    for (const Process& p : group)
      if (!host.group.contains(p) || apart.contains(p.node)) view.joined.push_back(p);
    for (const Process& p : host.group)
      if (!group.contains(p) || apart.contains(p.node)) view.left[p] = WYX_HOST_FAILURE;
    host.ring = ring;
    host.position = 0;
    host.companions = 0;
    host.group = group;
    if (!host.listening) return;
    if (!view.joined.empty() || !view.left.empty()) host.inbox.push_back(std::move(view));
    host.inbox.push_back(ring->id);
  }

  /// That of a ring that is given up (`random`) may never come.
  void judge(Station& host, const Ring& ring, Random* random) {
    if (random && random->chance(60)) return;
    Verdict verdict{ring.id, is_quorate(ring.id), {}, hosts() / 2 + 1};
    for (const Node m : ring.members) verdict.votes[m] = 1;
    host.latest = verdict;
    host.verdicts.push_back(std::move(verdict));
  }

  void receive(Station& host, std::size_t position) {
    while (host.position < position) take(host, host.ring->order[host.position++]);
  }
  void take(Station& host, const Sent& sent) {
    if (const auto* message = std::get_if<std::shared_ptr<const Message>>(&sent.what)) {
      if (host.listening && host.group.contains(sent.from)) host.inbox.push_back(Received{sent.from, *message});
      return;
    }
    View view;
    const auto* leaves = std::get_if<Leaves>(&sent.what);
    if (leaves ? host.group.erase(sent.from) == 0 : !host.group.insert(sent.from).second) return;
    const bool own = !leaves && sent.connection == host.connection;
    if (leaves) {
      view.left[sent.from] = leaves->code;
    } else {
      view.joined.push_back(sent.from);
    }
    if (sent.from.node == host.node) host.local = local_of(host);
    if (own) host.listening = true;
    if (!host.listening) return;
    view.members.assign(host.group.begin(), host.group.end());
    host.inbox.push_back(std::move(view));
    if (own) host.inbox.push_back(host.ring->id);
  }
  std::set<Process> local_of(const Station& host) const {
    std::set<Process> local;
    std::ranges::copy_if(host.group, std::inserter(local, local.end()),
                         [&](const Process& p) { return p.node == host.node; });
    return local;
  }

  std::vector<Station> stations_;
  std::map<RingId, std::vector<Node>> rings_;  // all that were ever formed
  std::uint64_t connections_ = 0;
};

}  // namespace gs::cluster::test
