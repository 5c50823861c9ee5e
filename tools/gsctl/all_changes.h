// The changes of all groups, as the daemon's tap tells them.
#pragma once

#include <functional>
#include <optional>

#include "tools/gsctl/change.h"
#include "tools/gsctl/inspection.h"
#include "tools/gsctl/loop.h"

namespace gsctl {

/// Goes on when the daemon comes back, and says so.
class AllChanges {
 public:
  using Say = std::function<void(const Change&)>;

  /// Throws InspectError: there is no daemon at first. `say` is called from the loop.
  AllChanges(Loop& loop, Say say);

 private:
  void connect();
  void receive();
  void take(const gs::inspect::ReportT& report);
  void take(const gs::inspect::HappeningT& happening);
  void come_back();

  Loop& loop_;
  const Say say_;
  std::optional<gs::inspect::Inspector> tap_;
  Loop::Handle readable_;
  Loop::Handle time_;
};

}  // namespace gsctl
