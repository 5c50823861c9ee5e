// A base API that answers like a daemon, for many threads: a request is accepted and its notification queued;
// dispatch hands queued notifications to the callbacks. It allocates nothing once its tables have grown.
#ifndef TESTS_GSCL_FAKE_DAEMON_H
#define TESTS_GSCL_FAKE_DAEMON_H

#include <deque>
#include <mutex>
#include <vector>

#include "gscl/gscl.h"

namespace fake_daemon {

/// One at a time.
class FakeDaemon {
 public:
  FakeDaemon();
  ~FakeDaemon();
  FakeDaemon(const FakeDaemon&) = delete;
  FakeDaemon& operator=(const FakeDaemon&) = delete;

 private:
  struct Client {
    wyx_join_request_t join;
    wyx_subscription_cb_t* subscribed;
    wyx_provider_t id;
    bool live;
  };
  struct Event {
    wyx_token_t token;
    wyx_request_t protocol;  // WYX_SUBSCRIPTION for a subscription notification
  };

  static wyx_rc_t enter(wyx_token_t* token, const wyx_proposal_info_t* proposal, bool join);
  static wyx_rc_t propose(wyx_token_t token, wyx_request_t protocol);
  static wyx_rc_t leave(wyx_token_t token);
  static wyx_rc_t dispatch(wyx_dispatch_flag_t flag);
  static void deliver(const Client& client, const Event& event);

  std::mutex mutex_;
  std::vector<Client> clients_;  // by token
  std::vector<Event> queue_;     // oldest at head_
  size_t head_ = 0;
  GSAPIRtnCollection_t table_ = {};
  GSAPIRtnCollection_t* table_before_;
};

}  // namespace fake_daemon

#endif
