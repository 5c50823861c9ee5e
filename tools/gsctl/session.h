// The session with the daemon, on the loop of a command.
#pragma once

#include <functional>
#include <string>

#include "gscl/gscl.h"
#include "tools/gsctl/command.h"
#include "tools/gsctl/loop.h"

namespace gsctl {

/// Owns the process's controller: construct it before members and subscriptions. Their callbacks run from the
/// loop, or inside open().
class Session : private zelt_gscl_V1::GSController {
 public:
  explicit Session(Loop& loop) : loop_(loop) {}
  ~Session() override;

  /// Throws Error: there is no daemon, it is not permitted, or makes no sense.
  void open();
  /// False: no daemon can be had. Also after the session was lost.
  bool try_open();
  void close();

  /// What is called, from the loop, when the daemon is gone and all that it said has been handed out. Nothing of
  /// this session works then until it is opened again.
  void on_lost(std::function<void()> callback) { lost_ = std::move(callback); }

  /// Tries, until it is open, and calls `callback` then, from the loop.
  void reopen(std::function<void()> callback);

  /// What is called whenever all that had arrived has been handed out.
  void on_delivered(std::function<void()> callback) { delivered_ = std::move(callback); }

  /// Takes effect at the next opening: the daemon asks every second whether this process runs, and announces it to
  /// its groups when an answer takes `seconds`. `asked` is called each time.
  void be_responsive(unsigned short seconds, std::function<void()> asked);

  /// This host's.
  static short node();

 private:
  void deliver();
  wyx_callback_rc_t responsivenessCb(const wyx_responsiveness_notification_t* notification) override;

  Loop& loop_;
  Loop::Handle readable_;
  std::function<void()> lost_;
  std::function<void()> asked_;
  std::function<void()> delivered_;
  Loop::Handle retry_;
};

/// For commands that end with the session: status 5 with this text.
void end_when_lost(Session& session, const std::string& text);

/// The time limit of a command: status 4 with this text. Nothing without --timeout.
[[nodiscard]] Loop::Handle end_in_time(Loop& loop, const Settings& settings, const std::string& text);

/// A client of the library whose notification comes as `on_change` on the loop. The records live only during the
/// call.
class Subscription : public zelt_gscl_V1::GSSubscriber {
 public:
  using Change = std::function<void(const wyx_subscription_notification_t&)>;
  Subscription(Loop& loop, const std::string& group, int what, Change on_change);

 private:
  void subscribeCb(const wyx_subscription_notification_t* notification) override;

  Loop& loop_;
  const Change on_change_;
};

/// Throws Error: the name of a group is empty, or over what the library keeps.
void check_group(const std::string& group);

}  // namespace gsctl
