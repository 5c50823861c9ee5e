// Deadlines and what to do when they pass. Knows no clock: it is told the time.
#pragma once

#include <functional>
#include <map>
#include <optional>

#include "common/clock.h"

namespace gs::daemon {

using platform::Duration;
using platform::Time;

/// Not safe for concurrent use. An action may arm and cancel timers.
class Timers {
 public:
  using Action = std::function<void()>;
  struct Id {
    Time when{};
    std::uint64_t number = 0;  // 0: none
    auto operator<=>(const Id&) const = default;
  };

  Id arm(Time when, Action action) {
    const Id id{when, ++last_number_};
    actions_.emplace(id, std::move(action));
    return id;
  }
  /// Of a timer that has run or was cancelled: does nothing. Leaves `id` naming none.
  void cancel(Id& id) {
    if (id.number == 0) return;
    actions_.erase(id);
    id = {};
  }
  std::optional<Time> next() const {
    if (actions_.empty()) return std::nullopt;
    return actions_.begin()->first.when;
  }
  /// Runs what is due at `now`, earliest first, including what these actions arm for no later than `now`; a few at
  /// a time, so that others are served in between: `next` says whether more is due.
  void run(Time now) {
    for (int i = 0; i < kAtOnce && !actions_.empty() && actions_.begin()->first.when <= now; ++i) {
      auto due = actions_.extract(actions_.begin());
      due.mapped()();
    }
  }

 private:
  static constexpr int kAtOnce = 16;

  std::map<Id, Action> actions_;
  std::uint64_t last_number_ = 0;
};

}  // namespace gs::daemon
