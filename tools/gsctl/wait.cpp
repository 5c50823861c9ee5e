// gsctl wait: until a group is as wanted.
#include "tools/gsctl/command.h"
#include "tools/gsctl/member.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/session.h"
#include "tools/gsctl/text.h"

namespace gsctl {
namespace {

struct Options {
  std::string group;
  std::optional<std::size_t> members;
  std::optional<std::string> state;
  bool gone = false;
  bool leader = false;
};

class Wait {
 public:
  Wait(Loop& loop, const Options& options, const Settings& settings)
      : options_(options),
        settings_(settings),
        loop_(loop),
        subscription_(loop, options.group, what(options), [this](const auto& n) { changed(n); }) {}

  void begin() {
    const wyx_rc_t rc = subscription_.subscribeGroup();
    if (rc == WYX_UNKNOWN_GROUP) return done();  // it is gone
    if (rc != WYX_OK)
      throw Error(rc == WYX_NO_INIT ? kLost : kRefused, "group '" + options_.group + "': " + explain(rc));
  }

 private:
  /// A group that is gone ends a subscription only when it is not to wait for the next of that name.
  static int what(const Options& options) {
    return WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP | (options.gone ? 0 : WYX_SUBSCRIBE_PERSISTENCE);
  }

  void changed(const wyx_subscription_notification_t& n) {
    const int type = n.gs_subscription_type;
    if (type & WYX_SUBSCRIPTION_GS_HAS_DIED) return;
    if (type & WYX_SUBSCRIPTION_DISSOLVED) return done();
    if (n.gs_full_membership != nullptr) members_ = members_of(n.gs_full_membership);
    if (n.gs_state_value != nullptr) state_ = bytes_of(n.gs_state_value);
    event_ = n.gs_event_seqnum;
    if (is_so()) done();
  }

  bool is_so() const {
    if (options_.members) return members_.size() >= *options_.members;
    if (options_.state) return !members_.empty() && state_ == *options_.state;
    return options_.leader && !members_.empty();
  }

  void done() {
    if (settings_.json) {
      Json object = {{"time", utc_text()}};
      set_bytes(object, "group", options_.group);
      if (event_) object["event"] = *event_;
      object["members"] = to_json(options_.gone ? Members() : members_);
      print_json(object);
    } else if (options_.leader) {
      print_line(to_text(members_.front()));
    }
    loop_.stop();
  }

  const Options& options_;
  const Settings& settings_;
  Loop& loop_;
  Members members_;
  std::string state_;
  std::optional<std::uint64_t> event_;
  Subscription subscription_;
};

int wait(const Options& options, const Settings& settings) {
  check_group(options.group);
  Loop loop;
  Session session(loop);
  session.open();
  end_when_lost(session, "the daemon went away while group '" + options.group + "' was waited for");
  const auto limit = end_in_time(loop, settings, "time is over: group '" + options.group + "' is not so yet");
  Wait wait(loop, options, settings);
  wait.begin();
  loop.run();
  return kDone;
}

}  // namespace

Run add_wait(CLI::App& command) {
  auto options = std::make_shared<Options>();
  command.add_option("GROUP", options->group, "Its name")->type_name("")->required();
  CLI::Option_group* until = command.add_option_group("Until");
  until->add_option("--members", options->members, "It has so many members, or more; for none, --gone")
      ->type_name("N")
      ->check(CLI::Range(1, 1'000'000));
  until->add_option("--state", options->state, "Its state value is this")->type_name("TEXT");
  until->add_flag("--gone", options->gone, "There is no such group");
  until->add_flag("--leader", options->leader, "It has an oldest member, whose id is printed");
  until->require_option(1);
  return [options](const Settings& settings) { return wait(*options, settings); };
}

}  // namespace gsctl
