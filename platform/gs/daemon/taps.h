// Who watches all that happens. What happens while an event is applied is noted; a while later each tap is sent
// what it wants of it, in one message, so that it costs those whom the events are about next to nothing.
#pragma once

#include <chrono>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "daemon/transport.h"
#include "engine/observer.h"
#include "inspect/messages.h"

namespace gs::daemon {

/// A tap that does not read misses what happens meanwhile, and is told how much that was.
class Taps : public Observer {
 public:
  static constexpr std::size_t kMost = 256;

  bool empty() const { return taps_.empty(); }
  bool full() const { return taps_.size() >= kMost; }
  void add(ConnectionId id, const inspect::AskT& wanted);
  void remove(ConnectionId id) { taps_.erase(id); }

  void happened(const Happening& happening) override;

  /// Something waits to be sent, if only the number of what was missed.
  bool waiting() const;
  std::vector<ConnectionId> ids() const;
  /// What waits for this one, up to about kAtOnce bytes; empty: nothing.
  inspect::ReportT take(ConnectionId id);
  /// Nothing that waits for it can be sent for now. Returns how much it misses more.
  std::uint64_t drop(ConnectionId id);

 private:
  static constexpr std::size_t kMostNoted = 8192;     // for one tap
  static constexpr std::size_t kAtOnce = 256 * 1024;  // bytes

  /// As it is told, and what that only points to. Made into a report later: members wait while it is noted.
  struct Noted {
    explicit Noted(const Happening& from);
    Happening happening;
    std::string group, name;
    std::chrono::system_clock::time_point time = std::chrono::system_clock::now();
  };
  struct Tap {
    std::set<std::string, std::less<>> groups;  // none: all
    std::uint32_t kinds = 0;                    // a bit for each; none: all
    bool contents = false;
    bool wants(const Happening& happening) const;
    std::vector<Noted> noted;
    std::uint64_t missed = 0;   // before the first of those
    std::uint64_t missing = 0;  // after the last
  };
  static std::unique_ptr<inspect::HappeningT> told(const Noted& noted, bool contents);

  std::map<ConnectionId, Tap> taps_;
};

}  // namespace gs::daemon
