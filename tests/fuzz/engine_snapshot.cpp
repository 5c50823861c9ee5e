// A snapshot from anywhere: it is refused and nothing changes, or the engine stands and comes to an end of all its
// work.
#include <cstdio>
#include <cstdlib>

#include "engine/engine.h"

namespace gs {
namespace {

void require(bool condition, const std::string& what) {
  if (condition) return;
  fprintf(stderr, "%s\n", what.c_str());
  abort();
}

/// Whatever the groups wait for: time limits, votes, the work that is left, at last the death of every host.
void go_on(Engine& engine, SessionId asking) {
  const auto work = [&] {
    for (int i = 0; i < 1000 && engine.busy(); ++i) engine.apply(ContinueEvent{});
  };
  work();
  for (const auto& group : engine.status()) {
    for (const MissingVoter& voter : engine.missing_votes(group.name, 8).voters)
      engine.apply(RequestEvent{voter.to.session,
                                VoteRequest{voter.to.token, WYX_VOTE_APPROVE, {}, "m", WYX_NULL_VOTE}, false});
    JoinRequest join;
    join.attributes.group_name = group.name;
    engine.apply(RequestEvent{asking, join, true});
    work();
  }
  for (std::uint32_t node = 0; node < 4; ++node) engine.apply(HostGoneEvent{node});
  work();
}

void run(const std::uint8_t* data, std::size_t size) {
  const auto* bytes = reinterpret_cast<const std::byte*>(data);
  Limits limits;
  limits.slice = 1;
  Engine engine(limits);
  const auto empty = engine.snapshot().all();
  std::string error;
  SnapshotReceiver received;
  if (!received.add({bytes, size}) || !received.complete()) return;
  if (!engine.restore(received.take(), &error)) {
    require(!error.empty() && engine.snapshot().all() == empty, "refused without a word, or not without a change");
    return;
  }
  Engine again(limits);
  require(again.restore(engine.snapshot(), &error), error);
  require(again.snapshot().all() == engine.snapshot().all(), "its own snapshot is another one's");
  go_on(engine, {5, 1});
  go_on(again, {5, 1});
  require(again.digest() == engine.digest(), "two engines of one state went different ways");
}

}  // namespace
}  // namespace gs

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  gs::run(data, size);
  return 0;
}
