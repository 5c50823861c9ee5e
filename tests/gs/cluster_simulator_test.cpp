// Several daemons over a simulated network, under random faults; what they promise is checked after every step.
//
// GS_CLUSTER_SIM_STEPS=n changes the number of steps in all, GS_CLUSTER_SIM_SEED=n begins with another episode. A
// failure tells its episode's seed and the steps that are needed for it.
#include <gtest/gtest.h>

#include <array>

#include "common/sanitizers.h"
#include "gs/cluster_daemon.h"

namespace gs::cluster::test {
namespace {

using gs::test::number_from;

constexpr std::uint64_t kSteps = ZN_ADDRESS_SANITIZER || ZN_THREAD_SANITIZER ? 40'000 : 400'000;
constexpr std::uint64_t kRuleSteps = 10'000'000;  // to find that a rule is left out
constexpr std::size_t kEpisode = 3'000;           // steps

enum class What {
  kOrder,
  kReceive,
  kDeliver,
  kJudge,
  kReform,
  kDatagram,
  kLoseDatagram,
  kPass,  // what goes on by itself
  kRequest,
  kBeginSession,
  kEndSession,
  kWork,  // clients
  kCut,
  kBlip,
  kRingLost,
  kDatagramAgain,
  kHostDown,
  kCorosyncDown,
  kKill,
  kStop,
  kHang,  // faults
  kHeal,
  kHostUp,
  kStart,
  kWake,  // and their ends
};
constexpr std::array kNames{"order",          "receive",       "deliver",       "judge",   "reform",
                            "datagram",       "lose datagram", "pass",          "request", "begin session",
                            "end session",    "work",          "cut",           "blip",    "ring lost",
                            "datagram again", "host down",     "corosync down", "kill",    "stop",
                            "hang",           "heal",          "host up",       "start",   "wake"};

/// One decision. What it does depends on the state, too: without the steps before it, it may do nothing.
struct Step {
  What what = What::kPass;
  Node node = 1;
  std::uint64_t dice = 0;
};

class Cluster {
 public:
  explicit Cluster(const Plan& plan, std::string* story = nullptr)
      : world_(plan), daemons_(static_cast<std::size_t>(plan.hosts) + 1) {
    world_.story = story;
    for (Node node = 1; node <= hosts(); ++node) {
      world_.network.host_up(node);
      daemons_[node] = std::make_unique<Daemon>(world_, node);
    }
  }

  const Seen& seen() const { return world_.seen; }
  const std::string& error() const { return world_.history.error(); }
  Node hosts() const { return world_.network.hosts(); }

  void perform(const Step& step) {
    if (world_.story)
      *world_.story +=
          std::string(kNames[static_cast<std::size_t>(step.what)]) + " " + std::to_string(step.node) + "\n";
    Random random(step.dice);
    Station& host = world_.network.at(step.node);
    if (step.what < What::kRequest) {
      move(step, random);
    } else if (step.what < What::kCut) {
      if (awake(step.node)) client(step, *daemons_[step.node], random);
    } else {
      fault(step, host, random);
    }
    for (auto& daemon : daemons_)
      if (daemon && daemon->has_given_up()) end(daemon, false);
  }

  /// What can go on by itself.
  std::vector<Step> moves() {
    std::vector<Step> moves;
    for (Node node = 1; node <= hosts(); ++node) {
      const Station& host = world_.network.at(node);
      if (world_.network.can_order(host)) moves.push_back({What::kOrder, node});
      if (world_.network.can_receive(host)) moves.push_back({What::kReceive, node});
      if (world_.network.is_to_reform(host)) moves.push_back({What::kReform, node});
      if (!awake(node)) continue;
      if (!host.inbox.empty()) moves.push_back({What::kDeliver, node});
      if (!host.verdicts.empty()) moves.push_back({What::kJudge, node});
    }
    const auto arrives = [this](const Datagram& d) { return awake(d.to); };
    if (std::ranges::any_of(world_.datagrams, arrives)) moves.push_back({What::kDatagram, 1});
    return moves;
  }

  /// What would mend something.
  std::vector<Step> repairs() {
    std::vector<Step> repairs;
    for (Node node = 1; node <= hosts(); ++node) {
      const Station& host = world_.network.at(node);
      if (host.side != 0) repairs.push_back({What::kHeal, node});
      if (!host.up) repairs.push_back({What::kHostUp, node});
      if (host.up && !daemons_[node]) repairs.push_back({What::kStart, node});
      if (daemons_[node] && daemons_[node]->hung) repairs.push_back({What::kWake, node});
    }
    return repairs;
  }

