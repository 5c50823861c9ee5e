// How long until groups over several hosts have agreed, and how many messages they take.
#include <algorithm>
#include <sstream>

#include "bench/cluster_scene.h"

namespace zn {
namespace {

constexpr int kAgree = 0, kAlone = 3, kTalk = 10;  // slots
constexpr int kBigger = 1024;                      // bytes of the bigger messages

/// Latencies in microseconds.
struct Samples {
  std::vector<double> echo, local, one, alone, several;
};

void echo(ClusterScene& scene, int count, std::vector<double>* samples) {
  scene.raw(1).write_line("echo " + std::to_string(count) + " " + std::to_string(kPayload));
  std::istringstream line(scene.raw(1).wait_line(Clock::now() + kWaitLimit));
  for (double nanoseconds = 0; line >> nanoseconds;) samples->push_back(nanoseconds / 1e3);
}

/// A request that the daemon answers by itself.
void round_trips(int count, std::vector<double>* samples) {
  const wyx_responsiveness_t none{WYX_NO_RESPONSIVENESS, 0, 0, nullptr, 0};
  for (int i = 0; i < count; i++) {
    const int64_t start = now_ns();
    if (stub_change_responsiveness(&none) != WYX_OK) throw Failure{"a local request was refused"};
    samples->push_back(microseconds(start, now_ns()));
  }
}

void changes(ClusterScene& scene, BenchMember& proposer, wyx_num_phases_t phases, int count,
             std::vector<double>* samples) {
  const Slot& mine = proposer.witness().slot();
  for (int i = 0; i < count; i++) {
    const uint64_t target = mine.count + 1;
    const int64_t start = now_ns();
    if (proposer.propose_next_state(phases) != WYX_OK) throw Failure{"a proposal was refused"};
    scene.until([&] { return mine.count >= target; });
    samples->push_back(microseconds(start, now_ns()));
  }
}

/// In turns, so that what else the machine does falls on all of them.
void measure(ClusterScene& scene, BenchMember& proposer, BenchMember& alone, int rounds, int count,
             Samples* samples) {
  for (int round = 0; round < rounds; round++) {
    echo(scene, count, &samples->echo);
    round_trips(count, &samples->local);
    changes(scene, proposer, WYX_1_PHASE, count, &samples->one);
    changes(scene, alone, WYX_1_PHASE, count, &samples->alone);
    changes(scene, proposer, WYX_N_PHASE, count, &samples->several);
  }
}

void add(Figures* figures, const std::string& name, std::vector<double>& samples) {
  figures->add(name + ", p50", percentile(samples, 0.5), "us");
  figures->add("  p99", percentile(samples, 0.99), "us");
}

void add_agreement(Figures* figures, const std::string& name, std::vector<double>& samples, Samples& all,
                   std::optional<double> at_most) {
  add(figures, name, samples);
  for (const double share : {0.5, 0.99}) {
    const double plain = percentile(all.echo, share) + percentile(all.local, share);
    figures->add("  over echo + round trip (p" + std::to_string(static_cast<int>(100 * share)) + ")",
                 percentile(samples, share) / plain, "x", at_most);
  }
}

void told_to_send(Process& sender, int count, int length) {
  sender.write_line("send " + std::to_string(count) + " " + std::to_string(length));
}

double rate(int64_t start, int64_t end, uint64_t messages) {
  return static_cast<double>(messages) * 1e3 / microseconds(start, end) * 1e3;
}

double group_rate(ClusterScene& scene, int senders, int count, int length) {
  const std::string group = "talk" + std::to_string(senders) + "-" + std::to_string(length);
  const auto talkers = scene.members(kTalk, kTalk + 2, group);
  const auto total = static_cast<uint64_t>(senders) * static_cast<uint64_t>(count);
  const int64_t start = now_ns();
  for (int i = 0; i < senders; i++) told_to_send(*talkers[static_cast<size_t>(i)], count, length);
  const int64_t end = scene.await_counts(kTalk, kTalk + 2, total);
  scene.check(kTalk, kTalk + 2);
  return rate(start, end, total);
}

double raw_rate(ClusterScene& scene, int senders, int count, int length) {
  const int first = ClusterScene::raw_slot(1), last = ClusterScene::raw_slot(scene.nodes());
  const auto total = static_cast<uint64_t>(senders) * static_cast<uint64_t>(count);
  const uint64_t before = scene.slot(first).count;
  const int64_t start = now_ns();
  for (int i = 1; i <= senders; i++) told_to_send(scene.raw(i), count, length);
  const int64_t end = scene.await_counts(first, last, before + total);
  scene.check(first, last);
  return rate(start, end, total);
}

}  // namespace

void agreement(ClusterScene& scene, const ClusterSettings& settings, Figures* figures) {
  BenchMember proposer("agree", kAgree, scene.slot(kAgree)), alone("alone", kAlone, scene.slot(kAlone));
  if (proposer.joinGroup() != WYX_OK || alone.joinGroup() != WYX_OK) throw Failure{"no join"};
  ClusterScene::Processes others;
  for (int i = 1; i <= 2; i++) {
    const int host = std::min(i + 1, scene.nodes());
    others.push_back(scene.client(host, "member", kAgree + i, "agree"));
    scene.until([&] { return proposer.getMemberCount() == i + 1; });
  }
  Samples warm_up, samples;
  measure(scene, proposer, alone, 1, settings.samples, &warm_up);
  measure(scene, proposer, alone, settings.rounds, settings.samples, &samples);
  scene.await_counts(kAgree, kAgree + 2, scene.slot(kAgree).count);
  scene.check(kAgree, kAgree + 2);
  proposer.goodbyeGroup();
  alone.goodbyeGroup();

  add(figures, "raw CPG, a message's own way back", samples.echo);
  add(figures, "local round trip, client to gsd", samples.local);
  add_agreement(figures, "one phase, three members, request to own approval", samples.one, samples, scene.bound());
  add_agreement(figures, "one phase, one member, request to own approval", samples.alone, samples, std::nullopt);
  add_agreement(figures, "n phases, three voters, request to own approval", samples.several, samples,
                std::nullopt);
}

void throughput(ClusterScene& scene, const ClusterSettings& settings, Figures* figures) {
  for (const int length : {kPayload, kBigger}) {
    for (const int senders : {1, 3}) {
      const double ours = group_rate(scene, senders, settings.messages, length);
      figures->add("messages of " + std::to_string(length) + " bytes, " + std::to_string(senders) + " sending",
                   ours, "per second");
      if (scene.nodes() < senders) continue;
      const double raw = raw_rate(scene, senders, settings.raw_messages, length);
      figures->add("  raw CPG", raw, "per second");
      figures->add("  of raw CPG", 100 * ours / raw, "%");
    }
  }
}

}  // namespace zn
