// gsctl watch: a line, and if wanted a program, for each change of groups.
#include <list>

#include "tools/gsctl/all_changes.h"
#include "tools/gsctl/change.h"
#include "tools/gsctl/command.h"
#include "tools/gsctl/member.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/session.h"

namespace gsctl {
namespace {

constexpr int kEverything = WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP | WYX_SUBSCRIBE_PERSISTENCE;

struct Options {
  std::vector<std::string> groups;
  std::string command;
};

[[noreturn]] void end_unread() { throw OutputGone(); }

class Watch {
 public:
  Watch(Loop& loop, Session& session, const Options& options, const Settings& settings)
      : loop_(loop), session_(session), options_(options), settings_(settings), jobs_(loop) {
    for (const std::string& group : options.groups) {
      subscriptions_.emplace_back(loop, group, kEverything, [this, group](const auto& n) { changed(group, n); });
    }
  }

  void begin();

 private:
  void subscribe();
  void changed(const std::string& group, const wyx_subscription_notification_t& n);
  void left(Change change, const wyx_subscription_notification_t& n);
  void say(const Change& change);
  void say_of_all(const std::string& what);

  Loop& loop_;
  Session& session_;
  const Options& options_;
  const Settings& settings_;
  JobQueue jobs_;
  std::list<Subscription> subscriptions_;  // they stay where they are
  Loop::Handle reader_;
};

void Watch::begin() {
  session_.on_lost([this] {
    say_of_all("lost");
    session_.reopen([this] {
      say_of_all("found");
      subscribe();
    });
  });
  reader_ = when_unread(loop_, end_unread);
  subscribe();
}

void Watch::subscribe() {
  for (Subscription& subscription : subscriptions_) {
    const wyx_rc_t rc = subscription.subscribeGroup();
    if (rc == WYX_NO_INIT) return;  // of that the session tells
    if (rc != WYX_OK)
      throw Error(kRefused, std::string("group '") + subscription.getGroupName() + "': " + explain(rc));
  }
}

/// One notification can tell of several changes; they have one number.
void Watch::changed(const std::string& group, const wyx_subscription_notification_t& n) {
  const int type = n.gs_subscription_type;
  if (type & WYX_SUBSCRIPTION_GS_HAS_DIED) return;  // said once for all
  Change change{group, "now", n.gs_event_seqnum, {}, "", members_of(n.gs_full_membership), {}};
  const bool ended = (type & WYX_SUBSCRIPTION_PERSISTENT) != 0;
  const bool delta = (type & (WYX_SUBSCRIPTION_DELTA_JOIN | WYX_SUBSCRIPTION_DELTA_LEAVE)) != 0;
  if (!delta && !ended && n.gs_full_membership != nullptr) {
    change.bytes = bytes_of(n.gs_state_value);
    return say(change);
  }
  if (type & WYX_SUBSCRIPTION_DELTA_JOIN) {
    change.what = "joined";
    change.who = members_of(n.gs_changing_membership);
    say(change);
  }
  if (type & WYX_SUBSCRIPTION_DELTA_LEAVE) left(change, n);
  if ((type & WYX_SUBSCRIPTION_STATE) && !ended) {
    say({group, "state", n.gs_event_seqnum, {}, "", {}, bytes_of(n.gs_state_value)});
  }
  if (ended) say({group, "ended", n.gs_event_seqnum, {}, "", {}, {}});
}

/// A line for each reason.
void Watch::left(Change change, const wyx_subscription_notification_t& n) {
  const Members who = members_of(n.gs_changing_membership);
  change.what = "left";
  for (std::size_t i = 0; i < who.size(); ++i) {
    const std::string why =
        n.gs_leave_codes == nullptr ? "gone" : leave_reason(n.gs_leave_codes[i].gs_voluntary_or_failure);
    if (!change.who.empty() && why != change.why) {
      say(change);
      change.who.clear();
    }
    change.why = why;
    change.who.push_back(who[i]);
  }
  say(change);
}

void Watch::say(const Change& change) {
  print(change, settings_.json);
  if (!options_.command.empty()) jobs_.add(job_of(change, options_.command));
}

void Watch::say_of_all(const std::string& what) {
  for (const std::string& group : options_.groups) {
    say({group, what, {}, {}, what == "lost" ? "the daemon is gone" : "the daemon is back", {}, {}});
  }
}

/// Until interrupted.
void run(Loop& loop, const Settings& settings) {
  const auto interrupts = on_interrupt(loop, [&](int) { loop.stop(); });
  const auto limit = end_in_time(loop, settings, "watched for as long as --timeout says");
  loop.run();
}

/// Of every group there is.
void watch_all(const Options& options, const Settings& settings) {
  Loop loop;
  JobQueue jobs(loop);
  AllChanges changes(loop, [&](const Change& change) {
    print(change, settings.json);
    if (!options.command.empty()) jobs.add(job_of(change, options.command));
  });
  const auto reader = when_unread(loop, end_unread);
  run(loop, settings);
}

void watch_some(const Options& options, const Settings& settings) {
  for (const std::string& group : options.groups) check_group(group);
  Loop loop;
  Session session(loop);
  session.open();
  Watch watch(loop, session, options, settings);
  watch.begin();
  run(loop, settings);
}

int watch(const Options& options, const Settings& settings) {
  options.groups.empty() ? watch_all(options, settings) : watch_some(options, settings);
  return kDone;
}

}  // namespace

Run add_watch(CLI::App& command) {
  auto options = std::make_shared<Options>();
  command.add_option("GROUP", options->groups, "Their names; they need not be there yet. None: all there are")
      ->type_name("");
  command.add_option("--exec", options->command, "Run this by the shell for each change, one after the other")
      ->type_name("CMD");
  return [options](const Settings& settings) { return watch(*options, settings); };
}

}  // namespace gsctl
