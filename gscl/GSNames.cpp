// Printable names of codes and of the client enumerations.
#include <cstdio>

#include "gscl/GSUtils.h"

namespace {

struct Name {
  int value;
  const char* text;
};

// Whole values and their texts, as they appear in trace lines; never composed from bits. Some texts shorten the
// names of the flags, and some combinations have no name.

constexpr Name kRcNames[] = {
    {0, "WYX_OK"},
    {1, "WYX_NOT_OK"},
    {2, "WYX_EXISTS"},
    {3, "WYX_NO_INIT"},
    {4, "WYX_NAME_TOO_LONG"},
    {5, "WYX_NO_MEMORY"},
    {6, "WYX_NOT_A_MEMBER"},
    {7, "WYX_BAD_CLIENT_TOKEN"},
    {8, "WYX_BAD_MEMBER_TOKEN"},
    {9, "WYX_BAD_PARAMETER"},
    {10, "WYX_UNKNOWN_GROUP"},
    {11, "WYX_INVALID_GROUP"},
    {12, "WYX_NO_SOURCE_GROUP_PROVIDER"},
    {13, "WYX_BAD_GROUP_ATTRIBUTES"},
    {14, "WYX_WRONG_OLD_STATE"},
    {15, "WYX_DUPLICATE_INSTANCE_NUMBER"},
    {16, "WYX_COLLIDE"},
    {17, "WYX_SOCK_CREATE_FAILED"},
    {18, "WYX_SOCK_INIT_FAILED"},
    {19, "WYX_CONNECT_FAILED"},
    {20, "WYX_VOTE_NOT_EXPECTED"},
    {21, "WYX_NOT_SUPPORTED"},
    {22, "WYX_INVALID_SOURCE_GROUP"},
};

// Those that no trace line names.
constexpr Name kFurtherRcNames[] = {
    {23, "WYX_UNKNOWN_PROVIDER"},           {24, "WYX_INVALID_DEACTIVATE_PHASE"},
    {25, "WYX_PROVIDER_APPEARS_TWICE"},     {26, "WYX_BACKLEVEL_PROVIDERS"},
    {27, "WYX_NULL_ADAPTER_INFO"},          {28, "WYX_ADAPTER_INFO_NOT_FOUND"},
    {29, "WYX_ADAPTER_INFO_NOT_SENT"},      {30, "WYX_NOT_ADAPTER_GROUP"},
    {31, "WYX_VOTE_VALUE_NOT_ALLOWED"},     {32, "WYX_BAD_INPUT_IP_FORMAT"},
    {33, "WYX_NO_IPV4_ADDRESS_FOR_THE_ID"}, {34, "WYX_WRITE_SOCK_ERROR"},
    {35, "WYX_BAD_QUORUM_MSG_SEQNUM"},      {36, "WYX_NOT_REGISTERED_FOR_SYNC_QUORUM"},
    {37, "WYX_UNEXPECTED_QUORUM_RESP"},
};

constexpr Name kNotificationTypeNames[] = {
    {-1, "empty-notification"},           {0, "WYX_RESPONSIVENESS_NOTIFICATION"},
    {1, "WYX_QUERY_NOTIFICATION"},        {2, "WYX_DELAYED_ERROR_NOTIFICATION"},
    {3, "WYX_N_PHASE_NOTIFICATION"},      {4, "WYX_APPROVED_NOTIFICATION"},
    {5, "WYX_REJECTED_NOTIFICATION"},     {6, "WYX_ANNOUNCEMENT_NOTIFICATION"},
    {7, "WYX_SUBSCRIPTION_NOTIFICATION"}, {8, "WYX_MERGE_NOTIFICATION"},
};

constexpr Name kRequestTypeNames[] = {
    {-1, "empty-request"},
    {0, "WYX_RESPONSIVENESS"},
    {1, "WYX_JOIN"},
    {2, "WYX_FAILURE_LEAVE"},
    {3, "WYX_LEAVE"},
    {4, "WYX_EXPEL"},
    {5, "WYX_STATE_VALUE_CHANGE"},
    {6, "WYX_PROVIDER_MESSAGE"},
    {7, "WYX_CAST_OUT"},
    {8, "WYX_SOURCE_STATE_REFLECTION"},
    {9, "WYX_MERGE"},
    {10, "WYX_SUBSCRIPTION"},
    {11, "WYX_GROUP_ATTRIBUTE_CHANGE"},
};

constexpr Name kSummaryNames[] = {
    {0x0, ""},
    {0x1, "WYX_EXPLICIT_APPROVE"},
    {0x2, "WYX_EXPLICIT_REJECT"},
    {0x4, "WYX_DEFAULT_APPROVE"},
    {0x8, "WYX_DEFAULT_REJECT"},
    {0x10, "WYX_TIME_LIMIT_EXCEEDED"},
    {0x14, "WYX_DEFAULT_APPROVE|WYX_TIME_LIMIT_EXCEEDED"},
    {0x18, "WYX_DEFAULT_REJECT|WYX_TIME_LIMIT_EXCEEDED"},
    {0x20, "WYX_PROVIDER_FAILED"},
    {0x24, "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED"},
    {0x28, "WYX_DEFAULT_REJECT|WYX_PROVIDER_FAILED"},
    {0x38, "WYX_DEFAULT_REJECT|WYX_TIME_LIMIT_EXCEEDED|WYX_PROVIDER_FAILED"},
    {0x40, "WYX_RESPONSIVENESS_NO_RESPONSE"},
    {0x80, "WYX_RESPONSIVENESS_RESPONSE"},
    {0x100, "WYX_GROUP_DISSOLVED"},
    {0x104, "WYX_DEFAULT_APPROVE|WYX_DISSOLVED"},
    {0x108, "WYX_DEFAULT_REJECT|WYX_DISSOLVED"},
    {0x200, "WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY"},
    {0x204, "WYX_DEFAULT_APPROVE|WYX_DIED_HORRIBLY"},
    {0x208, "WYX_DEFAULT_REJECT|WYX_DIED_HORRIBLY"},
    {0x2024, "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_LOCAL_SPLIT"},
    {0x2028, "WYX_DEFAULT_REJECT|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_LOCAL_SPLIT"},
    {0x4024, "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_REMOTE_SPLIT"},
    {0x4028, "WYX_DEFAULT_REJECT|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_REMOTE_SPLIT"},
    {0x8024, "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_LINK_DOWN"},
    {0x8028, "WYX_DEFAULT_REJECT|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_LINK_DOWN"},
    {0x10024, "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_SHUTDOWN"},
    {0x10028, "WYX_DEFAULT_REJECT|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_SHUTDOWN"},
    {0x20024, "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_STOP"},
    {0x20028, "WYX_DEFAULT_REJECT|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_STOP"},
    {0x40024, "WYX_DEFAULT_APPROVE|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_FORCE_DOWN"},
    {0x40028, "WYX_DEFAULT_REJECT|WYX_PROVIDER_FAILED|WYX_MEMBER_LEAVE_DUE_TO_FORCE_DOWN"},
};

constexpr Name kSubscriptionTypeNames[] = {
    {0x0, "0"},
    {0x1, "WYX_SUBSCRIPTION_STATE"},
    {0x2, "WYX_SUBSCRIPTION_DELTA_JOIN"},
    {0x3, "WYX_SUBSCRIPTION_STATE|_DELTA_JOIN"},
    {0x4, "WYX_SUBSCRIPTION_DELTA_LEAVE"},
    {0x5, "WYX_SUBSCRIPTION_STATE|_DELTA_LEAVE"},
    {0x6, "WYX_SUBSCRIPTION_DELTA_JOIN|_DELTA_LEAVE"},
    {0x7, "WYX_SUBSCRIPTION_STATE|_DELTA_JOIN|_DELTA_LEAVE"},
    {0x8, "WYX_SUBSCRIPTION_MEMBERSHIP"},
    {0x9, "WYX_SUBSCRIPTION_STATE|_MEMBERSHIP"},
    {0xa, "WYX_SUBSCRIPTION_DELTA_JOIN|_MEMBERSHIP"},
    {0xb, "WYX_SUBSCRIPTION_STATE|_DELTA_JOIN|_MEMBERSHIP"},
    {0xe, "WYX_SUBSCRIPTION_DELTA_JOIN|_DELTA_LEAVE|_MEMBERSHIP"},
    {0x40, "WYX_SUBSCRIPTION_SPECIAL_DATA"},
    {0x41, "WYX_SUBSCRIPTION_STATE|_SPECIAL_DATA"},
    {0x42, "WYX_SUBSCRIPTION_DELTA_JOIN|_SPECIAL_DATA"},
    {0x43, "WYX_SUBSCRIPTION_STATE|_DELTA_JOIN|_SPECIAL_DATA"},
    {0x44, "WYX_SUBSCRIPTION_DELTA_LEAVE|_SPECIAL_DATA"},
    {0x48, "WYX_SUBSCRIPTION_MEMBERSHIP|_SPECIAL_DATA"},
    {0x49, "WYX_SUBSCRIPTION_MEMBERSHIP|_STATE|_SPECIAL_DATA"},
    {0x80, "WYX_SUBSCRIPTION_DISSOLVED"},
    {0x100, "WYX_SUBSCRIPTION_GS_HAS_DIED"},
};

constexpr Name kSubscriptionCtrlNames[] = {
    {0x0, "0"},
    {0x1, "WYX_SUBSCRIBE_STATE"},
    {0x2, "WYX_SUBSCRIBE_DELTA_JOINS"},
    {0x3, "WYX_SUBSCRIBE_STATE|_DELTA_JOINS"},
    {0x4, "WYX_SUBSCRIBE_DELTA_LEAVES"},
    {0x5, "WYX_SUBSCRIBE_STATE|_DELTA_LEAVES"},
    {0x6, "WYX_SUBSCRIBE_DELTAS_ONLY"},
    {0x7, "WYX_SUBSCRIBE_STATE|_DELTAS_ONLY"},
    {0xe, "WYX_SUBSCRIBE_ALL_MEMBERSHIP"},
    {0xf, "WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP"},
    {0x10, "WYX_SUBSCRIBE_ADAPTER_INFO"},
    {0x16, "WYX_SUBSCRIBE_DELTAS_ONLY|_ADAPTER_INFO"},
    {0x1e, "WYX_SUBSCRIBE_ALL_MEMBERSHIP|_ADAPTER_INFO"},
    {0x40, "WYX_SUBSCRIBE_SPECIAL_DATA"},
};

constexpr Name kWaitForRCNames[] = {
    {-5, "GS_WAITFOR_EFAULT"},        {-4, "GS_WAITFOR_EDEADLK"},      {-3, "GS_WAITFOR_EINVAL"},
    {-2, "GS_WAITFOR_EPERM"},         {-1, "GS_WAITFOR_ERROR"},        {0, "GS_PROTOCOL_NOT_REQUESTED"},
    {1, "GS_NOTIFICATION_PENDING"},   {2, "GS_NOTIFICATION_RECEIVED"}, {3, "GS_WAITFOR_NOT_A_MEMBER"},
    {99, "GS_WAITFOR_NOT_SUPPORTED"},
};

constexpr Name kVoteNames[] = {
    {0, "WYX_NULL_VOTE"},
    {1, "WYX_VOTE_APPROVE"},
    {2, "WYX_VOTE_CONTINUE"},
    {3, "WYX_VOTE_REJECT"},
};

constexpr Name kPhaseNames[] = {
    {1, "WYX_1_PHASE"},
    {2, "WYX_N_PHASE"},
};

constexpr Name kClientTypeNames[] = {
    {1, "GS_PROVIDER"},
    {2, "GS_SUBSCRIBER"},
};

constexpr Name kClientStateNames[] = {
    {0, "GS_IAM_IDLE"},        {1, "GS_IAM_JOINING"},    {2, "GS_IAM_JOINED"},
    {3, "GS_IAM_SUBSCRIBING"}, {4, "GS_IAM_SUBSCRIBED"},
};

template <size_t N>
const char* find_name(const Name (&names)[N], int value) {
  for (const Name& name : names) {
    if (name.value == value) return name.text;
  }
  return nullptr;
}

template <size_t N>
const char* name_or(const Name (&names)[N], int value, const char* unknown) {
  const char* known = find_name(names, value);
  return known != nullptr ? known : unknown;
}

/// Room for the longest fallback text of any function, with any number.
typedef char FallbackText[48];

template <size_t N>
const char* name_or_number(const Name (&names)[N], int value, FallbackText& text, const char* format) {
  const char* known = find_name(names, value);
  if (known != nullptr) return known;
  snprintf(text, sizeof(text), format, value);
  return text;
}

}  // namespace

