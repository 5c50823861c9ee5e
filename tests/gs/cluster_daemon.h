// A simulated host's daemon: replication, engine and a few clients.
#pragma once

#include <cstring>
#include <unordered_map>

#include "engine/engine.h"
#include "engine/text.h"
#include "gs/cluster_history.h"
#include "gs/cluster_network.h"
#include "gs/cluster_text.h"

namespace gs::cluster::test {

using Seen = std::map<std::string, std::uint64_t>;  // how often what has happened

struct Plan {
  int hosts = 3;
  bool safe = true;
  Rule without = Rule::kNone;
  std::size_t piece = 64;
  Limits limits;
  bool adapters = false;  // are published: an event more may mend what else would be found
};

struct Datagram {
  Node from = 0;
  Node to = 0;
  std::string address;
  std::string key;
  Confirmed confirmed;
};

/// What the hosts of one simulation share.
struct World {
  explicit World(const Plan& of) : plan(of), network(of.hosts), history(static_cast<Node>(of.hosts)) {}

  /// For whoever reads a failure.
  void tell(Node node, const std::string& what) {
    if (story) *story += "    node " + std::to_string(node) + " " + what + "\n";
  }

  const Plan plan;
  std::string* story = nullptr;
  Network network;
  History history;
  Time now{0};
  std::vector<Datagram> datagrams;
  std::deque<TimerId> timers;                    // that somebody has armed
  std::set<SessionId> sessions;                  // all that have begun
  std::set<SessionId> over;                      // those that have ended
  std::map<Node, Word> words;                    // everybody's last, since it has lost its state
  std::set<std::pair<Node, BeginId>> concluded;  // who has confirmed the decision of which exchange
  struct Named {
    std::uint64_t name = 0;
    std::shared_ptr<const Event> event;
  };
  std::unordered_map<const Event*, Named> events;  // all that were ever sent
  Seen seen;
  std::map<Node, Adapters> adapters;  // that each has published last
  std::uint64_t last_adapter = 0;
  std::uint64_t last_life = 0;
  std::uint32_t last_pid = 0;
};

class Daemon : public Order, public Replica, public Host {
 public:
  Daemon(World& world, Node node)
      : world_(world),
        self_{node, ++world.last_pid},
        engine_(std::make_unique<Engine>(world.plan.limits)),
        replication_(
            {.self = self_,
             .safe = world.plan.safe,
             .member_timeout = Duration(1'000),
             .piece = world.plan.piece,
             .without = world.plan.without},
            *this, *this, *this, [this] { return Random(++world_.last_life).next(); },
            [this] { return 1'700'000'000'000u + static_cast<std::uint64_t>(world_.now.count()); }) {
    world_.network.start(node);
  }
  Daemon(const Daemon&) = delete;
  Daemon& operator=(const Daemon&) = delete;
  ~Daemon() override { lose_state(); }

  const Process& self() const { return self_; }
  Replication& replication() { return replication_; }
  bool has_given_up() const { return has_given_up_; }
  bool hung = false;

  // ------------------------------------------------------------------------------------------- what it is given

  void deliver(std::size_t count) {
    auto& inbox = world_.network.at(self_.node).inbox;
    replication_.advance(world_.now);
    for (; count > 0 && !inbox.empty(); --count) {
      const Input input = std::move(inbox.front());
      inbox.pop_front();
      world_.tell(self_.node, "reads " + test::text(input));
      std::visit([this](const auto& i) { take(i); }, input);
    }
    replication_.settle();
  }
  void judge() {
    auto& verdicts = world_.network.at(self_.node).verdicts;
    if (verdicts.empty()) return;
    replication_.advance(world_.now);
    const Verdict verdict = std::move(verdicts.front());
    verdicts.pop_front();
    world_.tell(self_.node,
                "hears of ring " + text(verdict.ring) + (verdict.quorate ? " quorate" : " not quorate"));
    replication_.verdict(verdict);
  }
  void take(const Datagram& datagram) {
    const auto peer = peers_.find(datagram.from);
    if (datagram.address != address() || peer == peers_.end() || peer->second.key != datagram.key) return;
    replication_.advance(world_.now);
    replication_.confirmed(datagram.from, datagram.confirmed);
  }

  // --------------------------------------------------------------------------------------------------- clients

  void begin_session() {
    if (!replication_.serves() || clients_.size() >= 3) return;
    const SessionId id{self_.node, last_session_ = std::max(last_session_, domain_.sessions_above) + 1};
    clients_[id] = {};
    if (!world_.sessions.insert(id).second) world_.history.error("numbers twice: one names two sessions");
  }
  void end_session(Random& random) {
    if (clients_.empty()) return;
    const SessionId id = random.one_of(clients_).first;
    clients_.erase(id);
    world_.over.insert(id);
    replication_.submit(SessionGoneEvent{id});
  }
  /// A request is sent on where it is not refused at once.
  void request(Random& random) {
    if (clients_.empty()) return;
    auto& [id, client] = random.one_of(clients_);
    for (int i = 0; i < 4; ++i) {
      const Request made = make(random);
      if (engine_->precheck(id, made) != WYX_OK) continue;
      ++client.pending;
      return replication_.submit(RequestEvent{id, made, random.chance(50)});
    }
  }
  /// What a daemon has to order itself; mostly the first one does.
  void work(Random& random, bool calm) {
    const bool publishes = world_.plan.adapters && (calm ? !published_ : random.chance(5));
    if (replication_.serves() && publishes) publish_adapters();
    if (!replication_.serves() || (domain_.rank > 0 && (calm || random.chance(80)))) return;
    if (!calm && !world_.timers.empty() && random.chance(30))
      return replication_.submit(TimerExpiredEvent{random.one_of(world_.timers)});
    if (engine_->busy() && !continued_) replication_.submit(ContinueEvent{});
    continued_ = engine_->busy();
  }

  // ---------------------------------------------------------------------------------------------------- checks

  bool has_pending() const {
    return std::ranges::any_of(clients_, [](const auto& c) { return c.second.pending > 0; });
  }
  History::Place place() const { return place_; }
  /// Of every host that takes part, as its daemon is now.
  bool knows_all_adapters() const {
    return !world_.plan.adapters || std::ranges::all_of(engine_->hosts(), [this](const auto& host) {
      const auto last = world_.adapters.find(host.first);
      return last != world_.adapters.end() && host.second.adapters == last->second;
    });
  }
  bool knows(SessionId id) const {
    for (const Token token : {0, 1})
      if (engine_->precheck(id, GoodbyeRequest{token}) == WYX_OK) return true;
    return engine_->precheck(id, UnsubscribeRequest{kSubscriber}) == WYX_OK;
  }
  /// A session whose subscription is not known.
  std::optional<SessionId> missing() const {
    for (const auto& [id, client] : clients_)
      if (client.subscribed && engine_->precheck(id, UnsubscribeRequest{kSubscriber}) != WYX_OK) return id;
    return {};
  }

  // ----------------------------------------------------------------------------------------------------- Order

  void join() override {
    world_.tell(self_.node, "joins");
    world_.network.join(self_);
  }
  void leave() override {
    world_.network.leave(self_, WYX_HOST_LEAVE_DUE_TO_STOP);
    lose_state();
  }
  void send(const Message& message) override {
    if (const auto* word = std::get_if<Word>(&message)) {
      world_.words[self_.node] = *word;
      own_word_ = *word;
    }
    if (const auto* ordered = std::get_if<Ordered>(&message))
      world_.events[ordered->event.get()] = {world_.events.size(), ordered->event};
    if (const auto* confirmed = std::get_if<Confirmed>(&message))
      world_.concluded.emplace(self_.node, confirmed->begin);
    world_.tell(self_.node, "sends " + test::text(message));
    world_.network.send(self_, message);
  }
  void confirm(const Confirmed& confirmed) override {
    world_.concluded.emplace(self_.node, confirmed.begin);
    for (const auto& [node, word] : peers_)
      if (node != self_.node) world_.datagrams.push_back({self_.node, node, word.address, key(), confirmed});
  }
  void set_peers(const std::map<Node, Word>& peers) override { peers_ = peers; }
  std::string address() const override { return std::to_string(self_.pid); }
  std::string key() const override { return "key of " + address(); }

  // --------------------------------------------------------------------------------------------------- Replica

  void apply(const Event& event) override {
    const auto out = engine_->apply(event);
    for (const TimerRequest& timer : out.timers) world_.timers.push_back(timer.id);
    while (world_.timers.size() > 8) world_.timers.pop_front();
    place_ = world_.history.apply(place_, name_of(event), engine_->digest(), out.timers);
    world_.tell(self_.node, "applies " + gs::text(event) + ", is at " + std::to_string(place_));
    if (!world_.network.is_quorate(ring_)) world_.history.error("no quorum: but something is applied");
    world_.history.applied(self_.node, place_, beside());
    world_.history.hold(self_.node, place_);
    check_concluded();
    if (world_.plan.safe) note_confirmed();
    if (serving_) {
      world_.history.serves(self_.node, ring_, place_, beside());
      world_.history.told(place_, out.timers);
    }
    if (const auto* request = std::get_if<RequestEvent>(&event)) answer(*request, out.rc);
    if (std::holds_alternative<ContinueEvent>(event)) continued_ = false;
  }
  /// The engine's, behind the place that it is at.
  SnapshotBytes snapshot() override {
    const auto state = engine_->snapshot();
    auto values = state.values();
    values.push_back(std::make_shared<const Bytes>(reinterpret_cast<const char*>(&place_), sizeof place_));
    return {state.head(), std::move(values)};
  }
  bool restore(const SnapshotBytes& snapshot, std::string* error) override {
    auto values = snapshot.values();
    const SharedBytes place = values.back();
    values.pop_back();
    if (!engine_->restore({snapshot.head(), std::move(values)}, error)) {
      world_.history.error("snapshot: " + *error);
      return false;
    }
    ++world_.seen["state taken"];
    std::memcpy(&place_, place->data(), sizeof place_);
    world_.tell(self_.node, "takes the state of " + std::to_string(place_));
    world_.history.hold(self_.node, place_);
    return true;
  }
  void serve(const Domain& domain) override {
    world_.history.applied(self_.node, place_, beside());
    world_.tell(self_.node, "serves");
    domain_ = domain;
    serving_ = true;
    continued_ = false;
    world_.history.serves(self_.node, ring_, place_, beside());
  }
  void drop_clients(const std::string& why) override {
    ++world_.seen[why];
    world_.tell(self_.node, "loses: " + why);
    end_clients();
  }
  void reset(const std::string& why) override {
    ++world_.seen[why];
    world_.tell(self_.node, "loses: " + why);
    end_clients();
    engine_ = std::make_unique<Engine>(world_.plan.limits);
    place_ = History::kEmpty;
  }
  void give_up(const std::string&) override { has_given_up_ = true; }
  void log(const std::string&) override {}

 private:
  static constexpr Token kSubscriber = 2;
  struct Client {
    int pending = 0;          // requests sent and not applied
    bool subscribed = false;  // as it was told
  };

  void take(const View& view) { replication_.view_changed(view); }
  void take(const RingId& ring) {
    ring_ = ring;
    replication_.ring_changed(ring);
  }
  void take(const Received& received) { replication_.received(received.from, *received.message); }

  void publish_adapters() {
    world_.adapters[self_.node] = {{"eth" + std::to_string(++world_.last_adapter), {}}};
    published_ = true;
    replication_.submit(AdaptersEvent{self_.node, world_.adapters[self_.node]});
  }
  Request make(Random& random) {
    const Token token = random.below(2);
    const ProtocolTerms terms{WYX_N_PHASE, 5};
    const int dice = random.below(100);
    if (dice < 45) return VoteRequest{token, random.chance(80) ? WYX_VOTE_APPROVE : WYX_VOTE_CONTINUE, {}, {}, {}};
    if (dice < 65) return StateChangeRequest{token, terms, std::to_string(random.below(100))};
    if (dice < 72) return SubscribeRequest{kSubscriber, 0x201, "g"};
    if (dice < 75) return UnsubscribeRequest{kSubscriber};
    if (dice < 80) return GoodbyeRequest{token};
    GroupAttributes attributes;
    attributes.group_name = random.chance(50) ? "g" : "h";
    attributes.num_phases = WYX_N_PHASE;
    attributes.batch_control = WYX_BATCH_BOTH;
    return JoinRequest{token, attributes, static_cast<std::int16_t>(random.below(4)), "m"};
  }
  void answer(const RequestEvent& event, wyx_rc_t rc) {
    const auto found = clients_.find(event.session);
    if (found == clients_.end()) return;
    if (--found->second.pending < 0) world_.history.error("request applied twice");
    if (rc != WYX_OK) return;
    if (std::holds_alternative<SubscribeRequest>(event.request)) found->second.subscribed = true;
    if (std::holds_alternative<UnsubscribeRequest>(event.request)) found->second.subscribed = false;
  }
  void end_clients() {
    for (const auto& [id, client] : clients_) world_.over.insert(id);
    clients_.clear();
    serving_ = published_ = false;
    world_.history.serves_no_more(self_.node);
  }
  void lose_state() {
    end_clients();
    world_.words.erase(self_.node);
    world_.history.hold(self_.node, History::kEmpty);
  }
  /// The hosts that have gone no further than this one's last exchange.
  std::set<Node> beside() const {
    std::set<Node> nodes;
    for (const auto& [node, word] : world_.words)
      if (word.begin == own_word_.begin) nodes.insert(node);
    return nodes;
  }
  /// Nothing is applied before everyone who takes part knows who does.
  void check_concluded() const {
    for (const auto& [node, word] : peers_) {
      const auto last = world_.words.find(node);
      const bool lives = last != world_.words.end() && last->second.life == word.life;
      if (node != self_.node && lives && !world_.concluded.contains({node, own_word_.begin}))
        world_.history.error("applied too early: node " + std::to_string(node) + " has not received it");
    }
  }
  /// All whom the last exchange asked have received what is applied here, and who had the state has it still.
  void note_confirmed() {
    auto best = own_word_.history;
    for (const auto& [node, word] : peers_) best = std::max(best, word.history);
    Node holders = 0;
    for (const auto& [node, word] : peers_) {
      if (word.history != best) continue;
      ++holders;
      const auto last = world_.words.find(node);
      if (last != world_.words.end() && last->second.life == word.life) world_.history.confirmed(node, place_);
    }
    if (holders >= world_.history.majority()) return;
    for (const Node node : world_.network.members(ring_))
      if (!peers_.contains(node) && world_.history.holds_something(node)) world_.history.confirmed(node, place_);
  }
  /// What was sent is the same wherever it is applied; the rest comes of a decision.
  std::uint64_t name_of(const Event& event) const {
    const auto sent = world_.events.find(&event);
    if (sent != world_.events.end()) return sent->second.name;
    const auto* gone = std::get_if<HostGoneEvent>(&event);
    const auto* came = std::get_if<HostCameEvent>(&event);
    const auto* numbers = std::get_if<NumbersEvent>(&event);
    const std::uint64_t name = gone ? gone->node * 65536u + gone->leave_code : came ? came->node : numbers->above;
    return Random(name * 16 + event.index()).next() | std::uint64_t{1} << 63;
  }

  World& world_;
  const Process self_;
  std::unique_ptr<Engine> engine_;
  Replication replication_;
  History::Place place_ = History::kEmpty;
  RingId ring_;
  Domain domain_;
  std::map<Node, Word> peers_;
  Word own_word_;
  std::map<SessionId, Client> clients_;
  std::uint64_t last_session_ = 0;
  bool serving_ = false;
  bool published_ = false;  // its adapters, in this life
  bool continued_ = false;  // a ContinueEvent is under way
  bool has_given_up_ = false;
};

}  // namespace gs::cluster::test
