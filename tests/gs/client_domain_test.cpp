// What a session is told of its domain, and what becomes of its answers.

#include <signal.h>

#include "support/client_fixture.h"

namespace test_support {
namespace {

constexpr int kAll = WYX_ENABLE_DOMAIN_EVENT | WYX_ENABLE_OPQUORUM_CALLBACK | WYX_ENABLE_OPQUORUM_ACK_REQUIRED;

std::string told_so_far;  // one dispatching thread

std::string text(const wyx_node_list_t& list) {
  std::string all;
  for (unsigned i = 0; i < list.gs_count; ++i) all += " " + std::to_string(list.gs_nodes[i].node_number);
  return all;
}

void on_domain_control(const wyx_domain_control_notification_t* n) {
  EXPECT_EQ(n->notification_type, WYX_DOMAIN_NOTIFICATION);
  const auto& info = n->info;
  const auto& quorum = info.quorum_val;
  const auto& refused = info.domaincb_resp_err.err_info.quorum_resp_err;
  if (n->domain_event_type == WYX_DOMAIN_NODE_CONFIG)
    told_so_far +=
        "nodes" + text(*info.nodes.current) + " +" + text(*info.nodes.added) + " -" + text(*info.nodes.removed);
  if (n->domain_event_type == WYX_DOMAIN_MASTER_NODE)
    told_so_far += "master " + std::to_string(info.domain_master_info.node_number) + " of " +
                   std::to_string(info.domain_master_info.size);
  if (n->domain_event_type == WYX_OPQUORUM_INFO)
    told_so_far += "quorum " + std::to_string(quorum.notification_sequence) + ": " +
                   std::to_string(quorum.old_quorum_val) + " " + std::to_string(quorum.new_quorum_val);
  if (n->domain_event_type == WYX_DOMAINCB_RESP_ERR_INFO)
    told_so_far += "refused " + std::to_string(refused.quorum_resp.notification_sequence) + ": " +
                   std::to_string(refused.error_code);
  told_so_far += "\n";
}

class ClientDomain : public SessionTest, public testing::WithParamInterface<EndpointKind> {
 protected:
  void SetUp() override {
    if (GetParam() == EndpointKind::kDaemon) daemon.emplace();
    setenv("GSD_ENDPOINT", daemon ? daemon->endpoint().c_str() : "embedded:", 1);
    recorder().reset();
    told_so_far.clear();
  }
  void open_with(int flags, int count = 8, wyx_domain_control_cb_t* routine = on_domain_control) {
    ASSERT_EQ(wyx_setup(28, count, &descriptor, static_cast<wyx_socket_ctrl_t>(flags), nullptr, "", on_ping,
                        on_delayed_error, on_query, routine),
              WYX_OK);
  }
  /// Until so many lines are there; what came until then.
  std::string told(std::ptrdiff_t lines) {
    const auto count = [] { return std::count(told_so_far.begin(), told_so_far.end(), '\n'); };
    EXPECT_TRUE(dispatch_until(descriptor, [&] { return count() >= lines; }));
    wyx_dispatch(WYX_NON_BLOCKING);
    return std::exchange(told_so_far, "");
  }
  void join_a_group() {
    wyx_token_t token = -1;
    Group group("g");
    ASSERT_EQ(join(group, 1, &token), WYX_OK);
    EXPECT_TRUE(dispatch_until(descriptor, [&] { return !recorder().of(token).empty(); }));
    recorder().reset();
  }
  static wyx_rc_t answer(std::uint64_t sequence) {
    wyx_quorum_resp_t answer = {sequence, nullptr};
    return wyx_internal_send_domain_msg_to_gsd(WYX_PRIV_MSG_OPQUORUM, &answer, sizeof answer);
  }

  std::optional<GsdProcess> daemon;
  wyx_descriptor_t descriptor = -1;
};

TEST_P(ClientDomain, EachSession_isToldWhatItHasAskedForAndNothingElse) {
  const std::string nodes = "nodes 1 + 1 -\nmaster 1 of 1\n";
  open_with(WYX_ENABLE_DOMAIN_EVENT);
  EXPECT_EQ(told(2), nodes);
  EXPECT_EQ(answer(1), WYX_NOT_REGISTERED_FOR_SYNC_QUORUM);
  wyx_quit();
  open_with(WYX_ENABLE_OPQUORUM_CALLBACK);
  EXPECT_EQ(told(1), "quorum 0: 1 0\n");
  EXPECT_EQ(answer(0), WYX_NOT_REGISTERED_FOR_SYNC_QUORUM);
  EXPECT_EQ(told(1), "refused 0: 36\n");
  wyx_quit();
  const struct {
    int flags, count;
    wyx_domain_control_cb_t* routine;
  } silent[] = {
      {kAll, 7, on_domain_control}, {kAll, 8, nullptr}, {WYX_ENABLE_OPQUORUM_ACK_REQUIRED, 8, on_domain_control}};
  for (const auto& [flags, count, routine] : silent) {
    open_with(flags, count, routine);
    join_a_group();
    EXPECT_EQ(told_so_far, "");
    EXPECT_EQ(answer(1), WYX_NOT_REGISTERED_FOR_SYNC_QUORUM);
    wyx_quit();
  }
  EXPECT_EQ(answer(1), WYX_NO_INIT);
}

TEST_P(ClientDomain, AnswerToAQuorumNotification_isExpectedOnceWithItsSequence) {
  open_with(kAll);
  EXPECT_EQ(told(3), "nodes 1 + 1 -\nmaster 1 of 1\nquorum 1: 1 0\n");
  EXPECT_EQ(answer(2), WYX_BAD_QUORUM_MSG_SEQNUM);
  EXPECT_EQ(answer(1), WYX_OK);
  EXPECT_EQ(answer(1), WYX_UNEXPECTED_QUORUM_RESP);
  EXPECT_EQ(told(2), "refused 2: 35\nrefused 1: 37\n");
  std::uint64_t half = 1;
  EXPECT_EQ(wyx_internal_send_domain_msg_to_gsd(WYX_PRIV_MSG_OPQUORUM, &half, sizeof half), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_internal_send_domain_msg_to_gsd(WYX_PRIV_MSG_OPQUORUM, nullptr, 16), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_internal_send_domain_msg_to_gsd(WYX_PRIV_MSG_NONE, &half, 16), WYX_NOT_SUPPORTED);
}

TEST_P(ClientDomain, LossOfQuorum_isToldBeforeItsClientsHearThatTheDaemonHasDied) {
  if (!daemon) GTEST_SKIP() << "this process has no daemon to lose";
  open_with(kAll);
  told(3);
  join_a_group();
  recorder().set_hook([](const Seen& seen) { told_so_far += is_end(seen) ? "died\n" : "something\n"; });
  daemon->kill(SIGKILL);
  EXPECT_EQ(told(2), "quorum 0: 0 2\ndied\n");
  EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_NO_INIT);
}

INSTANTIATE_TEST_SUITE_P(Endpoints, ClientDomain, kEndpoints, endpoint_name);

}  // namespace
}  // namespace test_support