namespace zelt_gscl {

const char* gscl_rc_name(wyx_rc_t rc) {
  static thread_local FallbackText text;
  return name_or_number(kRcNames, rc, text, "rc_code[%d]");
}

const char* gscl_return_code_name(wyx_rc_t rc) {
  const char* further = find_name(kFurtherRcNames, rc);
  return further != nullptr ? further : gscl_rc_name(rc);
}

const char* gscl_notification_type_name(wyx_notification_type_t type) {
  static thread_local FallbackText text;
  return name_or_number(kNotificationTypeNames, type, text, "notification-type[%d]");
}

const char* gscl_request_type_name(wyx_request_t type) {
  static thread_local FallbackText text;
  return name_or_number(kRequestTypeNames, type, text, "request-type[%d]");
}

const char* gscl_summary_a_code_name(wyx_summary_code_t code) {
  static thread_local FallbackText text;
  return name_or_number(kSummaryNames, code, text, "summary-code[0x%x]");
}

const char* gscl_summary_code_name(wyx_summary_code_t code) {
  static thread_local FallbackText text;
  return name_or_number(kSummaryNames, code, text, "summary-code[0x%x]");
}

const char* gscl_summary_code_names(wyx_summary_code_t code) {
  static thread_local FallbackText text;
  return name_or_number(kSummaryNames, code, text, "summary-code[0x%x]");
}

const char* gscl_subscription_a_type_name(wyx_subscription_type_t type) {
  static thread_local FallbackText text;
  return name_or_number(kSubscriptionTypeNames, type, text, "subscription_type[0x%x]");
}

const char* gscl_subscription_type_name(wyx_subscription_type_t type) {
  static thread_local FallbackText text;
  return name_or_number(kSubscriptionTypeNames, type, text, "subscription_type[0x%x]");
}

const char* gscl_subscription_type_names(wyx_subscription_type_t type) {
  static thread_local FallbackText text;
  return name_or_number(kSubscriptionTypeNames, type, text, "subscription_type[0x%x]");
}

const char* gscl_subscription_ctrl_name(wyx_subscription_ctrl_t control) {
  static thread_local FallbackText text;
  return name_or_number(kSubscriptionCtrlNames, control, text, "subscribe_ctrl[0x%x]");
}

const char* gscl_vote_value_name(wyx_vote_value_t vote) { return name_or(kVoteNames, vote, "UNKNWON_VOTE"); }

const char* gscl_num_phase_name(wyx_num_phases_t phases) { return name_or(kPhaseNames, phases, "UNKNOWN_PHASE"); }

const char* gscl_GSClientTypeName(GSClientType type) { return name_or(kClientTypeNames, type, "GS_UNKNCLIENT"); }

const char* gscl_GSClientStateName(GSClientState state) {
  static thread_local FallbackText text;
  return name_or_number(kClientStateNames, state, text, "client-state[%d]");
}

const char* gscl_GSWaitForRCName(GSWaitForRC rc) {
  static thread_local FallbackText text;
  return name_or_number(kWaitForRCNames, rc, text, "WaitForRC[%d]");
}

}  // namespace zelt_gscl

