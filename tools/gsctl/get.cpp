// gsctl get: a group's state value.
#include "common/printable.h"
#include "tools/gsctl/command.h"
#include "tools/gsctl/member.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/session.h"
#include "tools/gsctl/text.h"

namespace gsctl {
namespace {

struct Options {
  std::string group;
  bool show = false;
};

void print(const Options& options, const Settings& settings, const wyx_subscription_notification_t& n) {
  const std::string value = bytes_of(n.gs_state_value);
  if (settings.json) {
    Json object = Json::object();
    set_bytes(object, "group", options.group);
    object["event"] = n.gs_event_seqnum;
    object["length"] = value.size();
    set_bytes(object, "state", value);
    print_json(object);
  } else if (options.show) {
    print_raw(platform::printable(value, "\n\t") + "\n");
  } else {
    print_raw(value);
  }
}

int get(const Options& options, const Settings& settings) {
  check_group(options.group);
  Loop loop;
  Session session(loop);
  session.open();
  end_when_lost(session, "the daemon went away before it said the value: try again");
  const auto limit = end_in_time(loop, settings, "no value of group '" + options.group + "' in time");
  Subscription subscription(loop, options.group, WYX_SUBSCRIBE_STATE, [&](const auto& n) {
    print(options, settings, n);
    loop.stop();
  });
  const wyx_rc_t rc = subscription.subscribeGroup();
  if (rc != WYX_OK) throw Error(kRefused, "group '" + options.group + "': " + explain(rc));
  loop.run();
  return kDone;
}

}  // namespace

Run add_get(CLI::App& command) {
  auto options = std::make_shared<Options>();
  command.add_option("GROUP", options->group, "Its name")->type_name("")->required();
  command.add_flag("--show", options->show, "Printable, with a line's end; without it, the bytes as they are");
  return [options](const Settings& settings) { return get(*options, settings); };
}

}  // namespace gsctl
