// Whole processes over a daemon of their own: how long until a group has agreed, how many messages it takes, how
// far one change spreads, how soon a death is known, what an idle client costs the daemon. Set against the same
// kind of socket used bare, and against the same traffic without group services (relay.h), in the same run; and
// everything that is measured is also checked: sequence, contents, agreement.
//
//   processes [--quick] [--benchmark_out=FILE]
#include "examples/processes.h"

#include <sched.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <vector>

#include "bench/figures.h"
#include "bench/process_roles.h"
#include "bench/relay.h"
#include "bench/waits.h"

namespace {

using zelt_gscl_V1::GSController;
using zn::BenchMember;
using zn::Failure;
using zn::Process;

constexpr int kSpread = 200;  // subscribers, receivers and idle clients
// Slots of the board.
constexpr int kProposer = 0, kTalker = 10, kVictim = 20, kFirstOfMany = 100;

struct Settings {
  int rounds = 20;       // of each latency, alternating
  int samples = 200;     // in each round
  int messages = 20000;  // of each sender
  int changes = 60;      // spread to all subscribers
  int deaths = 100;
  int spread = kSpread;

  static Settings quick() { return {2, 50, 500, 3, 3, 10}; }
};

/// Puts processes on one core, or leaves them where they are; all are set free again at the end.
class Placement {
 public:
  Placement(bool one_core, std::vector<pid_t> processes) : processes_(std::move(processes)) {
    ::sched_getaffinity(0, sizeof all_, &all_);
    if (!one_core) return;
    cpu_set_t one;
    CPU_ZERO(&one);
    int core = 0;
    while (!CPU_ISSET(core, &all_)) core++;
    CPU_SET(core, &one);
    set(one);
  }
  ~Placement() { set(all_); }
  Placement(const Placement&) = delete;
  Placement& operator=(const Placement&) = delete;

 private:
  void set(const cpu_set_t& cores) {
    for (pid_t process : processes_) ::sched_setaffinity(process, sizeof cores, &cores);
  }

  const std::vector<pid_t> processes_;
  cpu_set_t all_;
};

class Benchmark {
 public:
  explicit Benchmark(const Settings& settings);
  void run();
  const zn::Figures& figures() const { return figures_; }

 private:
  using Children = std::vector<std::unique_ptr<Process>>;

  std::unique_ptr<Process> start(const zn::PrivateDaemon& daemon, const std::string& role,
                                 const std::vector<std::string>& arguments);
  Children start_many(const zn::PrivateDaemon& daemon, const std::string& role, int first, int count,
                      const std::string& last_argument);
  template <class Condition>
  void until(Condition condition) {
    zn::dispatch_until(*controller_, condition);
  }
  int64_t await_counts(int first, int count, uint64_t target) {
    return zn::await_counts(board_, first, count, target);
  }
  void check(int first, int count) { zn::check(board_, first, count); }

  void latencies(bool one_core);
  void add_agreement(const std::string& what, std::vector<double>& samples, std::vector<double>& relayed,
                     std::vector<double>& bare);
  void ping_pong(int socket, std::vector<double>* samples);
  Children start_relay(const std::string& path);
  void relayed(zn::RelayedProposer& proposer, wyx_num_phases_t phases, std::vector<double>* samples);
  void agreement(wyx_num_phases_t phases, std::vector<double>* samples);
  void message_rate(int senders, double ping_pong_us);
  void idle_memory();
  void spread(int subscribers);
  double bare_spread(int receivers);
  void deaths();
  double bare_death();