namespace zelt_gscl_V1 {

const char* gscl_rc_name(wyx_rc_t rc) { return zelt_gscl::gscl_rc_name(rc); }

const char* gscl_notification_type_name(wyx_notification_type_t type) {
  return zelt_gscl::gscl_notification_type_name(type);
}

const char* gscl_request_type_name(wyx_request_t type) { return zelt_gscl::gscl_request_type_name(type); }

const char* gscl_summary_a_code_name(wyx_summary_code_t code) { return zelt_gscl::gscl_summary_a_code_name(code); }

const char* gscl_summary_code_name(wyx_summary_code_t code) { return zelt_gscl::gscl_summary_code_name(code); }

const char* gscl_summary_code_names(wyx_summary_code_t code) { return zelt_gscl::gscl_summary_code_names(code); }

const char* gscl_subscription_a_type_name(wyx_subscription_type_t type) {
  return zelt_gscl::gscl_subscription_a_type_name(type);
}

const char* gscl_subscription_type_name(wyx_subscription_type_t type) {
  return zelt_gscl::gscl_subscription_type_name(type);
}

const char* gscl_subscription_type_names(wyx_subscription_type_t type) {
  return zelt_gscl::gscl_subscription_type_names(type);
}

const char* gscl_subscription_ctrl_name(wyx_subscription_ctrl_t control) {
  return zelt_gscl::gscl_subscription_ctrl_name(control);
}

const char* gscl_vote_value_name(wyx_vote_value_t vote) { return zelt_gscl::gscl_vote_value_name(vote); }

const char* gscl_num_phase_name(wyx_num_phases_t phases) { return zelt_gscl::gscl_num_phase_name(phases); }

const char* gscl_GSClientTypeName(GSClientType type) { return zelt_gscl::gscl_GSClientTypeName(type); }

const char* gscl_GSClientStateName(GSClientState state) { return zelt_gscl::gscl_GSClientStateName(state); }

const char* gscl_GSWaitForRCName(GSWaitForRC rc) { return zelt_gscl::gscl_GSWaitForRCName(rc); }

}  // namespace zelt_gscl_V1
