// Watches a group without being in it: prints who is in and what its state is, whenever that changes.
//
//   watcher GROUP
//
// It ends when the group does, or at the end of its standard input.
#include <poll.h>

#include <cstdio>
#include <string>

#include "examples/commands.h"
#include "examples/say.h"
#include "gscl/gscl.h"

using zelt_gscl_V1::GSController;
using zelt_gscl_V1::GSSubscriber;

class Watcher : public GSSubscriber {
 public:
  explicit Watcher(const char* group) : GSSubscriber(group, WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP) {}

  // A pointer is null when the notification does not carry that part: then it is as it was.
  void subscribeCb(const wyx_subscription_notification_t* n) override {
    if (n->gs_subscription_type & (WYX_SUBSCRIPTION_DISSOLVED | WYX_SUBSCRIPTION_GS_HAS_DIED)) {
      say(n->gs_event_seqnum, "the group is gone");
      return;
    }
    if (n->gs_full_membership) members_ = to_text(n->gs_full_membership);
    if (n->gs_state_value) state_ = to_text(n->gs_state_value);
    say(n->gs_event_seqnum, "members: " + members_ + "; state: " + state_);
  }

 private:
  std::string members_;
  std::string state_ = "\"\"";
};

static int fail(const char* what, wyx_rc_t rc) {
  std::fprintf(stderr, "watcher: %s: %s\n", what, zelt_gscl::gscl_rc_name(rc));
  return 1;
}

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: watcher GROUP\n");
    return 2;
  }
  GSController controller;
  wyx_rc_t rc = controller.initialize();
  if (rc != WYX_OK) return fail("no connection to the daemon", rc);
  Watcher watcher(argv[1]);
  rc = watcher.subscribeGroup();
  if (rc != WYX_OK) return fail("subscribe", rc);

  Commands commands;
  while (watcher.getClientState() != zelt_gscl::GS_IAM_IDLE) {
    pollfd ready[] = {{controller.getGSDescriptor(), POLLIN, 0}, {commands.descriptor(), POLLIN, 0}};
    if (poll(ready, 2, -1) < 0) return 1;
    if (ready[0].revents && (rc = controller.dispatch(WYX_NON_BLOCKING)) != WYX_OK) return fail("dispatch", rc);
    if (ready[1].revents && !commands.read_some()) break;
  }
  return 0;
}