  const Settings settings_;
  zn::PrivateDaemon daemon_;
  zn::Board board_{daemon_.folder() + "/board"};
  std::unique_ptr<GSController> controller_;
  std::unique_ptr<BenchMember> proposer_;
  Children members_;
  zn::Figures figures_;
  double ping_pong_us_ = 0;
};

std::unique_ptr<Process> Benchmark::start(const zn::PrivateDaemon& daemon, const std::string& role,
                                          const std::vector<std::string>& arguments) {
  std::vector<std::string> command{zn::program("processes"), "--role=" + role};
  command.insert(command.end(), arguments.begin(), arguments.end());
  return std::make_unique<Process>(command, daemon.environment());
}

Benchmark::Children Benchmark::start_many(const zn::PrivateDaemon& daemon, const std::string& role, int first,
                                          int count, const std::string& last) {
  Children children;
  for (int i = first; i < first + count; i++) {
    board_[i].count = board_[i].errors = board_[i].ready = 0;
    children.push_back(start(daemon, role, {daemon_.folder() + "/board", std::to_string(i), last}));
  }
  return children;
}

Benchmark::Benchmark(const Settings& settings) : settings_(settings) {
  if (!board_.ok()) throw Failure{"no shared board"};
  ::setenv("GSD_ENDPOINT", daemon_.environment()[0].second.c_str(), 1);
  controller_ = std::make_unique<GSController>();
  if (controller_->initialize() != WYX_OK) throw Failure{"no session"};
  proposer_ = std::make_unique<BenchMember>("agree", static_cast<short>(kProposer), board_[kProposer]);
  if (proposer_->joinGroup() != WYX_OK) throw Failure{"no join"};
  members_ = start_many(daemon_, "member", kProposer + 1, 2, "agree");
  until([&] { return proposer_->getMemberCount() == 3; });
}

void Benchmark::ping_pong(int socket, std::vector<double>* samples) {
  char bytes[zn::kPayload] = {};
  for (int i = 0; i < settings_.samples; i++) {
    const int64_t start = zn::now_ns();
    bytes[0] = static_cast<char>(i);
    const bool sent = ::send(socket, bytes, sizeof bytes, MSG_NOSIGNAL) == zn::kPayload;
    if (!sent || ::recv(socket, bytes, sizeof bytes, 0) != zn::kPayload) throw Failure{"ping-pong failed"};
    samples->push_back(static_cast<double>(zn::now_ns() - start) / 1e3);
  }
}

/// The relay and its members but for the proposer.
Benchmark::Children Benchmark::start_relay(const std::string& path) {
  Children children;
  children.push_back(start(daemon_, "relay", {path}));
  children.front()->wait_line(zn::Clock::now() + zn::kWaitLimit);
  for (int i = 1; i < zn::kRelayed; i++) children.push_back(start(daemon_, "relayed", {path, std::to_string(i)}));
  return children;
}

void Benchmark::relayed(zn::RelayedProposer& proposer, wyx_num_phases_t phases, std::vector<double>* samples) {
  for (int i = 0; i < settings_.samples; i++) {
    const int64_t start = zn::now_ns();
    proposer.agree(phases == WYX_N_PHASE);
    samples->push_back(static_cast<double>(zn::now_ns() - start) / 1e3);
  }
}

void Benchmark::agreement(wyx_num_phases_t phases, std::vector<double>* samples) {
  zn::Slot& mine = board_[kProposer];
  for (int i = 0; i < settings_.samples; i++) {
    const uint64_t target = mine.count + 1;
    const int64_t start = zn::now_ns();
    if (proposer_->propose_next_state(phases) != WYX_OK) throw Failure{"a proposal was refused"};
    until([&] { return mine.count >= target; });
    samples->push_back(static_cast<double>(zn::now_ns() - start) / 1e3);
  }
}

// The latencies in turns, so that what else the machine does falls on all of them. On one core a hand-over
// costs a change of context; over all cores, where the scheduler puts the processes, it may cost the wake-up of
// another core.
void Benchmark::latencies(bool one_core) {
  const std::string path = daemon_.folder() + "/echo.sock", relay_path = daemon_.folder() + "/relay.sock";
  const int listening = zn::listen_on(path);
  auto echo = start(daemon_, "echo", {path});
  const int socket = ::accept(listening, nullptr, nullptr);
  const Children relay = start_relay(relay_path);
  zn::RelayedProposer relayed_proposer(relay_path);
  std::vector<pid_t> processes = {0, daemon_.pid(), echo->pid(), members_[0]->pid(), members_[1]->pid()};
  for (const auto& one : relay) processes.push_back(one->pid());
  const Placement placement(one_core, processes);

  std::vector<double> bare, one, several, relayed_one, relayed_several, warm_up;
  ping_pong(socket, &warm_up);
  agreement(WYX_1_PHASE, &warm_up);
  for (int round = 0; round < settings_.rounds; round++) {
    ping_pong(socket, &bare);
    agreement(WYX_1_PHASE, &one);
    relayed(relayed_proposer, WYX_1_PHASE, &relayed_one);
    agreement(WYX_N_PHASE, &several);
    relayed(relayed_proposer, WYX_N_PHASE, &relayed_several);
  }
  ::close(socket);
  ::close(listening);
  ::unlink(path.c_str());
  ::unlink(relay_path.c_str());
  await_counts(kProposer, 3, board_[kProposer].count);
  check(kProposer, 3);

  const std::string where = one_core ? ", one core" : ", all cores";
  ping_pong_us_ = zn::percentile(bare, 0.5);
  figures_.add("bare ping-pong between two processes" + where + ", p50", ping_pong_us_, "us");
  figures_.add("  p99", zn::percentile(bare, 0.99), "us");
  add_agreement("one phase, three processes" + where, one, relayed_one, bare);
  add_agreement("n phases, three voters" + where, several, relayed_several, bare);
}

void Benchmark::add_agreement(const std::string& what, std::vector<double>& samples, std::vector<double>& relayed,
                              std::vector<double>& bare) {
  const double p50 = zn::percentile(samples, 0.5), p99 = zn::percentile(samples, 0.99);
  const double relayed_p50 = zn::percentile(relayed, 0.5);
  figures_.add("request to own approval, " + what + ", p50", p50, "us");
  figures_.add("  over a bare ping-pong (p50)", p50 / zn::percentile(bare, 0.5), "x", 4);
  figures_.add("  the same packets and sleeps without group services (p50)", relayed_p50, "us");
  figures_.add("  over that (p50)", p50 / relayed_p50, "x", 1.3);
  figures_.add("  p99", p99, "us");
  figures_.add("  over a bare ping-pong (p99)", p99 / zn::percentile(bare, 0.99), "x");
}

void Benchmark::message_rate(int senders, double ping_pong_us) {
  const std::string group = "talk" + std::to_string(senders);
  Children talkers;
  for (int i = 0; i < 3; i++) {
    zn::Slot& slot = board_[kTalker + i];
    slot.digest = slot.count = slot.errors = slot.ready = 0;
    Children one = start_many(daemon_, "member", kTalker + i, 1, group);
    talkers.push_back(std::move(one.front()));
    while (board_[kTalker + i].ready == 0) ::usleep(200);
  }
  const int64_t start = zn::now_ns();
  for (int i = 0; i < senders; i++)
    talkers[static_cast<size_t>(i)]->write_line("send " + std::to_string(settings_.messages) + " " +
                                                std::to_string(zn::kPayload));
  const uint64_t total = static_cast<uint64_t>(senders) * static_cast<uint64_t>(settings_.messages);
  const double seconds = static_cast<double>(await_counts(kTalker, 3, total) - start) / 1e9;
  check(kTalker, 3);
  const double rate = static_cast<double>(total) / seconds;
  figures_.add("messages into a group of three, " + std::to_string(senders) + " sending", rate, "per second");
  figures_.add("  time for each, over a bare ping-pong", 1e6 / rate / ping_pong_us, "x");
}

// With a daemon that has served nobody yet, so that no memory of earlier clients is used again.
void Benchmark::idle_memory() {
  zn::PrivateDaemon fresh;
  const double before = zn::resident_kib(fresh.pid());
  Children idle = start_many(fresh, "idle", kFirstOfMany, settings_.spread, "");
  for (int i = kFirstOfMany; i < kFirstOfMany + settings_.spread; i++)
    zn::await("an idle client has connected", [&] { return board_[i].ready != 0; });
  const double clients = zn::resident_kib(fresh.pid()) - before;
  figures_.add("memory of the daemon for an idle client", clients / settings_.spread, "KiB", 64);
  figures_.add("  " + std::to_string(settings_.spread) + " of them, over the daemon without clients",
               clients / before, "x");
}

void Benchmark::spread(int subscribers) {
  Children children = start_many(daemon_, "subscriber", kFirstOfMany, subscribers, "agree");
  await_counts(kFirstOfMany, subscribers, 1);  // the state as it was
  std::vector<double> samples;
  for (int i = 0; i < settings_.changes; i++) {
    const uint64_t target = board_[kFirstOfMany].count + 1;
    const uint64_t own = board_[kProposer].count + 1;
    const int64_t start = zn::now_ns();
    if (proposer_->propose_next_state(WYX_1_PHASE) != WYX_OK) throw Failure{"a proposal was refused"};
    until([&] { return board_[kProposer].count >= own; });
    samples.push_back(static_cast<double>(await_counts(kFirstOfMany, subscribers, target) - start) / 1e3);
  }
  for (int i = kFirstOfMany; i < kFirstOfMany + subscribers; i++) {
    if (board_[i].errors != 0) throw Failure{"a subscriber saw wrong contents"};
  }
  children.clear();
  const double bare = bare_spread(subscribers);
  const std::string name = "one change to " + std::to_string(subscribers) + " subscriber process(es), ";
  figures_.add(name + "p50", zn::percentile(samples, 0.5), "us");
  figures_.add("  p99", zn::percentile(samples, 0.99), "us");
  figures_.add("  over bare sends to as many processes (p50)", zn::percentile(samples, 0.5) / bare, "x");
}

double Benchmark::bare_spread(int receivers) {
  const std::string path = daemon_.folder() + "/bare.sock";
  const int listening = zn::listen_on(path);
  Children children = start_many(daemon_, "receiver", kFirstOfMany, receivers, path);
  std::vector<int> sockets;
  for (int i = 0; i < receivers; i++) sockets.push_back(::accept(listening, nullptr, nullptr));
  std::vector<double> samples;
  for (int i = 1; i <= settings_.changes; i++) {
    const std::string bytes = zn::Payload{1, zn::kPayload, static_cast<uint64_t>(i)}.bytes();
    const int64_t start = zn::now_ns();
    for (int socket : sockets) {
      if (::send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL) != zn::kPayload)
        throw Failure{"bare send failed"};
    }
    const int64_t end = await_counts(kFirstOfMany, receivers, static_cast<uint64_t>(i));
    samples.push_back(static_cast<double>(end - start) / 1e3);
  }
  for (int socket : sockets) ::close(socket);
  ::close(listening);
  ::unlink(path.c_str());
  return zn::percentile(samples, 0.5);
}

