// The changes of groups, as the daemon's tap tells them.
#pragma once

#include <functional>
#include <map>
#include <optional>

#include "tools/gsctl/change.h"
#include "tools/gsctl/inspection.h"
#include "tools/gsctl/loop.h"
#include "tools/gsctl/reports.h"

namespace gsctl {

/// Begins with how each group is. Goes on when the daemon comes back, and says so.
class GroupChanges {
 public:
  using Say = std::function<void(const Change&)>;

  /// Of `groups`, which need not be there yet; none: of all. `say` is called from begin() and from the loop.
  GroupChanges(Loop& loop, std::vector<std::string> groups, Say say);

  /// Throws InspectError or Error: no daemon serves.
  void begin();

 private:
  struct Known {
    Members members;
    std::uint64_t event = 0;  // up to which it is known
  };

  void connect();
  void receive();
  void take(const inspect::ReportT& report);
  void take(const inspect::HappeningT& happening);
  void catch_up();
  void or_lost(const std::function<void()>& what);
  void departed(const inspect::HappeningT& happening, Known& known, Change change);
  void say_of_daemon(const std::string& what, const std::string& why);
  void come_back();

  Loop& loop_;
  const std::vector<std::string> groups_;
  const Say say_;
  std::map<std::string, Known> known_;
  std::optional<gs::inspect::Inspector> tap_;
  Loop::Handle readable_;
  Loop::Handle time_;
};

}  // namespace gsctl
