#include <gtest/gtest.h>
#include <pthread.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <climits>
#include <string>
#include <thread>

#include "gscl/GSUtils.h"
#include "zn_cu.h"

namespace {

using namespace zelt_gscl;  // NOLINT: the functions under test

#define EXPECT_OWN_NAME(function, code) EXPECT_STREQ(function(code), #code)

// One of each function, from the far end of its values where a slip would show, and those with a text of their
// own.
TEST(Names, knownValues_printTheirEnumerators) {
  EXPECT_OWN_NAME(gscl_rc_name, WYX_INVALID_SOURCE_GROUP);
  EXPECT_OWN_NAME(gscl_notification_type_name, WYX_MERGE_NOTIFICATION);
  EXPECT_OWN_NAME(gscl_request_type_name, WYX_GROUP_ATTRIBUTE_CHANGE);
  EXPECT_OWN_NAME(gscl_summary_code_name, WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY);
  EXPECT_OWN_NAME(gscl_subscription_type_name, WYX_SUBSCRIPTION_SPECIAL_DATA);
  EXPECT_OWN_NAME(gscl_subscription_ctrl_name, WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP);
  EXPECT_OWN_NAME(gscl_vote_value_name, WYX_VOTE_REJECT);
  EXPECT_OWN_NAME(gscl_num_phase_name, WYX_N_PHASE);
  EXPECT_OWN_NAME(gscl_GSClientTypeName, GS_SUBSCRIBER);
  EXPECT_OWN_NAME(gscl_GSClientStateName, GS_IAM_SUBSCRIBED);
  EXPECT_OWN_NAME(gscl_GSWaitForRCName, GS_WAITFOR_NOT_SUPPORTED);
  EXPECT_STREQ(gscl_GSWaitForRCName(GS_WAITFOR_NOT_REQUESTED), "GS_PROTOCOL_NOT_REQUESTED");
  EXPECT_STREQ(gscl_GSWaitForRCName(GS_WAITFOR_PENDING), "GS_NOTIFICATION_PENDING");
  EXPECT_STREQ(gscl_GSWaitForRCName(GS_WAITFOR_RECEIVED), "GS_NOTIFICATION_RECEIVED");
}

/// How many values from -1000 up to `last` have a name of their own.
template <class Code>
int named(const char* (*name)(Code), int last, const std::string& fallback) {
  int found = 0;
  for (int value = -1000; value <= last; value++) {
    const std::string text = name(static_cast<Code>(value));
    if (text.compare(0, fallback.size(), fallback) != 0) found++;
  }
  return found;
}

TEST(Names, wholeValuesOnly_nothingElseIsNamed) {
  EXPECT_EQ(named(gscl_rc_name, 1000, "rc_code["), 23);
  EXPECT_EQ(named(gscl_notification_type_name, 1000, "notification-type["), 10);
  EXPECT_EQ(named(gscl_request_type_name, 1000, "request-type["), 13);
  EXPECT_EQ(named(gscl_summary_a_code_name, 0x80000, "summary-code["), 32);
  EXPECT_EQ(named(gscl_subscription_a_type_name, 0x1000, "subscription_type["), 22);
  EXPECT_EQ(named(gscl_subscription_ctrl_name, 0x1000, "subscribe_ctrl["), 14);
  EXPECT_EQ(named(gscl_vote_value_name, 1000, "UNKNWON_VOTE"), 4);
  EXPECT_EQ(named(gscl_num_phase_name, 1000, "UNKNOWN_PHASE"), 2);
  EXPECT_EQ(named(gscl_GSClientTypeName, 1000, "GS_UNKNCLIENT"), 2);
  EXPECT_EQ(named(gscl_GSClientStateName, 1000, "client-state["), 5);
  EXPECT_EQ(named(gscl_GSWaitForRCName, 1000, "WaitForRC["), 10);
}

TEST(Names, combinations_useTheirShortTexts) {
  const auto summary = [](int code) { return gscl_summary_code_names(static_cast<wyx_summary_code_t>(code)); };
  EXPECT_STREQ(summary(0), "");
  EXPECT_STREQ(summary(0x24), "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED");
  EXPECT_STREQ(summary(0x38), "WYX_DEFAULT_REJECT|WYX_TIME_LIMIT_EXCEEDED|WYX_PROVIDER_FAILED");
  EXPECT_STREQ(summary(0x104), "WYX_DEFAULT_APPROVE|WYX_DISSOLVED");
  EXPECT_STREQ(summary(0x208), "WYX_DEFAULT_REJECT|WYX_DIED_HORRIBLY");
  EXPECT_STREQ(summary(0x8024), "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_LINK_DOWN");
  const auto type = [](int code) {
    return gscl_subscription_type_names(static_cast<wyx_subscription_type_t>(code));
  };
  EXPECT_STREQ(type(0), "0");
  EXPECT_STREQ(type(7), "WYX_SUBSCRIPTION_STATE|_DELTA_JOIN|_DELTA_LEAVE");
  EXPECT_STREQ(type(0x49), "WYX_SUBSCRIPTION_MEMBERSHIP|_STATE|_SPECIAL_DATA");
  const auto control = [](int code) {
    return gscl_subscription_ctrl_name(static_cast<wyx_subscription_ctrl_t>(code));
  };
  EXPECT_STREQ(control(0), "0");
  EXPECT_STREQ(control(7), "WYX_SUBSCRIBE_STATE|_DELTAS_ONLY");
  EXPECT_STREQ(control(0x1e), "WYX_SUBSCRIBE_ALL_MEMBERSHIP|_ADAPTER_INFO");
}

TEST(Names, unknownValues_printTheirNumberWhole) {
  EXPECT_STREQ(gscl_rc_name(WYX_UNKNOWN_PROVIDER), "rc_code[23]");
  EXPECT_STREQ(gscl_rc_name(static_cast<wyx_rc_t>(-7)), "rc_code[-7]");
  EXPECT_STREQ(gscl_notification_type_name(static_cast<wyx_notification_type_t>(INT_MIN)),
               "notification-type[-2147483648]");
  EXPECT_STREQ(gscl_request_type_name(static_cast<wyx_request_t>(-1)), "empty-request");
  EXPECT_STREQ(gscl_summary_code_name(WYX_GROUP_ATTRIBUTES_CHANGED), "summary-code[0x1000]");
  EXPECT_STREQ(gscl_subscription_type_name(static_cast<wyx_subscription_type_t>(0xf)), "subscription_type[0xf]");
  EXPECT_STREQ(gscl_subscription_ctrl_name(static_cast<wyx_subscription_ctrl_t>(-1)),
               "subscribe_ctrl[0xffffffff]");
  EXPECT_STREQ(gscl_vote_value_name(WYX_VOTE_APPROVE_AND_SWITCH_ALPHA_OMEGA), "UNKNWON_VOTE");
  EXPECT_STREQ(zelt_gscl_V1::gscl_rc_name(static_cast<wyx_rc_t>(99)), "rc_code[99]");
}

TEST(Names, unknownValuesInTwoThreads_keepTheirOwnTexts) {
  const char* mine = gscl_rc_name(static_cast<wyx_rc_t>(1001));
  const char* other_function = gscl_request_type_name(static_cast<wyx_request_t>(1002));
  std::thread([&] { EXPECT_STREQ(gscl_rc_name(static_cast<wyx_rc_t>(1003)), "rc_code[1003]"); }).join();
  EXPECT_STREQ(mine, "rc_code[1001]");
  EXPECT_STREQ(other_function, "request-type[1002]");
}

TEST(Membership, searched_givesTheFirstIndex) {
  std::array<wyx_provider_t, 3> ids = {};
  ids[0].gs_provider_id = 7;
  ids[1].gs_provider_id = 0x50003;
  ids[2].gs_provider_id = 0x50003;
  wyx_membership_t record = {3, ids.data()};
  wyx_provider_t wanted;
  wanted._gs_provider_info._gs_instance_number = 3;
  wanted._gs_provider_info._gs_node_number = 5;
  EXPECT_EQ(gscl_find_membership(&record, wanted), 1);
  record.gs_count = 1;
  EXPECT_EQ(gscl_find_membership(&record, wanted), -1);
  record = {0, nullptr};
  EXPECT_EQ(gscl_find_membership(&record, wanted), -1);
  EXPECT_EQ(gscl_find_membership(nullptr, wanted), -1);
}

TEST(Membership, cloned_isTheCallersAlone) {
  std::array<wyx_provider_t, 2> ids = {};
  ids[1].gs_provider_id = 9;
  const wyx_membership_t record = {2, ids.data()};
  wyx_membership_t* clone = zelt_gscl_V1::gscl_clone_membership(&record);
  ASSERT_EQ(clone->gs_count, 2u);
  EXPECT_NE(clone->gs_providers, ids.data());
  EXPECT_EQ(clone->gs_providers[1].gs_provider_id, 9);
  gscl_delete_membership(clone);
  EXPECT_EQ(clone->gs_count, 0u);
  EXPECT_EQ(clone->gs_providers, nullptr);
  gscl_delete_membership(clone);
  delete clone;

  wyx_membership_t* empty = gscl_clone_membership(nullptr);
  ASSERT_NE(empty, nullptr);
  EXPECT_EQ(empty->gs_count, 0u);
  EXPECT_EQ(empty->gs_providers, nullptr);
  delete empty;
  gscl_delete_membership(nullptr);
}

TEST(ThreadBuffers, beforeInitialisation_areRefused) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");  // a new process: initialisation is once
  EXPECT_EXIT(
      {
        const bool refused = gscl_thr_specific_realloc_buffer(0, 10) == nullptr &&
                             gscl_thr_specific_free_buffer(0) == -1 && gscl_thr_specific_init_buffer(-1) == 0;
        _exit(refused ? 0 : 1);
      },
      testing::ExitedWithCode(0), "");
}