// From the signal to the last survivor's approved failure leave.
void Benchmark::deaths() {
  std::vector<double> samples, bare;
  for (int i = 0; i < settings_.deaths; i++) {
    zn::Slot& mine = board_[kProposer];
    Children victim = start_many(daemon_, "member", kVictim, 1, "agree");
    until([&] { return proposer_->getMemberCount() == 4; });
    while (board_[kVictim].ready == 0) ::usleep(200);
    const uint64_t target = mine.failures + 1;
    const int64_t start = zn::now_ns();
    victim.front()->signal(SIGKILL);
    until([&] { return mine.failures >= target; });
    int64_t latest = mine.time;
    for (int other = kProposer + 1; other < kProposer + 3; other++) {
      while (board_[other].failures < target) ::usleep(200);
      latest = std::max(latest, board_[other].time.load());
    }
    samples.push_back(static_cast<double>(latest - start) / 1e6);
    bare.push_back(bare_death());
  }
  for (int i = kProposer; i < kProposer + 3; i++) {
    if (board_[i].errors != 0) throw Failure{"a survivor saw a wrong sequence"};
  }
  figures_.add("SIGKILL to the last survivor's failure leave, p50", zn::percentile(samples, 0.5), "ms");
  figures_.add("  p99", zn::percentile(samples, 0.99), "ms", 10);
  figures_.add("  over SIGKILL to the end of a bare socket (p50)",
               zn::percentile(samples, 0.5) / zn::percentile(bare, 0.5), "x");
}

