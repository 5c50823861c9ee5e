// What the base API library reads, from a daemon that may say anything: the input is a small program of requests,
// messages of the daemon and dispatches. The callbacks read every byte of their records. Whatever is said, each
// call comes back, and a client is told only what is for its kind.
#include "fuzz/hostile_daemon.h"

namespace {

using namespace test_support;

void on_domain_control(const wyx_domain_control_notification_t* n) {
  if (n->domain_event_type != WYX_DOMAIN_NODE_CONFIG) return;
  for (const wyx_node_list_t* list : {n->info.nodes.current, n->info.nodes.added, n->info.nodes.removed})
    for (unsigned i = 0; i < list->gs_count; ++i)
      if (list->gs_nodes[i].node_number < 0) abort();
}

class Run {
 public:
  Run(const std::uint8_t* data, std::size_t size) : in_(data, size) {
    Recorder::get().reset();
    setup(on_domain_control);
  }
  ~Run() {
    daemon_.answer_request();
    wyx_quit();
    if (wyx_dispatch(WYX_NON_BLOCKING) != WYX_NO_INIT) abort();
  }

  void run() {
    for (int steps = 0; !in_.empty() && steps < kMaxSteps; ++steps) step();
    for (const Seen& seen : Recorder::get().all()) {
      const bool of_subscriber = std::holds_alternative<gs::SubscriptionNotification>(seen.what);
      const bool known = seen.token == -1 || std::ranges::count(tokens_, seen.token) > 0;
      if (!known || (of_subscriber && std::ranges::count(subscribers_, seen.token) == 0)) abort();
    }
  }

 private:
  static constexpr int kMaxSteps = 64;

  void step() {
    switch (in_.byte() % 10) {
      case 0:
        return enter([](wyx_token_t* token) { return subscribe("g", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP, token); },
                     true);
      case 1:
        return enter(
            [](wyx_token_t* token) {
              Group group("g");
              return join(group, 1, token);
            },
            false);
      case 2:
        return request();
      case 3:
        return in_.byte() < 32 ? daemon_.hang_up() : daemon_.say();
      case 4:
        daemon_.answer_request();
        if (in_.byte() < 128) wyx_quit();
        daemon_.begin();
        setup(on_domain_control);
        return;
      case 5:
      case 6:
        wyx_dispatch(WYX_NON_BLOCKING);
        return;
      default:
        return daemon_.say();
    }
  }

  template <typename Ask>
  void enter(const Ask& ask, bool subscriber) {
    daemon_.answer_request();
    wyx_token_t token = -1;
    if (ask(&token) != WYX_OK) return;
    daemon_.know(token);
    tokens_.push_back(token);
    if (subscriber) subscribers_.push_back(token);
  }

  void request() {
    const wyx_token_t token = tokens_.empty() ? 1 : tokens_[in_.byte() % tokens_.size()];
    const int kind = in_.byte() % 7;
    int node = 0;
    if (kind != 6) daemon_.answer_request();
    switch (kind) {
      case 0:
        send_message(token, "message");
        break;
      case 1:
        change_state(token, "state");
        break;
      case 2:
        leave(token);
        break;
      case 3:
        vote(token, WYX_VOTE_APPROVE);
        break;
      case 4:
        wyx_goodbye(token);
        break;
      case 5:
        wyx_unsubscribe(token);
        break;
      default:
        daemon_.answer_query([&] { wyx_get_domain_master_node_number(&node); });
    }
  }

  fuzz::Input in_;
  fuzz::HostileDaemon daemon_{in_};
  std::vector<wyx_token_t> tokens_, subscribers_;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  Run(data, size).run();
  return 0;
}
