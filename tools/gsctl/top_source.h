// What top shows, asked for again and again without ever standing still for it.
#pragma once

#include <deque>
#include <functional>
#include <optional>

#include "tools/gsctl/inspection.h"
#include "tools/gsctl/loop.h"
#include "tools/gsctl/reports.h"

namespace gsctl {

/// As the daemon was when it was asked last.
struct Snapshot {
  inspect::DaemonT daemon;
  std::vector<std::unique_ptr<inspect::GroupT>> groups;
  std::vector<std::unique_ptr<inspect::SessionT>> sessions;
  std::vector<std::unique_ptr<inspect::MemberT>> members;  // of the group that was wanted
};

/// What is asked for beside the daemon and its groups.
struct Wanted {
  bool sessions = false;
  std::string members_of;
};

class TopSource {
 public:
  struct Callbacks {
    std::function<Wanted()> wanted;
    std::function<void(Snapshot)> told;
    std::function<void(std::string why)> lost;  // it goes on trying
  };

  /// Asks every `interval` seconds. Throws Error or InspectError: there is no daemon at first.
  TopSource(Loop& loop, double interval, Callbacks callbacks);

  /// At once, instead of when it is time.
  void ask_now();

 private:
  void connect();
  void begin();
  void ask_next();
  void receive();
  void take(inspect::ReportT report);
  void lose(const std::string& why);
  void again();
  void try_again();

  Loop& loop_;
  const double interval_;
  const Callbacks callbacks_;
  std::optional<gs::inspect::Inspector> inspector_;
  Loop::Handle readable_;
  Loop::Handle time_;
  std::deque<inspect::AskT> asks_;  // the first is on its way
  Snapshot snapshot_;
};

}  // namespace gsctl