double Benchmark::bare_death() {
  const std::string path = daemon_.folder() + "/death.sock";
  const int listening = zn::listen_on(path);
  auto echo = start(daemon_, "echo", {path});
  const int socket = ::accept(listening, nullptr, nullptr);
  const int64_t start = zn::now_ns();
  echo->signal(SIGKILL);
  char byte;
  const bool ended = ::recv(socket, &byte, 1, 0) <= 0;
  const double milliseconds = static_cast<double>(zn::now_ns() - start) / 1e6;
  ::close(socket);
  ::close(listening);
  ::unlink(path.c_str());
  if (!ended) throw Failure{"a dead process has spoken"};
  return milliseconds;
}

void Benchmark::run() {
  latencies(true);
  latencies(false);
  message_rate(1, ping_pong_us_);
  message_rate(3, ping_pong_us_);
  idle_memory();
  spread(1);
  spread(settings_.spread);
  deaths();
}

}  // namespace

int main(int argc, char** argv) {
  const std::string role = zn::option(argc, argv, "role");
  if (role == "relay") return zn::run_relay(argv[2]);
  if (role == "relayed") return zn::run_relayed(argv[2], std::atoi(argv[3]));
  if (!role.empty()) return zn::run_role(role, argc - 2, argv + 2);

  zn::catch_interrupts();
  zn::print_host();
  const Settings settings = zn::flag(argc, argv, "quick") ? Settings::quick() : Settings{};
  std::printf("settings: %d x %d samples of each latency, %d messages a sender, %d bytes each, %d subscribers\n",
              settings.rounds, settings.samples, settings.messages, zn::kPayload, settings.spread);
  try {
    Benchmark benchmark(settings);
    benchmark.run();
    benchmark.figures().print();
    return benchmark.figures().write_json(zn::option(argc, argv, "benchmark_out")) ? 0 : 1;
  } catch (const Failure& failure) {
    std::fprintf(stderr, "processes: %s\n", failure.text.c_str());
    return 1;
  }
}