TEST(ThreadBuffers, grown_keepContentsAndBelongToTheirThread) {
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
  std::thread other([&] { EXPECT_NE(use('o'), mine); });  // its buffers go with it: the leak checker sees to that
  other.join();
  EXPECT_EQ(mine[0], 'm');
  EXPECT_EQ(gscl_thr_specific_free_buffer(3), -1);
  EXPECT_EQ(gscl_thr_specific_free_buffer(1), 0);
  EXPECT_EQ(gscl_thr_specific_free_buffer(1), 0);
  EXPECT_EQ(gscl_thr_specific_realloc_buffer(2, 0), nullptr);
  EXPECT_TRUE(pthread_equal(gscl_thread_self(), pthread_self()));
}

TEST(AbsTime, withoutLimit_isNull) {
  timespec t = {1, 1};
  EXPECT_EQ(GSGetAbsTime(&t, -1, 5), nullptr);
  EXPECT_EQ(t.tv_sec, 4294967295);
  EXPECT_EQ(t.tv_nsec, 0);
}

long long nanoseconds(const timespec& t) { return t.tv_sec * 1000000000LL + t.tv_nsec; }

TEST(AbsTime, relativeTime_isAddedAndNormalised) {
  constexpr std::array<std::array<int, 2>, 7> times = {
      {{0, 0}, {0, 999999}, {5, 500000}, {0, INT_MAX}, {3, -1}, {3, INT_MIN}, {100000, 1000000}}};
  for (const auto& [secs, usecs] : times) {
    timespec before;
    timespec t;
    timespec after;
    cu_get_current_time_1(&before);
    ASSERT_EQ(zelt_gscl_V1::GSGetAbsTime(&t, secs, usecs), &t);
    cu_get_current_time_1(&after);
    const long long added = secs * 1000000000LL + usecs * 1000LL;
    EXPECT_GE(nanoseconds(t), nanoseconds(before) + added) << secs << ' ' << usecs;
    EXPECT_LE(nanoseconds(t), nanoseconds(after) + added) << secs << ' ' << usecs;
    EXPECT_GE(t.tv_nsec, 0);
    EXPECT_LT(t.tv_nsec, 1000000000);
  }
}

}  // namespace
