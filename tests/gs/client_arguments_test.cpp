// What bad input gets, and what the queries answer.

#include <arpa/inet.h>

#include <limits>

#include "support/client_fixture.h"

namespace test_support {
namespace {

class ClientArguments : public ClientTest {
 protected:
  void SetUp() override {
    ClientTest::SetUp();
    ASSERT_EQ(join(group, 1, &token), WYX_OK);
    ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().count(token, WYX_APPROVED_NOTIFICATION) == 1; }));
    ASSERT_EQ(subscribe(group.name, WYX_SUBSCRIBE_STATE, &watcher), WYX_OK);
    ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().of(watcher).size() == 1; }));
    recorder().reset();
  }
  /// Nothing has happened, and the session works.
  void TearDown() override {
    EXPECT_FALSE(readable(fd()));
    EXPECT_EQ(change_state(token, "well"), WYX_OK);
    EXPECT_TRUE(dispatch_until(fd(), [&] { return recorder().of(watcher).size() == 1; }));
    EXPECT_EQ(recorder().of(watcher)[0].state, "well");
    ClientTest::TearDown();
  }

  Group group{"arguments"};
  wyx_token_t token = -1;
  wyx_token_t watcher = -1;
};

TEST_P(ClientArguments, NullPointers_areBadParameters) {
  wyx_proposal_info_t empty = {};
  wyx_token_t unused = -5;
  EXPECT_EQ(wyx_join(&unused, nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_join(&unused, &empty), WYX_BAD_PARAMETER);
  EXPECT_EQ(join(group, 2, nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_subscribe(&unused, nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_subscribe(&unused, &empty), WYX_BAD_PARAMETER);
  EXPECT_EQ(subscribe(group.name, WYX_SUBSCRIBE_STATE, nullptr), WYX_BAD_PARAMETER);
  for (const auto entry :
       {wyx_change_state_value, wyx_send_message, wyx_leave, wyx_expel, wyx_change_attributes}) {
    EXPECT_EQ(entry(token, nullptr), WYX_BAD_PARAMETER);
  }
  for (const auto entry :
       {wyx_change_state_value, wyx_send_message, wyx_leave, wyx_expel, wyx_change_attributes}) {
    EXPECT_EQ(entry(token, &empty), WYX_BAD_PARAMETER) << "no phases";
  }
  EXPECT_EQ(wyx_change_responsiveness(nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(unused, -5);
}

TEST_P(ClientArguments, Names_overTheLimitAreTooLong) {
  wyx_token_t unused = -5;
  Group longest(std::string(32, 'n'));
  ASSERT_EQ(join(longest, 1, &unused), WYX_OK);
  ASSERT_TRUE(dispatch_until(fd(), [&] { return recorder().of(unused).size() == 1; }));
  ASSERT_EQ(wyx_goodbye(unused), WYX_OK);
  for (const std::size_t length : {33, 5000, 300000}) {
    Group too_long(std::string(length, 'n'));
    EXPECT_EQ(join(too_long, 1, &unused), WYX_NAME_TOO_LONG) << length;
    EXPECT_EQ(subscribe(too_long.name, WYX_SUBSCRIBE_STATE, &unused), WYX_NAME_TOO_LONG) << length;
  }
  std::string local(257, 'l');
  const wyx_proposal_info_t info = join_info(group, 2, local);
  EXPECT_EQ(wyx_join(&unused, &info), WYX_NAME_TOO_LONG);
  Group unnamed("");
  EXPECT_EQ(join(unnamed, 1, &unused), WYX_BAD_PARAMETER);
  EXPECT_EQ(subscribe("", WYX_SUBSCRIBE_STATE, &unused), WYX_BAD_PARAMETER);
}

TEST_P(ClientArguments, Lengths_overTheLimitOrNegativeOrOfNothing_areBadParameters) {
  constexpr int kLimit = 64 * 1024;
  std::string largest(kLimit + 1, 's');
  for (const int length : {-1, kLimit + 1, std::numeric_limits<int>::max()}) {
    wyx_proposal_info_t info = state_info(largest, WYX_1_PHASE);
    info._gs_protocol_info._gs_state_change_request.gs_new_state.gs_length = length;
    EXPECT_EQ(wyx_change_state_value(token, &info), WYX_BAD_PARAMETER) << length;
    EXPECT_EQ(wyx_send_message(token, &info), WYX_BAD_PARAMETER) << length;
    const wyx_state_value_t state = {length, largest.data()};
    EXPECT_EQ(wyx_vote(token, WYX_VOTE_APPROVE, &state, nullptr, WYX_NULL_VOTE), WYX_BAD_PARAMETER) << length;
  }
  wyx_proposal_info_t nothing = state_info(largest, WYX_1_PHASE);
  nothing._gs_protocol_info._gs_state_change_request.gs_new_state = {1, nullptr};
  EXPECT_EQ(wyx_change_state_value(token, &nothing), WYX_BAD_PARAMETER);
}

TEST_P(ClientArguments, ValuesThatDoNotExist_areRefused) {
  for (const int phases : {0, 3, -1, 1000000}) {
    EXPECT_EQ(change_state(token, "x", static_cast<wyx_num_phases_t>(phases)), WYX_BAD_PARAMETER) << phases;
  }
  wyx_token_t unused = -5;
  Group odd("odd");
  odd.attributes.gs_num_phases = static_cast<wyx_num_phases_t>(9);
  EXPECT_EQ(join(odd, 1, &unused), WYX_BAD_GROUP_ATTRIBUTES);
  odd = Group("odd");
  odd.attributes.gs_batch_control = static_cast<wyx_batch_ctrl_t>(-1);
  EXPECT_EQ(join(odd, 1, &unused), WYX_BAD_GROUP_ATTRIBUTES);
  odd = Group("odd");
  odd.attributes.gs_merge_control = static_cast<wyx_merge_ctrl_t>(-3);
  EXPECT_EQ(join(odd, 1, &unused), WYX_BAD_GROUP_ATTRIBUTES);
  EXPECT_EQ(vote(token, static_cast<wyx_vote_value_t>(77)), WYX_VOTE_VALUE_NOT_ALLOWED);
  EXPECT_EQ(vote(token, WYX_VOTE_APPROVE_AND_SWITCH_ALPHA_OMEGA), WYX_VOTE_VALUE_NOT_ALLOWED);
  EXPECT_EQ(wyx_dispatch(static_cast<wyx_dispatch_flag_t>(2)), WYX_BAD_PARAMETER);

  Group sourced("sourced");
  std::string source = "source";
  sourced.attributes.gs_source_group_name = source.data();
  EXPECT_EQ(join(sourced, 1, &unused), WYX_NOT_SUPPORTED);
  EXPECT_EQ(subscribe(group.name, WYX_SUBSCRIBE_ADAPTER_INFO, &unused), WYX_NOT_SUPPORTED);
}

TEST_P(ClientArguments, Expel_listsThatCannotBe) {
  wyx_provider_t twice[2] = {};
  wyx_proposal_info_t info = {};
  auto& request = info._gs_protocol_info._gs_expel_request;
  request.gs_num_phases = WYX_1_PHASE;
  request.gs_expel_list = {1, nullptr};
  EXPECT_EQ(wyx_expel(token, &info), WYX_BAD_PARAMETER);
  request.gs_expel_list = {0, twice};
  EXPECT_EQ(wyx_expel(token, &info), WYX_BAD_PARAMETER);
  request.gs_expel_list = {2, twice};
  EXPECT_EQ(wyx_expel(token, &info), WYX_PROVIDER_APPEARS_TWICE);
  request.gs_expel_list = {1, twice};
  EXPECT_EQ(wyx_expel(token, &info), WYX_UNKNOWN_PROVIDER);
  request.gs_deactivate_phase = -1;
  EXPECT_EQ(wyx_expel(token, &info), WYX_INVALID_DEACTIVATE_PHASE);
}

TEST_P(ClientArguments, TokensOfNobodyOrOfTheWrongKind_areBad) {
  for (const wyx_token_t bad : {-1, 0, token + 1000, watcher, std::numeric_limits<int>::max()}) {
    EXPECT_EQ(change_state(bad, "x"), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(send_message(bad, "x"), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(leave(bad), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(expel(bad, {}, ""), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(wyx_change_attributes(bad, nullptr), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(wyx_goodbye(bad), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(vote(bad, WYX_VOTE_APPROVE), WYX_BAD_MEMBER_TOKEN);
  }
  EXPECT_EQ(wyx_unsubscribe(token), WYX_BAD_MEMBER_TOKEN);
  EXPECT_EQ(wyx_unsubscribe(-1), WYX_BAD_MEMBER_TOKEN);
}

TEST_P(ClientArguments, Responsiveness_beyondPingsIsNotSupported) {
  wyx_responsiveness_t settings = {};
  settings.gs_responsiveness_interval = 1;
  for (const auto type : {WYX_COUNTER_RESPONSIVENESS, WYX_CRITICAL_CLIENT, WYX_EXEC_SCRIPT_WHEN_SLOW,
                          WYX_DAEMON_MUST_DIE_WHEN_SLOW, WYX_KILL_CLIENT_WHEN_SLOW}) {
    settings.gs_responsiveness_type = type;
    EXPECT_EQ(wyx_change_responsiveness(&settings), WYX_NOT_SUPPORTED);
  }
  settings.gs_responsiveness_type = WYX_PING_RESPONSIVENESS;
  settings.gs_responsiveness_interval = 0;
  EXPECT_EQ(wyx_change_responsiveness(&settings), WYX_BAD_PARAMETER);
}

TEST_P(ClientArguments, AdaptersById_areThoseOfThisNode) {
  int node = -1;
  ASSERT_EQ(wyx_get_node_number(&node), WYX_OK);
  wyx_provider_t here = {};
  here._gs_provider_info._gs_instance_number = 1;
  here._gs_provider_info._gs_node_number = static_cast<short>(node);
  wyx_provider_t elsewhere = here;
  elsewhere._gs_provider_info._gs_node_number = static_cast<short>(node + 1);

  wyx_adapter_info info = {};
  EXPECT_EQ(wyx_get_adapter_info_by_id(token, &here, &info), WYX_OK);
  EXPECT_TRUE(info.gs_member_id == here);
  EXPECT_EQ(info.node_number, node);
  EXPECT_EQ(wyx_get_adapter_info_by_id(token, &elsewhere, &info), WYX_ADAPTER_INFO_NOT_FOUND);
  EXPECT_EQ(wyx_get_adapter_info_by_id(token, &here, nullptr), WYX_NULL_ADAPTER_INFO);
  EXPECT_EQ(wyx_get_adapter_info_by_id(-1, &here, &info), WYX_BAD_MEMBER_TOKEN);
  wyx_ip_addr address = {};
  EXPECT_EQ(wyx_get_ipaddr_by_id(token, &here, &address), WYX_OK);
  EXPECT_EQ(wyx_get_adapter_info_by_addr(&address, &info), WYX_OK);
  EXPECT_EQ(wyx_get_ipaddr_by_id(token, &elsewhere, &address), WYX_NO_IPV4_ADDRESS_FOR_THE_ID);
  EXPECT_EQ(wyx_get_ipaddr_by_id(token, &here, nullptr), WYX_BAD_PARAMETER);
}

TEST_P(ClientArguments, Setup_asSecondOrWithWhatCannotBe_changesNothing) {
  EXPECT_EQ(setup().rc, WYX_EXISTS);
  wyx_descriptor_t descriptor = -9;
  const auto call = [](int version, int count, wyx_descriptor_t* out, const char* path) {
    return wyx_setup(version, count, out, WYX_SOCKET_NO_SIGNAL, nullptr, path, nullptr, nullptr, nullptr);
  };
  EXPECT_EQ(call(0, 7, &descriptor, ""), WYX_BAD_PARAMETER);
  EXPECT_EQ(call(28, 6, &descriptor, ""), WYX_BAD_PARAMETER);
  EXPECT_EQ(call(28, 9, &descriptor, ""), WYX_BAD_PARAMETER);
  EXPECT_EQ(call(28, 7, nullptr, ""), WYX_BAD_PARAMETER);
  EXPECT_EQ(call(28, 7, &descriptor, std::string(5000, 'p').c_str()), WYX_NAME_TOO_LONG);
  EXPECT_EQ(descriptor, -9);
}

INSTANTIATE_TEST_SUITE_P(Endpoints, ClientArguments, kEndpoints, endpoint_name);

// ---------------------------------------------------------------------------------------- without any session

TEST(ClientWithoutSession, Requests_wantOne) {
  Group group("none");
  wyx_token_t token = -5;
  EXPECT_EQ(join(group, 1, &token), WYX_NO_INIT);
  EXPECT_EQ(subscribe("none", WYX_SUBSCRIBE_STATE, &token), WYX_NO_INIT);
  EXPECT_EQ(change_state(1, "x"), WYX_NO_INIT);
  EXPECT_EQ(vote(1, WYX_VOTE_APPROVE), WYX_NO_INIT);
  EXPECT_EQ(wyx_goodbye(1), WYX_NO_INIT);
  EXPECT_EQ(wyx_unsubscribe(1), WYX_NO_INIT);
  EXPECT_EQ(wyx_dispatch(WYX_NON_BLOCKING), WYX_NO_INIT);
  EXPECT_EQ(wyx_dispatch(WYX_BLOCKING), WYX_NO_INIT);
  EXPECT_EQ(wyx_quit(), WYX_NO_INIT);
  const wyx_responsiveness_t settings = {};
  EXPECT_EQ(wyx_change_responsiveness(&settings), WYX_NO_INIT);
  EXPECT_EQ(token, -5);
}

TEST(ClientWithoutSession, Endpoint_thatMakesNoSense) {
  const std::string long_path = "unix:/" + std::string(108, 'p');
  for (const char* value : {"unix:", "unix:relative", "embedded", "embedded:x", "tcp:host", long_path.c_str()}) {
    setenv("GSD_ENDPOINT", value, 1);
    EXPECT_EQ(setup().rc, WYX_BAD_PARAMETER) << value;
    int node = -1;
    EXPECT_EQ(wyx_get_node_number(&node), WYX_BAD_PARAMETER) << value;
  }
}

TEST(ClientWithoutSession, NoDaemon_isSaidAtOnceAndCaptured) {
  const TempDir dir;
  setenv("GSD_ENDPOINT", ("unix:" + dir / "none").c_str(), 1);
  char before[64], after[64];
  ASSERT_EQ(wyx_get_ffdc_id(before), WYX_OK);
  const SetupResult refused = setup();
  EXPECT_EQ(refused.rc, WYX_CONNECT_FAILED);
  EXPECT_EQ(refused.descriptor, -1);
  int node = -7;
  EXPECT_EQ(wyx_get_node_number(&node), WYX_CONNECT_FAILED);
  EXPECT_EQ(wyx_get_domain_master_node_number(&node), WYX_CONNECT_FAILED);
  EXPECT_EQ(node, -7);
  ASSERT_EQ(wyx_get_ffdc_id(after), WYX_OK);
  EXPECT_STRNE(before, after);
  EXPECT_TRUE(std::string(after).starts_with("connect-2-")) << after;
  EXPECT_EQ(wyx_get_ffdc_id(nullptr), WYX_BAD_PARAMETER);
}

TEST(ClientWithoutSession, NodeQueries_askTheDaemon) {
  const GsdProcess daemon({"--node-number", "17"});
  setenv("GSD_ENDPOINT", daemon.endpoint().c_str(), 1);
  int node = -1, master = -1;
  EXPECT_EQ(wyx_get_node_number(&node), WYX_OK);
  EXPECT_EQ(wyx_get_domain_master_node_number(&master), WYX_OK);
  EXPECT_EQ(node, 17);
  EXPECT_EQ(master, 17);
  EXPECT_EQ(wyx_get_node_number(nullptr), WYX_BAD_PARAMETER);
  wyx_adapter_info info = {};
  EXPECT_EQ(wyx_get_adapter_info(&info), WYX_OK);
  EXPECT_EQ(info.node_number, 17);
}

TEST(ClientWithoutSession, Adapters_areTheHosts) {
  setenv("GSD_ENDPOINT", "embedded:", 1);
  wyx_adapter_info info = {};
  ASSERT_EQ(wyx_get_adapter_info(&info), WYX_OK);
  EXPECT_STRNE(info.interface_name, "");
  EXPECT_EQ(wyx_get_adapter_info(nullptr), WYX_NULL_ADAPTER_INFO);

  wyx_ip_addr address = {};
  address.ipv4_in_6.ip4x.s_addr = htonl(INADDR_LOOPBACK);
  ASSERT_EQ(wyx_get_adapter_info_by_addr(&address, &info), WYX_OK);
  EXPECT_STREQ(info.interface_name, "lo");
  address.ipv4_in_6.filler[2] = htonl(0xffff);  // the same, IPv6-mapped
  EXPECT_EQ(wyx_get_adapter_info_by_addr(&address, &info), WYX_OK);
  EXPECT_EQ(wyx_get_adapter_info_by_addr(&address, nullptr), WYX_NULL_ADAPTER_INFO);
  address.ipv4_in_6.ip4x.s_addr = inet_addr("192.0.2.77");  // documentation: nobody's
  EXPECT_EQ(wyx_get_adapter_info_by_addr(&address, &info), WYX_ADAPTER_INFO_NOT_FOUND);
  address.ipv4_in_6.ip4x.s_addr = inet_addr("224.0.0.1");
  EXPECT_EQ(wyx_get_adapter_info_by_addr(&address, &info), WYX_BAD_INPUT_IP_FORMAT);
  address = {};
  EXPECT_EQ(wyx_get_adapter_info_by_addr(&address, &info), WYX_BAD_INPUT_IP_FORMAT);
  EXPECT_EQ(wyx_get_adapter_info_by_addr(nullptr, &info), WYX_BAD_INPUT_IP_FORMAT);
}

TEST(ClientWithoutSession, LimitsAndVersions) {
  wyx_limits limits = {};
  ASSERT_EQ(wyx_get_limits(&limits), WYX_OK);
  EXPECT_EQ(limits.max_group_name_length, 32);
  EXPECT_EQ(limits.max_state_value_length, 65536);
  EXPECT_EQ(limits.max_provider_message_length, 65536);
  EXPECT_EQ(wyx_get_limits(nullptr), WYX_BAD_PARAMETER);

  setenv("ZN_CU_VERSION", "3.2.6.1", 1);
  wyx_zelt_version_t active = {}, installed = {};
  ASSERT_EQ(wyx_get_zelt_active_version(&active), WYX_OK);
  ASSERT_EQ(wyx_get_zelt_installed_version(&installed), WYX_OK);
  EXPECT_EQ(active.quick_version, installed.quick_version);
  EXPECT_EQ(installed.quick_version >> 24, installed.vrmf.version);
  EXPECT_EQ(installed.quick_version & 0xff, installed.vrmf.fixlevel);
  EXPECT_EQ(wyx_get_zelt_active_version(nullptr), WYX_BAD_PARAMETER);
}

}  // namespace
}  // namespace test_support
