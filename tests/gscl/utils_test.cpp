
#include <algorithm>
#include <climits>
#include <string>
#include <thread>
#include <vector>

#include "gscl/GSUtils.h"
#include "zn_cu.h"

namespace {

using namespace zelt_gscl;  // NOLINT: the functions under test

/// How many values have a name of their own, and what these ones print.
template <class Code>
std::string names(const char* (*name)(Code), std::vector<int> values) {
  int named = 0;
  for (int value = -1000; value <= 0x80000; value++) {
    const std::string text = name(static_cast<Code>(value));
    if (text.find('[') == text.npos && text != name(static_cast<Code>(INT_MAX))) named++;
  }
  std::string all = std::to_string(named);
  for (int value : values) all += std::string(" ") + name(static_cast<Code>(value));
  return all;
}

// From the far end of the values, where a slip would show, those with a text of their own, and unknown ones.
TEST(Names, wholeValuesAndNothingElse_areNamed) {
  EXPECT_EQ(names(gscl_rc_name, {22, 23, -7}), "23 WYX_INVALID_SOURCE_GROUP rc_code[23] rc_code[-7]");
  EXPECT_EQ(names(gscl_return_code_name, {22, 23, 37, 38}),
            "38 WYX_INVALID_SOURCE_GROUP WYX_UNKNOWN_PROVIDER WYX_UNEXPECTED_QUORUM_RESP rc_code[38]");
  EXPECT_EQ(names(gscl_notification_type_name, {WYX_MERGE_NOTIFICATION, INT_MIN}),
            "10 WYX_MERGE_NOTIFICATION notification-type[-2147483648]");
  EXPECT_EQ(names(gscl_request_type_name, {WYX_GROUP_ATTRIBUTE_CHANGE, -1}),
            "13 WYX_GROUP_ATTRIBUTE_CHANGE empty-request");
  for (auto function : {gscl_summary_a_code_name, gscl_summary_code_name, gscl_summary_code_names}) {
    EXPECT_EQ(names(function, {0, 0x200, 0x38, 0x104, 0x208, 0x8024, 0x1000}),
              "32  WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY WYX_DEFAULT_REJECT|WYX_TIME_LIMIT_EXCEEDED|"
              "WYX_PROVIDER_FAILED WYX_DEFAULT_APPROVE|WYX_DISSOLVED WYX_DEFAULT_REJECT|WYX_DIED_HORRIBLY "
              "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_LINK_DOWN summary-code[0x1000]");
  }
  for (auto function :
       {gscl_subscription_a_type_name, gscl_subscription_type_name, gscl_subscription_type_names}) {
    EXPECT_EQ(
        names(function, {0, 7, 0x49, 0x100, 0xf}),
        "22 0 WYX_SUBSCRIPTION_STATE|_DELTA_JOIN|_DELTA_LEAVE WYX_SUBSCRIPTION_MEMBERSHIP|_STATE|_SPECIAL_DATA "
        "WYX_SUBSCRIPTION_GS_HAS_DIED subscription_type[0xf]");
  }
  EXPECT_EQ(names(gscl_subscription_ctrl_name, {0, 7, 0xf, 0x1e, -1}),
            "14 0 WYX_SUBSCRIBE_STATE|_DELTAS_ONLY WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP "
            "WYX_SUBSCRIBE_ALL_MEMBERSHIP|_ADAPTER_INFO subscribe_ctrl[0xffffffff]");
  EXPECT_EQ(names(gscl_vote_value_name, {3, 4}), "4 WYX_VOTE_REJECT UNKNWON_VOTE");
  EXPECT_EQ(names(gscl_num_phase_name, {2, 3}), "2 WYX_N_PHASE UNKNOWN_PHASE");
  EXPECT_EQ(names(gscl_GSClientTypeName, {2, 3}), "2 GS_SUBSCRIBER GS_UNKNCLIENT");
  EXPECT_EQ(names(gscl_GSClientStateName, {4, 5}), "5 GS_IAM_SUBSCRIBED client-state[5]");
  EXPECT_EQ(names(gscl_GSWaitForRCName, {0, 1, 2, 99, 98}),
            "10 GS_PROTOCOL_NOT_REQUESTED GS_NOTIFICATION_PENDING GS_NOTIFICATION_RECEIVED "
            "GS_WAITFOR_NOT_SUPPORTED WaitForRC[98]");
}

TEST(Names, unknownValuesInTwoThreads_keepTheirOwnTexts) {
  const char* mine = gscl_rc_name(static_cast<wyx_rc_t>(1001));
  const char* other_function = gscl_request_type_name(static_cast<wyx_request_t>(1002));
  std::thread([&] { EXPECT_STREQ(gscl_rc_name(static_cast<wyx_rc_t>(1003)), "rc_code[1003]"); }).join();
  EXPECT_STREQ(mine, "rc_code[1001]");
  EXPECT_STREQ(other_function, "request-type[1002]");
}

TEST(Membership, searchedAndCloned) {
  wyx_provider_t ids[] = {{{7, 0}}, {{3, 5}}, {{3, 5}}}, wanted = {{3, 5}};
  wyx_membership_t record = {3, ids};
  EXPECT_EQ(gscl_find_membership(&record, wanted), 1);
  wyx_membership_t* clone = zelt_gscl_V1::gscl_clone_membership(&record);
  ids[1] = ids[2] = {};
  EXPECT_EQ(gscl_find_membership(&record, wanted), -1);
  EXPECT_EQ(gscl_find_membership(clone, wanted), 1);
  EXPECT_EQ(clone->gs_count, 3u);
  for (int twice = 0; twice < 2; ++twice) {
    gscl_delete_membership(clone);
    EXPECT_EQ(clone->gs_count, 0u);
    EXPECT_EQ(clone->gs_providers, nullptr);
    EXPECT_EQ(gscl_find_membership(clone, wanted), -1);
  }
  delete clone;
  clone = gscl_clone_membership(nullptr);
  EXPECT_EQ(clone->gs_count, 0u);
  delete clone;
  gscl_delete_membership(nullptr);
  EXPECT_EQ(gscl_find_membership(nullptr, wanted), -1);
}

TEST(ThreadBuffers, grown_keepContentsAndBelongToTheirThread) {
  EXPECT_EQ(gscl_thr_specific_init_buffer(-1), 0);
  ASSERT_EQ(gscl_thr_specific_init_buffer(3), 1);
  const auto use = [](char fill) {
    char* buffer = gscl_thr_specific_realloc_buffer(1, 10);
    std::fill_n(buffer, 10, fill);
    buffer = gscl_thr_specific_realloc_buffer(1, 20);
    EXPECT_EQ(std::string(buffer, 10), std::string(10, fill));
    buffer[19] = fill;
    EXPECT_EQ(gscl_thr_specific_realloc_buffer(1, 5), buffer);
    EXPECT_NE(gscl_thr_specific_realloc_buffer(2, 5), buffer);
    EXPECT_EQ(gscl_thr_specific_realloc_buffer(3, 5), nullptr);
    return buffer;
  };
  char* mine = use('m');
  std::thread([&] { EXPECT_NE(use('o'), mine); }).join();  // its buffers go with it: the leak checker sees to that
  EXPECT_EQ(mine[0], 'm');
  EXPECT_EQ(gscl_thr_specific_free_buffer(3), -1);
  for (int twice = 0; twice < 2; ++twice) EXPECT_EQ(gscl_thr_specific_free_buffer(1), 0);
  EXPECT_EQ(gscl_thr_specific_realloc_buffer(2, 0), nullptr);
}

TEST(AbsTime, relativeTime_isAddedAndNormalised) {
  timespec before, t, after;
  EXPECT_EQ(GSGetAbsTime(&t, -1, 5), nullptr) << "no limit";
  EXPECT_EQ(t.tv_sec, 4294967295);
  EXPECT_EQ(t.tv_nsec, 0);
  const auto nanoseconds = [](const timespec& time) { return time.tv_sec * 1000000000LL + time.tv_nsec; };
  for (const auto& [secs, usecs] : std::vector<std::pair<int, int>>{
           {0, 0}, {0, 999999}, {5, 500000}, {0, INT_MAX}, {3, -1}, {3, INT_MIN}, {100000, 1000000}}) {
    cu_get_current_time_1(&before);
    ASSERT_EQ(zelt_gscl_V1::GSGetAbsTime(&t, secs, usecs), &t);
    cu_get_current_time_1(&after);
    const long long added = secs * 1000000000LL + usecs * 1000LL;
    EXPECT_GE(nanoseconds(t), nanoseconds(before) + added) << secs << ' ' << usecs;
    EXPECT_LE(nanoseconds(t), nanoseconds(after) + added) << secs << ' ' << usecs;
    EXPECT_TRUE(t.tv_nsec >= 0 && t.tv_nsec < 1000000000) << t.tv_nsec;
  }
}

}  // namespace
