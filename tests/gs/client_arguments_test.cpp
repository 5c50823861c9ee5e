// What bad input gets, and what the queries answer.

#include <arpa/inet.h>

#include <limits>
#include <tuple>

#include "support/client_fixture.h"

namespace test_support {
namespace {

constexpr auto kLargest = std::numeric_limits<int>::max();

class ClientArguments : public ClientTest {
 protected:
  void SetUp() override {
    ClientTest::SetUp();
    token = joined(group);
    ASSERT_EQ(subscribe(group.name, WYX_SUBSCRIBE_STATE, &watcher), WYX_OK);
    ASSERT_TRUE(all_arrive(watcher, 1));
    recorder().reset();
  }
  /// Nothing has happened, and the session works.
  void TearDown() override {
    EXPECT_EQ(unused, -5);
    EXPECT_FALSE(readable(fd()));
    EXPECT_EQ(change_state(token, "well"), WYX_OK);
    EXPECT_EQ(told(watcher), "subscription {state}, state 'well'\n");
    ClientTest::TearDown();
  }
  Group group{"arguments"};
  wyx_token_t token = -1;
  wyx_token_t watcher = -1;
  wyx_token_t unused = -5;
};

TEST_P(ClientArguments, NullPointers_areBadParameters) {
  wyx_proposal_info_t empty = {};
  for (const wyx_proposal_info_t* info : {static_cast<wyx_proposal_info_t*>(nullptr), &empty}) {
    EXPECT_EQ(wyx_join(&unused, info), WYX_BAD_PARAMETER);
    EXPECT_EQ(wyx_subscribe(&unused, info), WYX_BAD_PARAMETER);
    for (const auto entry :
         {wyx_change_state_value, wyx_send_message, wyx_leave, wyx_expel, wyx_change_attributes})
      EXPECT_EQ(entry(token, info), WYX_BAD_PARAMETER);
  }
  EXPECT_EQ(join(group, 2, nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(subscribe(group.name, WYX_SUBSCRIBE_STATE, nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_change_responsiveness(nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_get_node_number(nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_get_limits(nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_get_zelt_active_version(nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_get_ffdc_id(nullptr), WYX_BAD_PARAMETER);
  EXPECT_EQ(wyx_get_adapter_info(nullptr), WYX_NULL_ADAPTER_INFO);
}

TEST_P(ClientArguments, NamesAndLengths_overTheLimitOrOfNothing_areRefused) {
  wyx_token_t longest = -1;
  Group whole(std::string(32, 'n'));
  ASSERT_EQ(join(whole, 1, &longest), WYX_OK);
  ASSERT_TRUE(all_arrive(longest, 1));
  ASSERT_EQ(wyx_goodbye(longest), WYX_OK);
  for (const auto& [length, rc] : {std::pair{0, WYX_BAD_PARAMETER},
                                   {33, WYX_NAME_TOO_LONG},
                                   {5000, WYX_NAME_TOO_LONG},
                                   {300000, WYX_NAME_TOO_LONG}}) {
    const std::string name(static_cast<std::size_t>(length), 'n');
    Group named(name);
    EXPECT_EQ(join(named, 1, &unused), rc) << length;
    EXPECT_EQ(subscribe(name, WYX_SUBSCRIBE_STATE, &unused), rc) << length;
  }
  std::string local(257, 'l');
  const wyx_proposal_info_t info = join_info(group, 2, local);
  EXPECT_EQ(wyx_join(&unused, &info), WYX_NAME_TOO_LONG);

  constexpr int kLimit = 64 * 1024;
  std::string largest(kLimit + 1, 's');
  const wyx_state_value_t wrong[] = {
      {-1, largest.data()}, {kLimit + 1, largest.data()}, {kLargest, largest.data()}, {1, nullptr}};
  for (const wyx_state_value_t& value : wrong) {
    wyx_proposal_info_t request = state_info(largest, WYX_1_PHASE);
    request._gs_protocol_info._gs_state_change_request.gs_new_state = value;
    EXPECT_EQ(wyx_change_state_value(token, &request), WYX_BAD_PARAMETER) << value.gs_length;
    EXPECT_EQ(wyx_send_message(token, &request), WYX_BAD_PARAMETER) << value.gs_length;
    EXPECT_EQ(wyx_vote(token, WYX_VOTE_APPROVE, &value, nullptr, WYX_NULL_VOTE), WYX_BAD_PARAMETER);
  }
}

TEST_P(ClientArguments, ValuesThatDoNotExist_areRefused) {
  EXPECT_EQ(change_state(token, "x", static_cast<wyx_num_phases_t>(1000000)), WYX_BAD_PARAMETER);
  EXPECT_EQ(vote(token, static_cast<wyx_vote_value_t>(77)), WYX_VOTE_VALUE_NOT_ALLOWED);
  EXPECT_EQ(wyx_dispatch(static_cast<wyx_dispatch_flag_t>(2)), WYX_BAD_PARAMETER);
  Group odd("odd");
  odd.attributes.gs_batch_control = static_cast<wyx_batch_ctrl_t>(-1);
  EXPECT_EQ(join(odd, 1, &unused), WYX_BAD_GROUP_ATTRIBUTES);
  std::string source = "source";
  odd.attributes.gs_source_group_name = source.data();
  EXPECT_EQ(join(odd, 1, &unused), WYX_NOT_SUPPORTED);

  wyx_provider_t list[2] = {};
  wyx_proposal_info_t info = {};
  auto& expel = info._gs_protocol_info._gs_expel_request;
  expel.gs_num_phases = WYX_1_PHASE;
  const std::pair<wyx_membership_t, wyx_rc_t> lists[] = {
      {{1, nullptr}, WYX_BAD_PARAMETER}, {{0, list}, WYX_BAD_PARAMETER}, {{2, list}, WYX_PROVIDER_APPEARS_TWICE}};
  for (const auto& [wrong, rc] : lists) {
    expel.gs_expel_list = wrong;
    EXPECT_EQ(wyx_expel(token, &info), rc);
  }

  wyx_responsiveness_t settings = {};
  settings.gs_responsiveness_type = WYX_PING_RESPONSIVENESS;
  EXPECT_EQ(wyx_change_responsiveness(&settings), WYX_BAD_PARAMETER) << "no interval";
  settings.gs_responsiveness_type = WYX_CRITICAL_CLIENT;
  EXPECT_EQ(wyx_change_responsiveness(&settings), WYX_NOT_SUPPORTED);
}

TEST_P(ClientArguments, TokensOfNobodyOrOfTheWrongKind_areBad) {
  wyx_provider_t provider = {};
  wyx_adapter_info info = {};
  for (const wyx_token_t bad : {-1, 0, token + 1000, watcher, kLargest}) {
    EXPECT_EQ(change_state(bad, "x"), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(send_message(bad, "x"), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(leave(bad), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(expel(bad, {}, ""), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(wyx_change_attributes(bad, nullptr), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(wyx_goodbye(bad), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(vote(bad, WYX_VOTE_APPROVE), WYX_BAD_MEMBER_TOKEN);
    EXPECT_EQ(wyx_get_adapter_info_by_id(bad, &provider, &info), WYX_BAD_MEMBER_TOKEN);
  }
  EXPECT_EQ(wyx_unsubscribe(token), WYX_BAD_MEMBER_TOKEN);
  EXPECT_EQ(wyx_unsubscribe(-1), WYX_BAD_MEMBER_TOKEN);
}

TEST_P(ClientArguments, AdaptersById_areThoseOfThisNode) {
  wyx_provider_t here = {}, elsewhere = {};
  here._gs_provider_info._gs_node_number = 1;
  elsewhere._gs_provider_info._gs_node_number = 2;
  wyx_adapter_info info = {};
  EXPECT_EQ(wyx_get_adapter_info_by_id(token, &here, &info), WYX_OK);
  EXPECT_TRUE(info.gs_member_id == here);
  EXPECT_EQ(info.node_number, 1);
  EXPECT_EQ(wyx_get_adapter_info_by_id(token, &elsewhere, &info), WYX_ADAPTER_INFO_NOT_FOUND);
  EXPECT_EQ(wyx_get_adapter_info_by_id(token, &here, nullptr), WYX_NULL_ADAPTER_INFO);
  wyx_ip_addr address = {};
  EXPECT_EQ(wyx_get_ipaddr_by_id(token, &here, &address), WYX_OK);
  EXPECT_EQ(wyx_get_adapter_info_by_addr(&address, &info), WYX_OK);
  EXPECT_EQ(wyx_get_ipaddr_by_id(token, &elsewhere, &address), WYX_NO_IPV4_ADDRESS_FOR_THE_ID);
  EXPECT_EQ(wyx_get_ipaddr_by_id(token, &here, nullptr), WYX_BAD_PARAMETER);
}

TEST_P(ClientArguments, Setup_asSecondOrWithWhatCannotBe_changesNothing) {
  EXPECT_EQ(setup().rc, WYX_EXISTS);
  wyx_descriptor_t descriptor = -9;
  const auto call = [](int version, int count, wyx_descriptor_t* out, const std::string& path) {
    return wyx_setup(version, count, out, WYX_SOCKET_NO_SIGNAL, nullptr, path.c_str(), nullptr, nullptr, nullptr);
  };
  EXPECT_EQ(call(0, 7, &descriptor, ""), WYX_BAD_PARAMETER);
  EXPECT_EQ(call(28, 6, &descriptor, ""), WYX_BAD_PARAMETER);
  EXPECT_EQ(call(28, 9, &descriptor, ""), WYX_BAD_PARAMETER);
  EXPECT_EQ(call(28, 7, nullptr, ""), WYX_BAD_PARAMETER);
  EXPECT_EQ(call(28, 7, &descriptor, std::string(5000, 'p')), WYX_NAME_TOO_LONG);
  EXPECT_EQ(descriptor, -9);
}

INSTANTIATE_TEST_SUITE_P(Endpoints, ClientArguments, kEndpoints, endpoint_name);

// ---------------------------------------------------------------------------------------- without any session

TEST(ClientWithoutSession, Requests_wantOne) {
  Group group("none");
  wyx_token_t token = -5;
  const wyx_responsiveness_t settings = {};
  for (const wyx_rc_t rc :
       {join(group, 1, &token), subscribe("none", WYX_SUBSCRIBE_STATE, &token), change_state(1, "x"),
        vote(1, WYX_VOTE_APPROVE), wyx_goodbye(1), wyx_unsubscribe(1), wyx_dispatch(WYX_NON_BLOCKING),
        wyx_dispatch(WYX_BLOCKING), wyx_quit(), wyx_change_responsiveness(&settings)})
    EXPECT_EQ(rc, WYX_NO_INIT);
  EXPECT_EQ(token, -5);
}

TEST(ClientWithoutSession, Endpoint_thatMakesNoSense) {
  const std::string long_path = "unix:/" + std::string(108, 'p');
  for (const char* value : {"unix:", "unix:relative", "embedded", "embedded:x", "tcp:host", long_path.c_str()}) {
    setenv("GSD_ENDPOINT", value, 1);
    EXPECT_EQ(setup().rc, WYX_BAD_PARAMETER) << value;
    int node = -1;
    EXPECT_EQ(wyx_get_node_number(&node), WYX_BAD_PARAMETER) << value;
    EXPECT_THAT(last_failure(), testing::StartsWith("endpoint-22-"));
  }
  setenv("GSD_ENDPOINT", "embedded:", 1);
  for (const char* value : {"0", "86401", "-1", "1s", " 1", "99999999999"}) {
    setenv("GSD_REQUEST_LIMIT", value, 1);
    EXPECT_EQ(setup().rc, WYX_BAD_PARAMETER) << value;
    EXPECT_THAT(last_failure(), testing::StartsWith("request-limit-22-"));
  }
  unsetenv("GSD_REQUEST_LIMIT");
}

TEST(ClientWithoutSession, NoDaemon_isSaidAtOnceAndCaptured_onStandardErrorWhenAsked) {
  const TempDir dir;
  const std::string path = dir / "none";
  setenv("GSD_ENDPOINT", ("unix:" + path).c_str(), 1);
  testing::internal::CaptureStderr();
  const SetupResult refused = setup();
  EXPECT_EQ(refused.rc, WYX_CONNECT_FAILED);
  EXPECT_EQ(refused.descriptor, -1);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
  EXPECT_THAT(last_failure(), testing::MatchesRegex("connect-absent-2-[0-9]+-[0-9]+-[0-9]{8}T[0-9]{6}Z"));

  setenv("GSD_DEBUG", "1", 1);
  testing::internal::CaptureStderr();
  int node = -7;
  EXPECT_EQ(wyx_get_node_number(&node), WYX_CONNECT_FAILED);
  EXPECT_EQ(testing::internal::GetCapturedStderr(),
            "wyx_r: cannot connect to " + path + ": No such file or directory (" + last_failure() + ")\n");
  unsetenv("GSD_DEBUG");
  EXPECT_EQ(wyx_get_domain_master_node_number(&node), WYX_CONNECT_FAILED);
  EXPECT_EQ(node, -7);
}

TEST(ClientWithoutSession, Queries_askTheDaemonForItsNode_limitsAndVersionsNobody) {
  const GsdProcess daemon({"--node-number", "17"});
  setenv("GSD_ENDPOINT", daemon.endpoint().c_str(), 1);
  int node = -1, master = -1;
  EXPECT_EQ(wyx_get_node_number(&node), WYX_OK);
  EXPECT_EQ(wyx_get_domain_master_node_number(&master), WYX_OK);
  wyx_adapter_info info = {};
  EXPECT_EQ(wyx_get_adapter_info(&info), WYX_OK);
  EXPECT_STRNE(info.interface_name, "");
  for (const int number : {node, master, int{info.node_number}}) EXPECT_EQ(number, 17);

  wyx_limits limits = {};
  ASSERT_EQ(wyx_get_limits(&limits), WYX_OK);
  EXPECT_EQ(
      std::tuple(limits.max_group_name_length, limits.max_state_value_length, limits.max_provider_message_length),
      std::tuple(32, 65536, 65536));
  setenv("ZN_CU_VERSION", "3.2.6.1", 1);
  for (const auto query : {wyx_get_zelt_active_version, wyx_get_zelt_installed_version}) {
    wyx_zelt_version_t version = {};
    ASSERT_EQ(query(&version), WYX_OK);
    EXPECT_EQ(version.quick_version, 0x03020601u);
  }
}

TEST(ClientWithoutSession, AdaptersByAddress_areTheHosts) {
  setenv("GSD_ENDPOINT", "embedded:", 1);
  const auto v4 = [](const char* text, unsigned prefix = 0) {
    wyx_ip_addr address = {};
    address.ipv4_in_6.ip4x.s_addr = inet_addr(text);
    address.ipv4_in_6.filler[2] = htonl(prefix);
    return address;
  };
  const std::pair<wyx_ip_addr, wyx_rc_t> cases[] = {{v4("127.0.0.1"), WYX_OK},
                                                    {v4("127.0.0.1", 0xffff), WYX_OK},               // IPv6-mapped
                                                    {v4("192.0.2.77"), WYX_ADAPTER_INFO_NOT_FOUND},  // nobody's
                                                    {v4("224.0.0.1"), WYX_BAD_INPUT_IP_FORMAT},
                                                    {v4("0.0.0.0"), WYX_BAD_INPUT_IP_FORMAT}};
  for (const auto& [address, rc] : cases) {
    wyx_adapter_info info = {};
    EXPECT_EQ(wyx_get_adapter_info_by_addr(&address, &info), rc);
    if (rc == WYX_OK) {
      EXPECT_STREQ(info.interface_name, "lo");
    }
    EXPECT_EQ(wyx_get_adapter_info_by_addr(&address, nullptr), WYX_NULL_ADAPTER_INFO);
    EXPECT_EQ(wyx_get_adapter_info_by_addr(nullptr, &info), WYX_BAD_INPUT_IP_FORMAT);
  }
}

}  // namespace
}  // namespace test_support