  /// Everything is mended but the daemon of `hung`; all that can go on does, until nothing is left to do.
  void mend(Node hung = 0) {
    for (Node node = 1; node <= hosts(); ++node) {
      world_.network.at(node).side = 0;
      perform({What::kHostUp, node});
      if (node != hung) perform({What::kWake, node});
    }
    constexpr int kRounds = 3'000;
    for (int round = 0; round < kRounds && error().empty(); ++round) {
      for (Node node = 1; node <= hosts(); ++node)
        if (!daemons_[node]) perform({What::kStart, node});
      if (!go_on() && !pass_idle()) return;
    }
    world_.history.error("no rest: it does not come to an end" + states());
  }

  void check_served(Node hung = 0) {
    for (Node node = 1; node <= hosts(); ++node) {
      if (node == hung) continue;
      if (!daemons_[node]->replication().serves())
        world_.history.error("not served: after all is mended" + states());
      if (daemons_[node]->has_pending()) world_.history.error("no answer: a request has not ended" + states());
    }
  }
  void check_same() {
    for (Node node = 1; node <= hosts() && error().empty(); ++node) {
      const Daemon& daemon = *daemons_[node];
      if (daemon.place() != daemons_[1]->place()) world_.history.error("states differ: after all is mended");
      if (!daemon.knows_all_adapters()) world_.history.error("adapters missing: or not those of now");
      if (daemon.missing()) world_.history.error("session missing: a subscription that was told is not there");
      for (const SessionId& id : world_.over)
        if (daemon.knows(id)) world_.history.error("ghost: a session that is over is still there");
    }
  }
  /// One that hangs does not hold up the others.
  void check_hung(std::uint64_t dice) {
    const Node hung = static_cast<Node>(1 + dice % hosts()), other = hung % hosts() + 1;
    perform({What::kHang, hung});
    perform({What::kBeginSession, other});
    for (std::uint64_t i = 0; i < 5; ++i) perform({What::kRequest, other, dice + i});
    mend(hung);
    if (!error().empty()) return;
    check_served(hung);
    mend();
  }

 private:
  bool awake(Node node) const { return daemons_[node] && !daemons_[node]->hung && world_.network.at(node).up; }

  void end(std::unique_ptr<Daemon>& daemon, bool late) {
    if (!daemon) return;
    world_.network.died(daemon->self(), late);
    daemon.reset();
  }

  void move(const Step& step, Random& random) {
    const auto some = static_cast<std::size_t>(1 + random.below(6));
    if (step.what == What::kOrder) world_.network.order(step.node);
    if (step.what == What::kReceive) world_.network.receive(step.node, some);
    if (step.what == What::kReform) world_.network.reform(step.node, step.dice == 0 ? nullptr : &random);
    if (step.what == What::kDatagram || step.what == What::kLoseDatagram)
      datagram(random, step.what == What::kLoseDatagram, step.dice == 0);
    if (step.what == What::kPass) pass(Duration(step.dice % 20'000));
    if (!awake(step.node)) return;
    if (step.what == What::kDeliver) daemons_[step.node]->deliver(some);
    if (step.what == What::kJudge) daemons_[step.node]->judge();
  }

  /// Any of those under way, or the first that can arrive.
  void datagram(Random& random, bool lost, bool first) {
    auto& all = world_.datagrams;
    const auto arrives = [this](const Datagram& d) { return awake(d.to); };
    auto at = std::ranges::find_if(all, arrives);
    if (at == all.end()) return;
    if (!first)
      at = std::ranges::find_if(all.begin() + random.below(static_cast<int>(all.size())), all.end(), arrives);
    if (at == all.end()) return;
    const Datagram datagram = *at;
    all.erase(at);
    if (!lost) arrive(datagram);
    old_datagrams_.push_back(datagram);
    while (old_datagrams_.size() > 16) old_datagrams_.pop_front();
  }
  void arrive(const Datagram& datagram) {
    if (awake(datagram.to) && world_.network.connected(datagram.from, datagram.to))
      daemons_[datagram.to]->take(datagram);
  }

  void pass(Duration time) {
    world_.now += time;
    for (Node node = 1; node <= hosts(); ++node)
      if (awake(node)) daemons_[node]->replication().advance(world_.now);
  }
  /// On to what somebody waits for.
  bool pass_idle() {
    std::optional<Time> next;
    for (Node node = 1; node <= hosts(); ++node) {
      if (!awake(node)) continue;
      const auto deadline = daemons_[node]->replication().next_deadline();
      if (deadline) next = next ? std::min(*next, *deadline) : *deadline;
    }
    if (!next) return false;
    pass(std::max(*next - world_.now, Duration(1)));
    return true;
  }
  bool go_on() {
    auto moves = this->moves();
    for (const Step& step : moves) perform(step);
    for (Node node = 1; node <= hosts(); ++node) {
      Random random(0);
      if (awake(node)) daemons_[node]->work(random, true);
    }
    return !moves.empty() || !this->moves().empty();
  }

  static void client(const Step& step, Daemon& daemon, Random& random) {
    if (step.what == What::kRequest) daemon.request(random);
    if (step.what == What::kBeginSession) daemon.begin_session();
    if (step.what == What::kEndSession) daemon.end_session(random);
    if (step.what == What::kWork) daemon.work(random, false);
  }

  /// That takes a while.
  std::unique_ptr<Daemon> start(Node node) {
    world_.now += Duration(5);
    return std::make_unique<Daemon>(world_, node);
  }
  void fault(const Step& step, Station& host, Random& random) {
    auto& daemon = daemons_[step.node];
    switch (step.what) {
      case What::kCut:
        for (Node node = 1; node <= hosts(); ++node) world_.network.at(node).side = random.below(2);
        break;
      case What::kHeal:
        for (Node node = 1; node <= hosts(); ++node) world_.network.at(node).side = 0;
        break;
      case What::kBlip:
        world_.network.blip(step.node);
        break;
      case What::kRingLost:
        world_.network.reform(step.node, &random, true);
        break;
      case What::kDatagramAgain:
        if (!old_datagrams_.empty()) arrive(random.one_of(old_datagrams_));
        break;
      case What::kHostDown:
        end(daemon, false);
        world_.network.host_down(step.node);
        break;
      case What::kCorosyncDown:
        world_.network.host_down(step.node);
        if (daemon) daemon->replication().gone("Corosync is not there");
        break;
      case What::kHostUp:
        world_.network.host_up(step.node);
        break;
      case What::kKill:
        end(daemon, random.chance(50));
        break;
      case What::kStop:
        if (!awake(step.node)) break;
        daemon->leave();
        daemon.reset();
        host.verdicts.clear();
        break;
      case What::kStart:
        if (!daemon && host.up) daemon = start(step.node);
        break;
      default:
        if (daemon) daemon->hung = step.what == What::kHang;
    }
  }
  std::string states() const {
    std::string all;
    for (const auto& daemon : daemons_)
      if (daemon)
        all += "\n  node " + std::to_string(daemon->self().node) + " is " + daemon->replication().state();
    return all;
  }

  World world_;
  std::deque<Datagram> old_datagrams_;            // that were under way
  std::vector<std::unique_ptr<Daemon>> daemons_;  // by node
};

// ----------------------------------------------------------------------------------------------------- episodes

/// Every seed is a cluster of its own kind.
Plan plan_of(std::uint64_t seed, bool safe, Rule without) {
  Random random(seed);
  Plan plan;
  plan.hosts = random.chance(50) ? 3 : 4 + random.below(2);
  plan.safe = safe;
  plan.without = without;
  plan.piece = random.chance(50) ? 64 : 1024;
  if (random.chance(50)) plan.limits.slice = 1;
  plan.adapters = random.chance(20);
  return plan;
}

/// Makes up the steps of an episode, as they go: times of faults, and times in which most is mended.
class Chance {
 public:
  explicit Chance(std::uint64_t seed) : random_(seed ^ 0xC0FFEE) {
    patient_ = random_.chance(70);
    constexpr std::array kHasty{1, 5, 20};
    hasty_ = random_.one_of(kHasty);
    pause_ = 100 + random_.below(900);
    clients_ = 30 + random_.below(120);
  }
  Step next(Cluster& cluster) {
    Step step{What::kPass, static_cast<Node>(1 + random_.below(static_cast<int>(cluster.hosts()))),
              random_.next()};
    return patient_ ? next_at_rest(cluster, step) : next_at_once(cluster, step);
  }

 private:
  /// Whatever comes, comes in the midst of everything else.
  Step next_at_once(Cluster& cluster, Step step) {
    const auto moves = cluster.moves();
    if (random_.below(pause_) == 0) storm_ = random_.below(80);
    const int faults = storm_ > 0 ? 60 : 0, mends = storm_ > 0 ? 20 : 60;  // of a thousand steps
    storm_ = std::max(storm_ - 1, 0);
    const int dice = random_.below(1000);
    const auto repairs = cluster.repairs();
    if (dice < faults) {
      step.what = one_of(What::kCut, What::kHang);
    } else if (dice < faults + mends && !repairs.empty()) {
      as(step, random_.one_of(repairs));
    } else if (dice < faults + mends + clients_) {
      step.what = client();
    } else if (moves.empty() || dice > 970) {
      step.dice = random_.next() % (random_.chance(moves.empty() ? 30 : 3) ? 2'000 : 50);
    } else {
      as(step, some_move(moves, cluster.hosts()));
      if (step.what == What::kDatagram && random_.chance(15)) step.what = What::kLoseDatagram;
    }
    return step;
  }
  /// Something comes when nothing goes on any more but what is late, which waits for as long as it takes.
  Step next_at_rest(Cluster& cluster, Step step) {
    auto moves = cluster.moves();
    std::erase_if(moves, [this](const Step& move) { return late_.contains({move.what, move.node}); });
    const auto repairs = cluster.repairs();
    const int dice = random_.below(100);
    if (!moves.empty() && !random_.chance(hasty_)) {
      as(step, random_.one_of(moves));
    } else if (dice < 30) {
      step.dice = 0;
      late_.clear();
      if (random_.chance(75)) choose_late(cluster.hosts());
    } else if (dice < 55) {
      step.what = random_.chance(30) ? What::kBlip : one_of(What::kCut, What::kHang);
    } else if (dice < 65 && !repairs.empty()) {
      as(step, random_.one_of(repairs));
    } else if (dice < 83) {
      step.what = client();
    } else {
      step.dice = random_.next() % 2'000;
    }
    return step;
  }
  static void as(Step& step, const Step& other) {
    step.what = other.what;
    step.node = other.node;
  }
  What client() {
    const int kind = random_.below(100);
    return kind < 75   ? What::kRequest
           : kind < 87 ? What::kBeginSession
           : kind < 92 ? What::kEndSession
                       : What::kWork;
  }
  /// Some do their part late for a while.
  const Step& some_move(const std::vector<Step>& moves, Node hosts) {
    if (random_.chance(3)) choose_late(hosts);
    const Step* move = nullptr;
    for (int i = 0; i < 8; ++i) {
      move = &random_.one_of(moves);
      if (!late_.contains({move->what, move->node})) break;
    }
    return *move;
  }
  /// One kind of move at all hosts but one, or all kinds at one, or some.
  void choose_late(Node hosts) {
    late_.clear();
    const int mode = random_.below(6);
    const What kind = one_of(What::kOrder, What::kDatagram);
    const auto host = static_cast<Node>(1 + random_.below(static_cast<int>(hosts)));
    for (int what = 0; what <= static_cast<int>(What::kDatagram); ++what) {
      for (Node node = 1; node <= hosts; ++node) {
        const What move = static_cast<What>(what);
        const bool late = mode == 0   ? move == kind && node != host
                          : mode == 1 ? node == host
                          : mode == 2 ? random_.chance(20)
                                      : move == kind && node == host;
        if (late) late_.insert({move, node});
      }
    }
  }
  What one_of(What first, What last) {
    const int count = static_cast<int>(last) - static_cast<int>(first) + 1;
    return static_cast<What>(static_cast<int>(first) + random_.below(count));
  }
  Random random_;
  bool patient_ = false;  // waits until nothing goes on, but for a few times of a hundred
  int hasty_ = 0;
  int pause_ = 0;  // steps between times of faults
  int storm_ = 0;  // how many more of this one
  int clients_ = 0;
  std::set<std::pair<What, Node>> late_;
};

std::string finish(Cluster& cluster, std::uint64_t dice) {
  const auto so_far = [&] { return cluster.error().empty(); };
  cluster.mend();
  if (so_far()) cluster.check_served();
  if (so_far()) cluster.check_same();
  if (so_far()) cluster.check_hung(dice);
  if (so_far()) cluster.check_served();
  if (so_far()) cluster.check_same();
  return cluster.error();
}

using Trace = std::vector<Step>;

std::string run(const Plan& plan, std::uint64_t seed, Trace& trace, Seen& seen) {
  Cluster cluster(plan);
  Chance chance(seed);
  while (trace.size() < kEpisode && cluster.error().empty()) {
    trace.push_back(chance.next(cluster));
    cluster.perform(trace.back());
  }
  if (cluster.error().empty()) finish(cluster, seed);
  for (const auto& [what, times] : cluster.seen()) seen[what] += times;
  return cluster.error();
}

std::string run_again(const Plan& plan, std::uint64_t seed, const Trace& trace, std::string* story = nullptr) {
  Cluster cluster(plan, story);
  for (const Step& step : trace) {
    cluster.perform(step);
    if (!cluster.error().empty()) return cluster.error();
  }
  return finish(cluster, seed);
}

/// Leaves out what is not needed for an error of the same kind.
Trace shrink(const Plan& plan, std::uint64_t seed, Trace trace, const std::string& error) {
  const std::string kind = error.substr(0, error.find(':'));
  int runs = 3'000;
  for (std::size_t chunk = trace.size() / 2; chunk > 0; chunk /= 2) {
    for (std::size_t from = 0; from < trace.size() && runs > 0;) {
      Trace less(trace.begin(), trace.begin() + static_cast<std::ptrdiff_t>(from));
      const std::size_t rest = std::min(from + chunk, trace.size());
      less.insert(less.end(), trace.begin() + static_cast<std::ptrdiff_t>(rest), trace.end());
      --runs;
      if (run_again(plan, seed, less).starts_with(kind)) {
        trace = std::move(less);
      } else {
        from += chunk;
      }
    }
  }
  return trace;
}

std::string report(const Plan& plan, std::uint64_t seed, const Trace& trace, const std::string& error) {
  std::string all = error + "\nepisode " + std::to_string(seed) + ", " + std::to_string(plan.hosts) + " hosts\n";
  const Trace shrunk = shrink(plan, seed, trace, error);
  std::string story;
  const std::string again = run_again(plan, seed, shrunk, &story);
  return all + std::to_string(shrunk.size()) + " steps:\n" + story + again + "\n";
}

struct Search {
  std::uint64_t steps = 0;  // of all episodes
  std::uint64_t first = 1;  // episode
  bool safe = true;
  Rule without = Rule::kNone;
  Seen seen;

  /// Empty, or what went wrong, and how if it is to be told.
  std::string error(bool tell) {
    std::uint64_t seed = number_from("GS_CLUSTER_SIM_SEED", first);
    for (std::uint64_t done = 0; done < steps; ++seed) {
      const Plan plan = plan_of(seed, safe, without);
      Trace trace;
      const std::string error = run(plan, seed, trace, seen);
      done += trace.size();
      if (!error.empty())
        return tell ? report(plan, seed, trace, error) : error + " (" + std::to_string(done) + " steps)";
    }
    return "";
  }
};

/// The run is worth something only if it came everywhere.
void expect_all_seen(const Seen& seen) {
  for (const char* what : {"state taken", "this host has no quorum", "other hosts have gone on without this one",
                           "the others went on without it: it did not answer in time", "Corosync is not there"})
    EXPECT_TRUE(seen.contains(what)) << what;
}

TEST(ClusterSimulator, Random_faults_break_no_promise) {
  Search search;
  search.steps = number_from("GS_CLUSTER_SIM_STEPS", kSteps);
  const std::string error = search.error(true);
  EXPECT_TRUE(error.empty()) << error;
  if (search.steps >= 400'000) expect_all_seen(search.seen);
}

TEST(ClusterSimulator, Random_faults_break_no_promise_of_agreed_delivery) {
  Search search;
  search.steps = number_from("GS_CLUSTER_SIM_STEPS", kSteps) / 2;
  search.safe = false;
  const std::string error = search.error(true);
  EXPECT_TRUE(error.empty()) << error;
}

class ClusterRule : public testing::TestWithParam<Rule> {};

TEST_P(ClusterRule, Left_out_is_found) {
  if (ZN_ADDRESS_SANITIZER || ZN_THREAD_SANITIZER) GTEST_SKIP() << "the search is too long";
  Search search;
  search.steps = number_from("GS_CLUSTER_SIM_STEPS", kRuleSteps);
  search.without = GetParam();
  if (GetParam() == Rule::kHistoryOfExchanges) search.first = 300'000;  // from 1 on it takes long
  search.safe = GetParam() != Rule::kHistoryOfMessages;  // without it, all that was told is known to all
  const std::string error = search.error(false);
  EXPECT_NE(error, "");
  RecordProperty("found", error);
}

constexpr std::array kRules{Rule::kVerdictFirst,
                            Rule::kEveryRing,
                            Rule::kWordNamesBegin,
                            Rule::kConfirmDecision,
                            Rule::kConfirmNamesExchange,
                            Rule::kConfirmAll,
                            Rule::kHostsAreState,
                            Rule::kLives,
                            Rule::kAside,
                            Rule::kBeginWhenCaughtUp,
                            Rule::kVotesOfHolders,
                            Rule::kEvictedIsToldToLose,
                            Rule::kEvictedBeginsAgain,
                            Rule::kNumbersGoOn,
                            Rule::kHistoryOfRing,
                            Rule::kHistoryOfExchanges,
                            Rule::kHistoryOfMessages};

INSTANTIATE_TEST_SUITE_P(Each, ClusterRule, testing::ValuesIn(kRules));

}  // namespace
}  // namespace gs::cluster::test
