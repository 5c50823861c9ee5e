// Records, codes and callback signatures of the group-services base API.
//
// These types cross the boundary to the base API library libwyx_r.so bit for bit (LP64); their sizes and
// offsets are asserted in wyx_api_layout.cpp. Records handed to a callback belong to the base API and live only
// until the callback returns. Records given to a request stay the caller's and are not read after it returns.
//
// The entry points themselves are reached through the table in gslib_dli.h.
//
// Forks: a session, opened by wyx_setup, belongs to the process that opened it. In the child of a fork every entry
// point behaves as without a session, the parent's tokens are nobody's, and the child may open a session of its
// own. Nothing that the child does, its end included, reaches the parent's session. The parent's descriptor stays
// valid in the child and is never readable. A dispatch that forks inside a callback answers WYX_NO_INIT in the
// child.
//
// Environment, read by wyx_setup (and by queries without a session): GSD_ENDPOINT, where the daemon is.
// GSD_REQUEST_LIMIT, the seconds that an answer may take, 1 to 86400, 30 without it: a daemon that takes longer
// counts as dead. Read at each failure: GSD_DEBUG, when it is neither empty nor "0": each is also a line on
// standard error,
//   wyx_r: cannot connect to /run/gsd/gsd.sock: Permission denied (connect-denied-13-4711-1-20260131T235959Z)
//
// Failures: wyx_get_ffdc_id reads what-code-pid-count-time, the count of this process's failures, the time in UTC.
//   what                                            | code
//   ------------------------------------------------|------------------------------------------------------------
//   connect-absent, -denied, -refused, -timeout     | errno: no socket there, not permitted, nobody listens on it,
//                                                   | the daemon takes no connection
//   connect, socket, embedded                       | errno: another failure of that step
//   hello-, attach-, query- with one of:            | a step of opening a session, or of a query without one
//     timeout, closed, malformed                    | ETIMEDOUT, ECONNRESET, EPROTO: no answer, the end, nonsense
//     refused                                       | wyx_rc_t: the daemon's answer
//   request-, ping- with timeout, closed, malformed | the same, of an open session: it has ended
//   event-malformed, hang-up, farewell              | the event channel: nonsense, the daemon's end, its goodbye
//   endpoint, request-limit                         | EINVAL: the variable has no usable value
#ifndef GSCL_WYX_API_H
#define GSCL_WYX_API_H

#include <netinet/in.h>
#include <stdint.h>

// ---------------------------------------------------------------------------------------------------------
// Codes. Every enumeration has int as its underlying type, because codes that are not named here are passed
// through, -1 for none among them.

/// Synchronous result of every entry point.
enum wyx_rc_t : int {
  WYX_OK = 0,
  WYX_OK_SO_FAR = 0,
  WYX_NOT_OK = 1,
  WYX_EXISTS = 2,
  WYX_NO_INIT = 3,
  WYX_NAME_TOO_LONG = 4,
  WYX_NO_MEMORY = 5,
  WYX_NOT_A_MEMBER = 6,
  WYX_BAD_CLIENT_TOKEN = 7,
  WYX_BAD_MEMBER_TOKEN = 8,
  WYX_BAD_PARAMETER = 9,
  WYX_UNKNOWN_GROUP = 10,
  WYX_INVALID_GROUP = 11,
  WYX_NO_SOURCE_GROUP_PROVIDER = 12,
  WYX_BAD_GROUP_ATTRIBUTES = 13,
  WYX_WRONG_OLD_STATE = 14,
  WYX_DUPLICATE_INSTANCE_NUMBER = 15,
  WYX_COLLIDE = 16,
  WYX_SOCK_CREATE_FAILED = 17,
  WYX_SOCK_INIT_FAILED = 18,
  WYX_CONNECT_FAILED = 19,
  WYX_VOTE_NOT_EXPECTED = 20,
  WYX_NOT_SUPPORTED = 21,
  WYX_INVALID_SOURCE_GROUP = 22,
  WYX_UNKNOWN_PROVIDER = 23,
  WYX_INVALID_DEACTIVATE_PHASE = 24,
  WYX_PROVIDER_APPEARS_TWICE = 25,
  WYX_BACKLEVEL_PROVIDERS = 26,
  WYX_NULL_ADAPTER_INFO = 27,
  WYX_ADAPTER_INFO_NOT_FOUND = 28,
  WYX_ADAPTER_INFO_NOT_SENT = 29,
  WYX_NOT_ADAPTER_GROUP = 30,
  WYX_VOTE_VALUE_NOT_ALLOWED = 31,
  WYX_BAD_INPUT_IP_FORMAT = 32,
  WYX_NO_IPV4_ADDRESS_FOR_THE_ID = 33,
  WYX_WRITE_SOCK_ERROR = 34,
  WYX_BAD_QUORUM_MSG_SEQNUM = 35,
  WYX_NOT_REGISTERED_FOR_SYNC_QUORUM = 36,
  WYX_UNEXPECTED_QUORUM_RESP = 37
};

enum wyx_notification_type_t : int {
  WYX_RESPONSIVENESS_NOTIFICATION = 0,
  WYX_QUERY_NOTIFICATION = 1,
  WYX_DELAYED_ERROR_NOTIFICATION = 2,
  WYX_N_PHASE_NOTIFICATION = 3,
  WYX_APPROVED_NOTIFICATION = 4,
  WYX_REJECTED_NOTIFICATION = 5,
  WYX_ANNOUNCEMENT_NOTIFICATION = 6,
  WYX_SUBSCRIPTION_NOTIFICATION = 7,
  WYX_MERGE_NOTIFICATION = 8,
  WYX_DOMAIN_NOTIFICATION = 9,
  WYX_NOTIFICATION_RESERVED_1 = 99,
  WYX_NOTIFICATION_RESERVED_2 = 100,
  WYX_NOTIFICATION_RESERVED_3 = 101,
  WYX_NOTIFICATION_RESERVED_4 = 102,
  WYX_NOTIFICATION_RESERVED_5 = 103
};

/// Protocol types.
enum wyx_request_t : int {
  WYX_RESPONSIVENESS = 0,
  WYX_JOIN = 1,
  WYX_FAILURE_LEAVE = 2,
  WYX_LEAVE = 3,
  WYX_EXPEL = 4,
  WYX_STATE_VALUE_CHANGE = 5,
  WYX_PROVIDER_MESSAGE = 6,
  WYX_CAST_OUT = 7,
  WYX_SOURCE_STATE_REFLECTION = 8,
  WYX_MERGE = 9,
  WYX_SUBSCRIPTION = 10,
  WYX_GROUP_ATTRIBUTE_CHANGE = 11,
  MAX_REQUEST = 11,
  WYX_INTERNAL_REQUEST = 99
};

/// Flags: what a protocol notification carries.
enum wyx_whats_changed_t : int {
  WYX_NO_CHANGE = 0,
  WYX_PROPOSED_MEMBERSHIP = 0x1,
  WYX_ONGOING_MEMBERSHIP = 0x2,
  WYX_PROPOSED_STATE_VALUE = 0x4,
  WYX_ONGOING_STATE_VALUE = 0x8,
  WYX_UPDATED_PROVIDER_MESSAGE = 0x10,
  WYX_UPDATED_MEMBERSHIP = 0x20,
  WYX_REJECTED_MEMBERSHIP = 0x40,
  WYX_UPDATED_STATE_VALUE = 0x80,
  WYX_REFLECTED_SOURCE_STATE_VALUE = 0x100,
  WYX_EXPEL_INFORMATION = 0x200,
  WYX_PROPOSED_GROUP_ATTRIBUTES = 0x400,
  WYX_ONGOING_GROUP_ATTRIBUTES = 0x800,
  WYX_UPDATED_GROUP_ATTRIBUTES = 0x1000,
  WYX_REJECTED_GROUP_ATTRIBUTES = 0x2000,
  WYX_CURRENT_STATE_VALUE = 0x4000,
  WYX_MERGE_GROUP_INFO = 0x10000,
  WYX_MERGE_ALPHA_OMEGA_SWITCHED = 0x20000
};

/// Flags: how a protocol or phase ended, and what an announcement says.
enum wyx_summary_code_t : int {
  WYX_MIN_SUMMARY_CODE = 0x1,
  WYX_EXPLICIT_APPROVE = 0x1,
  WYX_EXPLICIT_REJECT = 0x2,
  WYX_DEFAULT_APPROVE = 0x4,
  WYX_DEFAULT_REJECT = 0x8,
  WYX_TIME_LIMIT_EXCEEDED = 0x10,
  WYX_PROVIDER_FAILED = 0x20,
  WYX_RESPONSIVENESS_NO_RESPONSE = 0x40,
  WYX_RESPONSIVENESS_RESPONSE = 0x80,
  WYX_GROUP_DISSOLVED = 0x100,
  WYX_GROUP_SERVICES_HAS_DIED_HORRIBLY = 0x200,
  WYX_DEACTIVATE_UNSUCCESSFUL = 0x400,
  WYX_DEACTIVATE_TIME_LIMIT_EXCEEDED = 0x800,
  WYX_GROUP_ATTRIBUTES_CHANGED = 0x1000,
  WYX_MEMBER_LEAVE_DUE_TO_LOCAL_SPLIT = 0x2000,
  WYX_MEMBER_LEAVE_DUE_TO_REMOTE_SPLIT = 0x4000,
  WYX_MEMBER_LEAVE_DUE_TO_LINK_DOWN = 0x8000,
  WYX_MEMBER_LEAVE_DUE_TO_SHUTDOWN = 0x10000,
  WYX_MEMBER_LEAVE_DUE_TO_STOP = 0x20000,
  WYX_MEMBER_LEAVE_DUE_TO_FORCE_DOWN = 0x40000,
  WYX_MAX_SUMMARY_CODE = 0x40000
};

/// Flags: what a subscription notification carries.
enum wyx_subscription_type_t : int {
  WYX_SUBSCRIPTION_STATE = 0x1,
  WYX_SUBSCRIPTION_DELTA_JOIN = 0x2,
  WYX_SUBSCRIPTION_DELTA_LEAVE = 0x4,
  WYX_SUBSCRIPTION_MEMBERSHIP = 0x8,
  WYX_SUBSCRIPTION_SPECIAL_DATA = 0x40,
  WYX_SUBSCRIPTION_DISSOLVED = 0x80,
  WYX_SUBSCRIPTION_GS_HAS_DIED = 0x100,
  WYX_SUBSCRIPTION_PERSISTENT = 0x200
};

/// Flags: what a subscriber asks for.
enum wyx_subscription_ctrl_t : int {
  WYX_SUBSCRIBE_STATE = 0x1,
  WYX_SUBSCRIBE_DELTA_JOINS = 0x2,
  WYX_SUBSCRIBE_DELTA_LEAVES = 0x4,
  WYX_SUBSCRIBE_DELTAS_ONLY = 0x6,
  WYX_SUBSCRIBE_MEMBERSHIP = 0x8,
  WYX_SUBSCRIBE_ALL_MEMBERSHIP = 0xE,
  WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP = 0xF,
  WYX_SUBSCRIBE_ADAPTER_INFO = 0x10,
  WYX_SUBSCRIBE_SPECIAL_DATA = 0x40,
  WYX_SUBSCRIBE_PERSISTENCE = 0x200
};

/// Flags: batching of joins and leaves, collection of vote results.
enum wyx_batch_ctrl_t : int {
  WYX_NO_BATCHING = 0,
  WYX_BATCH_JOINS = 1,
  WYX_BATCH_LEAVES = 2,
  WYX_BATCH_BOTH = 3,
  WYX_DEACTIVATE_ON_FAILURE = 4,
  WYX_COLLECT_VOTE_RESULT = 8,
  WYX_COLLECT_MSG_RESULT = 16,
  WYX_COLLECT_STATEVALUE_RESULT = 32,
  WYX_COLLECT_ALL_RESULT = 56
};

enum wyx_num_phases_t : int { WYX_1_PHASE = 1, WYX_N_PHASE = 2 };

enum wyx_merge_ctrl_t : int {
  WYX_DISSOLVE_MERGE = 0,
  WYX_FIRST_MERGE_TYPE = 0,
  WYX_LARGER_MERGE = 1,
  WYX_SMALLER_MERGE = 2,
  WYX_DONTCARE_MERGE = 3,
  WYX_ANYORDER_MERGE = 4,
  WYX_LAST_MERGE_TYPE = 4
};

enum wyx_vote_value_t : int {
  WYX_NULL_VOTE = 0,
  WYX_VOTE_APPROVE = 1,
  WYX_VOTE_CONTINUE = 2,
  WYX_VOTE_REJECT = 3,
  WYX_VOTE_APPROVE_AND_SWITCH_ALPHA_OMEGA = 129,
  WYX_VOTE_CONTINUE_AND_SWITCH_ALPHA_OMEGA = 130
};

/// Flags: why a provider is gone.
enum wyx_leave_code_t : int {
  WYX_FAILURE_NONE = 0,
  WYX_VOLUNTARY_LEAVE = 0x1,
  WYX_PROVIDER_FAILURE = 0x2,
  WYX_HOST_FAILURE = 0x4,
  WYX_PROVIDER_EXPELLED = 0x8,
  WYX_SOURCE_PROVIDER_LEAVE = 0x10,
  WYX_PROVIDER_SAID_GOODBYE = 0x20,
  WYX_NETWORK_SUNDERED = 0x40,
  WYX_HOST_LEAVE_DUE_TO_LOCAL_SPLIT = 0x80,
  WYX_HOST_LEAVE_DUE_TO_REMOTE_SPLIT = 0x100,
  WYX_HOST_LEAVE_DUE_TO_LINK_DOWN = 0x200,
  WYX_HOST_LEAVE_DUE_TO_SHUTDOWN = 0x400,
  WYX_HOST_LEAVE_DUE_TO_STOP = 0x800,
  WYX_HOST_LEAVE_DUE_TO_FORCE_DOWN = 0x1000
};

enum wyx_adapter_reason_t : int { WYX_ADAPTER_DEAD = 1, WYX_ADAPTER_REMOVED = 2 };

/// Flags of the session's socket.
enum wyx_socket_ctrl_t : int {
  WYX_SOCKET_NO_SIGNAL = 0,
  WYX_SOCKET_SIGNAL = 0x1,
  WYX_ENABLE_ADAPTER_INFO = 0x2,
  WYX_ENABLE_DOMAIN_EVENT = 0x1000,
  WYX_ENABLE_IPV6 = 0x2000,
  WYX_ENABLE_MIGRATION_CALLBACK = 0x4000,
  WYX_ENABLE_OPQUORUM_CALLBACK = 0x8000,
  WYX_ENABLE_OPQUORUM_ACK_REQUIRED = 0x10000,
  WYX_STREAM = 0x800000,
  WYX_IMMEDIATE_DOMAIN_CONTROL = 0x10000000
};

enum wyx_dispatch_flag_t : int { WYX_NON_BLOCKING = 0, WYX_BLOCKING = 1 };

/// Flags: how the daemon checks that a client is alive.
enum wyx_responsiveness_type_t : int {
  WYX_NO_RESPONSIVENESS = 0,
  WYX_PING_RESPONSIVENESS = 0x1,
  WYX_COUNTER_RESPONSIVENESS = 0x2,
  WYX_CRITICAL_CLIENT = 0x8000,
  WYX_KEEP_CHECK_RESPONSIVENESS = 0x10000,
  WYX_ANNOUNCEMENT_WHEN_SLOW = 0x1000000,
  WYX_EXEC_SCRIPT_WHEN_SLOW = 0x2000000,
  WYX_DAEMON_MUST_DIE_WHEN_SLOW = 0x4000000,
  WYX_CLOSE_CLIENT_SOCKET = 0x8000000,
  WYX_KILL_CLIENT_WHEN_SLOW = 0x10000000
};

enum wyx_callback_rc_t : int { WYX_CALLBACK_NOT_OK = 0, WYX_CALLBACK_OK = 1 };

enum wyx_query_type_t : int { WYX_QUERY_ALL = 0, WYX_QUERY_GROUP = 1 };

enum wyx_migration_vote_t : int { WYX_MIGRATION_VOTE_YES = 1, WYX_MIGRATION_VOTE_NO = 2 };

enum wyx_site_dissolve_action_t : int {
  WYX_SITE_DISSOLVE_AND_DEFAULT = 0,
  WYX_SITE_DISSOLVE_AND_REBOOT = 1,
  WYX_SITE_DISSOLVE_AND_HALT = 2,
  WYX_SITE_DISSOLVE_AND_SYNC_REBOOT = 3,
  WYX_SITE_DISSOLVE_AND_SYNC_HALT = 4,
  WYX_SITE_DISSOLVE_AND_NONE = 5,
  WYX_SITE_DISSOLVE_AND_EXIT = 6
};

enum wyx_subcluster_dissolve_action_t : int {
  WYX_SUBCLUSTER_DISSOLVE_AND_DEFAULT = 0,
  WYX_SUBCLUSTER_DISSOLVE_AND_REBOOT = 1,
  WYX_SUBCLUSTER_DISSOLVE_AND_HALT = 2,
  WYX_SUBCLUSTER_DISSOLVE_AND_SYNC_REBOOT = 3,
  WYX_SUBCLUSTER_DISSOLVE_AND_SYNC_HALT = 4,
  WYX_SUBCLUSTER_DISSOLVE_AND_NONE = 5,
  WYX_SUBCLUSTER_DISSOLVE_AND_EXIT = 6
};

enum wyx_subcluster_type_t : int { WYX_SUBCLUSTER_TYPE_LOCAL = 0, WYX_SUBCLUSTER_TYPE_REMOTE = 1 };

enum wyx_priv_channel_msg_type_t : int { WYX_PRIV_MSG_NONE = 0, WYX_PRIV_MSG_OPQUORUM = 1 };

/// Selects the member of wyx_domain_control_notification_t::info.
enum wyx_domain_event_t : int {
  WYX_DOMAIN_DISCOVER = 1,
  WYX_DOMAIN_MERGE = 2,
  WYX_DOMAIN_VERSION = 3,
  WYX_DOMAIN_NODE_CONFIG = 4,
  WYX_MIGRATE_TO_PELL = 5,
  WYX_SITE_SPLIT = 6,
  WYX_SITE_MERGE = 7,
  WYX_DOMAIN_MASTER_NODE = 8,
  WYX_SUBCLUSTER_SPLIT = 9,
  WYX_SUBCLUSTER_MERGE = 10,
  WYX_OPQUORUM_INFO = 11,
  WYX_DOMAINCB_RESP_ERR_INFO = 12,
  WYX_INTERNAL_MSG_INFO = 0x10000001
};

enum wyx_migration_event_t : int {
  WYX_DOMAIN_PELL_MIGRATION_COORD = 1,
  WYX_DOMAIN_PELL_MIGRATION_APPRVD = 2,
  WYX_DOMAIN_PELL_MIGRATION_REJCTD = 3,
  WYX_DOMAIN_PELL_MIGRATION_COMPLT = 4
};

enum wyx_migration_reason_t : int {
  WYX_MIGRATE_TO_PELL_PREP_DONE = 1,
  WYX_MIGRATE_TO_PELL_COMMIT_DONE = 2,
  WYX_HB_MIGRATE_TO_PELL_PREP_FAILED = 3,
  WYX_ZN2PRMMIGRATETOPELLPREP_FAILED = 4,
  WYX_MIGRATE_TO_PELL_ALREADY_DONE = 5,
  WYX_INVALID_MIGRATION_TO_PELL_CALL = 7
};

enum wyx_quorum_state_t : int {
  WYX_QUORUM_STATE_HAS = 0,
  WYX_QUORUM_STATE_PENDING = 1,
  WYX_QUORUM_STATE_NONE = 2
};

// ---------------------------------------------------------------------------------------------------------
// Identity and values

typedef int wyx_token_t;                     ///< provider or subscriber; -1: none
typedef int wyx_descriptor_t;                ///< file descriptor of the session; -1: none
typedef unsigned short wyx_time_limit_t;     ///< of a protocol phase, in seconds; 0: no limit
typedef char* wyx_group_name_t;              ///< NUL-terminated

const int WYX_node_number = -1;
const int WYX_instance_number = -1;

/// A provider's identity in its group.
union wyx_provider_t {
  struct {
    short _gs_instance_number;
    short _gs_node_number;
  } _gs_provider_info;
  int gs_provider_id;
};

inline bool operator==(const wyx_provider_t& a, const wyx_provider_t& b) {
  return a.gs_provider_id == b.gs_provider_id;
}

struct wyx_membership_t {
  unsigned int gs_count;
  wyx_provider_t* gs_providers;  ///< gs_count of them, in join order, oldest first
};

struct wyx_state_value_t {
  int gs_length;  ///< bytes
  char* gs_state;
};

struct wyx_provider_message_t {
  int gs_length;  ///< bytes
  char* gs_message;
};

struct wyx_group_state_t {
  short gs_version;
  wyx_state_value_t gs_group_state_value;
};

union wyx_ip_addr {
  struct {
    uint32_t filler[3];
    in_addr ip4x;
  } ipv4_in_6;
  in6_addr ip6;
};

struct wyx_ip_membership_t {
  unsigned int gs_count;
  wyx_ip_addr* gs_ip_members;
};

struct wyx_special_data_t {
  int gs_length;
  unsigned int gs_flag;
  void* gs_special_data;
};

struct wyx_group_attributes_t {
  short gs_version;
  short gs_sizeof_group_attributes;
  short gs_client_version;
  wyx_batch_ctrl_t gs_batch_control;
  wyx_num_phases_t gs_num_phases;
  wyx_num_phases_t gs_source_reflection_num_phases;
  wyx_vote_value_t gs_group_default_vote;
  wyx_merge_ctrl_t gs_merge_control;
  wyx_time_limit_t gs_time_limit;
  wyx_time_limit_t gs_source_reflection_time_limit;
  wyx_group_name_t gs_group_name;
  wyx_group_name_t gs_source_group_name;
  wyx_vote_value_t gs_merge_default_vote;
};

// ---------------------------------------------------------------------------------------------------------
// Proposals

struct wyx_phase_info_t {
  unsigned short gs_num_phases;
  unsigned short gs_phase_number;  ///< counted from 1
};

struct wyx_leave_code_entry_t {
  unsigned int gs_voluntary_or_failure;  ///< flags of wyx_leave_code_t
  unsigned int gs_voluntary_leave_code;  ///< what the leaver gave
};

struct wyx_leave_info_t {
  unsigned int gs_count;
  wyx_leave_code_entry_t* gs_leave_codes;  ///< one for each changing provider
};

struct wyx_expel_info_t {
  int gs_deactivate_phase;
  int gs_expel_flag_length;
  char* gs_expel_flag;
};

struct wyx_merge_info_t {
  wyx_membership_t* gs_alpha_providers;
  wyx_membership_t* gs_omega_providers;
  wyx_group_state_t gs_alpha_group_state;
  wyx_group_state_t gs_omega_group_state;
};

struct wyx_vote_result_t {
  wyx_provider_t gs_voter;
  wyx_vote_value_t gs_vote_value;
  wyx_summary_code_t gs_summary_code;
  wyx_leave_code_t gs_leave_code;
  wyx_state_value_t* gs_proposed_state_value;
  wyx_provider_message_t* gs_provider_message;
};
typedef wyx_vote_result_t* wyx_vote_result_ptr_t;

struct wyx_vote_results_t {
  unsigned int gs_count;
  wyx_vote_result_ptr_t* gs_vote_results;
};

/// What a protocol notification is about. A pointer is null when its gs_whats_changed bit is clear.
struct wyx_proposal_t {
  wyx_phase_info_t gs_phase_info;
  wyx_provider_t gs_proposed_by;
  wyx_whats_changed_t gs_whats_changed;
  wyx_membership_t* gs_current_providers;
  wyx_membership_t* gs_changing_providers;
  wyx_leave_info_t* gs_leave_info;
  wyx_expel_info_t* gs_expel_info;
  wyx_state_value_t* gs_current_state_value;
  wyx_state_value_t* gs_proposed_state_value;
  wyx_state_value_t* gs_source_state_value;
  wyx_provider_message_t* gs_provider_message;
  wyx_group_attributes_t* gs_new_group_attributes;
  wyx_merge_info_t* gs_merge_info;
  wyx_vote_results_t* gs_current_vote_results;
  wyx_vote_results_t* gs_changing_vote_results;
};

// ---------------------------------------------------------------------------------------------------------
// Sites, domains, nodes

struct wyx_domain_spec_t {
  uint32_t node_number;
  uint32_t instance_id;
  uint32_t size;
};

struct wyx_uuid_t {
  union {
    uint64_t bits64[2];
    unsigned char bytes[16];
  } val;
};

struct wyx_site_spec_t {
  uint32_t site_number;
  wyx_uuid_t site_uuid;
  uint32_t site_policy;
  uint32_t site_priority;
  int32_t site_size;
};

struct wyx_node_info_t {
  int32_t node_number;
  uint32_t node_epoch;  ///< another one each time that the node comes
  uint64_t node_id;     ///< the same as its number
};

struct wyx_node_list_t {
  unsigned int gs_count;
  wyx_node_info_t* gs_nodes;  ///< gs_count of them, ascending by number
};

struct wyx_subcluster_dissolution_info_t {
  wyx_subcluster_type_t gs_subcluster_type;
  wyx_subcluster_dissolve_action_t action;
  union {
    wyx_domain_spec_t local_domain;  ///< for WYX_SUBCLUSTER_TYPE_LOCAL
    wyx_site_spec_t site_spec;       ///< for WYX_SUBCLUSTER_TYPE_REMOTE
  } info;
};

#ifndef CU_VRMF_T_DEFINED
#define CU_VRMF_T_DEFINED
/// A product version; of the common utilities library.
struct cu_vrmf_t {
  uint16_t version;
  uint16_t release;
  uint16_t modlevel;
  uint16_t fixlevel;
};
#endif

struct wyx_zelt_version_t {
  cu_vrmf_t vrmf;
  uint32_t quick_version;
};

// ---------------------------------------------------------------------------------------------------------
// Session and query records

struct wyx_responsiveness_t {
  wyx_responsiveness_type_t gs_responsiveness_type;
  unsigned int gs_responsiveness_interval;                ///< seconds between checks
  wyx_time_limit_t gs_responsiveness_response_time_limit;  ///< seconds
  void* gs_counter_location;
  unsigned int gs_counter_length;  ///< bytes
};

struct wyx_limits {
  int max_provider_message_length;  ///< bytes
  int max_state_value_length;       ///< bytes
  int max_group_name_length;        ///< characters
};

struct wyx_adapter_info {
  wyx_ip_addr ip_addr;
  short node_number;
  const char* interface_name;
  wyx_provider_t gs_member_id;
  const char* gs_group_name;
  const char* hb_network_name;
  const char* hb_network_type;
  void* __reserved_1__;
  void* __reserved_2__;
};

struct wyx_group_info_t {
  wyx_state_value_t* _gs_info_state;
  wyx_provider_t* _gs_info_providers;
};

union wyx_query_group_info_t {
  wyx_group_info_t _gs_group_info;
  wyx_group_name_t _gs_groups;
};

struct wyx_query_info_t {
  wyx_query_type_t gs_query_type;
  wyx_rc_t gs_query_return_code;
  int gs_number_of_groups;
  wyx_query_group_info_t* gs_group_info;
};

// ---------------------------------------------------------------------------------------------------------
// Notifications

struct wyx_proposal_info_t;

struct wyx_n_phase_notification_t {
  wyx_notification_type_t gs_notification_type;
  wyx_token_t gs_provider_token;
  wyx_request_t gs_protocol_type;
  wyx_summary_code_t gs_summary_code;
  wyx_time_limit_t gs_time_limit;
  wyx_proposal_t* gs_proposal;
  uint64_t gs_event_seqnum;
};

struct wyx_approved_notification_t {
  wyx_notification_type_t gs_notification_type;
  wyx_token_t gs_provider_token;
  wyx_request_t gs_protocol_type;
  wyx_summary_code_t gs_summary_code;
  wyx_proposal_t* gs_proposal;
  uint64_t gs_event_seqnum;
};

struct wyx_rejected_notification_t {
  wyx_notification_type_t gs_notification_type;
  wyx_token_t gs_provider_token;
  wyx_request_t gs_protocol_type;
  wyx_summary_code_t gs_summary_code;
  wyx_proposal_t* gs_proposal;
  uint64_t gs_event_seqnum;
};

struct wyx_announcement_notification_t {
  wyx_notification_type_t gs_notification_type;
  wyx_token_t gs_provider_token;
  wyx_summary_code_t gs_summary_code;
  wyx_membership_t* gs_announcement;
};

struct wyx_merge_notification_t {
  wyx_notification_type_t gs_notification_type;
  wyx_token_t gs_provider_token;
  wyx_request_t gs_protocol_type;
  wyx_proposal_t* gs_proposal;
  wyx_merge_ctrl_t gs_merge_control;
  wyx_group_state_t gs_alpha_group_state;
  wyx_group_state_t gs_omega_group_state;
};

struct wyx_subscription_notification_t {
  wyx_notification_type_t gs_notification_type;
  wyx_token_t gs_subscriber_token;
  wyx_subscription_type_t gs_subscription_type;
  wyx_state_value_t* gs_state_value;
  wyx_membership_t* gs_full_membership;
  wyx_membership_t* gs_changing_membership;
  wyx_special_data_t* gs_subscription_special_data;
  wyx_ip_membership_t* gs_full_ip_membership;
  wyx_ip_membership_t* gs_changing_ip_membership;
  wyx_adapter_reason_t* gs_reason_flags;
  wyx_merge_info_t* gs_merge_info;
  wyx_leave_code_entry_t* gs_leave_codes;  ///< one for each changing provider of a leave
  uint64_t gs_event_seqnum;
};

struct wyx_delayed_error_notification_t {
  wyx_notification_type_t gs_notification_type;
  wyx_token_t gs_request_token;
  wyx_request_t gs_protocol_type;
  wyx_rc_t gs_delayed_return_code;
  wyx_proposal_info_t* gs_failing_request;
  wyx_group_attributes_t* old_group_attributes;
};

struct wyx_responsiveness_notification_t {
  wyx_notification_type_t gs_notification_type;
  wyx_responsiveness_t gs_responsiveness_information;
};

struct wyx_query_notification_t {
  wyx_notification_type_t gs_notification_type;
  unsigned int gs_number_of_queries;
  wyx_query_info_t* gs_query_info;
};

struct wyx_domain_discover_t {
  wyx_domain_spec_t gs_domain;
  wyx_ip_addr ip_addr;
  unsigned int instance_id;
};

struct wyx_domain_merge_t {
  wyx_domain_spec_t gs_domain;
  wyx_domain_spec_t other_domain;
  wyx_node_list_t* gs_domain_members;
  wyx_node_list_t* other_domain_members;
};

struct wyx_domain_nodes_t {
  wyx_node_list_t* current;
  wyx_node_list_t* added;
  wyx_node_list_t* removed;
};

struct wyx_migration_event_info_t {
  wyx_migration_event_t sub_type;
  wyx_migration_reason_t reason;
  int32_t reason_detail_code;
  char reason_msg[100];
};

struct wyx_site_event_t {
  wyx_site_spec_t gs_local_site;
  wyx_site_spec_t gs_other_site;
};

struct wyx_quorum_change_t {
  uint64_t notification_sequence;  ///< 0: it is not to be answered
  wyx_quorum_state_t old_quorum_val;
  wyx_quorum_state_t new_quorum_val;
  uint64_t gs_event_seqnum;  ///< of the nodes' last change before the session had quorum
};

struct wyx_subcluster_event_t {
  wyx_domain_spec_t gs_local_domain;
  wyx_site_spec_t gs_local_site;
  wyx_site_spec_t gs_other_site;
  wyx_node_list_t gs_local_subcluster;
  wyx_node_list_t gs_other_subcluster;
  wyx_subcluster_type_t gs_subcluster_type;
  uint64_t gs_event_seqnum;
};

/// Answers a quorum notification: what wyx_internal_send_domain_msg_to_gsd is given with WYX_PRIV_MSG_OPQUORUM.
struct wyx_quorum_resp_t {
  uint64_t notification_sequence;  ///< of the notification
  void* reserved_field;
};

struct wyx_quorum_resp_err_t {
  wyx_quorum_resp_t quorum_resp;
  wyx_rc_t error_code;
};

struct wyx_domaincb_resp_err_t {
  wyx_domain_event_t domain_event_type;
  union {
    wyx_quorum_resp_err_t quorum_resp_err;
  } err_info;
};

struct wyx_internal_msg_t {
  void* msg;
};

struct wyx_domain_control_notification_t {
  wyx_notification_type_t notification_type;
  wyx_domain_event_t domain_event_type;  ///< selects the member of info
  union {
    wyx_domain_discover_t discover;
    wyx_domain_merge_t merge;
    wyx_zelt_version_t vers;
    wyx_domain_nodes_t nodes;
    wyx_migration_event_info_t migrate_event_info;
    wyx_site_event_t site_merge;
    wyx_site_event_t site_split;
    wyx_domain_spec_t domain_master_info;
    wyx_quorum_change_t quorum_val;
    wyx_subcluster_event_t subcluster_split;
    wyx_subcluster_event_t subcluster_merge;
    wyx_domaincb_resp_err_t domaincb_resp_err;
    wyx_internal_msg_t internal_msg;
  } info;
};

// ---------------------------------------------------------------------------------------------------------
// Callbacks: function types; they run inside wyx_dispatch, on the thread that called it.

typedef void wyx_n_phase_cb_t(const wyx_n_phase_notification_t*);
typedef void wyx_approved_cb_t(const wyx_approved_notification_t*);
typedef void wyx_rejected_cb_t(const wyx_rejected_notification_t*);
typedef void wyx_announcement_cb_t(const wyx_announcement_notification_t*);
typedef void wyx_merge_cb_t(const wyx_merge_notification_t*);
typedef void wyx_subscription_cb_t(const wyx_subscription_notification_t*);
typedef void wyx_delayed_error_cb_t(const wyx_delayed_error_notification_t*);
typedef void wyx_query_cb_t(const wyx_query_notification_t*);
typedef void wyx_domain_control_cb_t(const wyx_domain_control_notification_t*);
typedef wyx_callback_rc_t wyx_responsiveness_cb_t(const wyx_responsiveness_notification_t*);

// ---------------------------------------------------------------------------------------------------------
// Requests

struct wyx_join_request_t {
  wyx_group_attributes_t* gs_group_attributes;
  short gs_provider_instance;
  char* gs_provider_local_name;
  wyx_n_phase_cb_t* gs_n_phase_protocol_callback;
  wyx_approved_cb_t* gs_protocol_approved_callback;
  wyx_rejected_cb_t* gs_protocol_rejected_callback;
  wyx_announcement_cb_t* gs_announcement_callback;
  wyx_merge_cb_t* gs_merge_callback;
};

struct wyx_state_change_request_t {
  wyx_num_phases_t gs_num_phases;
  wyx_time_limit_t gs_time_limit;
  wyx_state_value_t gs_new_state;
};

struct wyx_message_request_t {
  wyx_num_phases_t gs_num_phases;
  wyx_time_limit_t gs_time_limit;
  wyx_provider_message_t gs_message;
};

struct wyx_leave_request_t {
  wyx_num_phases_t gs_num_phases;
  wyx_time_limit_t gs_time_limit;
  unsigned int gs_leave_code;
};

struct wyx_expel_request_t {
  wyx_num_phases_t gs_num_phases;
  wyx_time_limit_t gs_time_limit;
  wyx_membership_t gs_expel_list;
  int gs_deactivate_phase;
  char* gs_deactivate_flag;
};

struct wyx_subscribe_request_t {
  wyx_subscription_ctrl_t gs_subscription_control;
  wyx_group_name_t gs_subscription_group;
  wyx_subscription_cb_t* gs_subscription_callback;
};

struct wyx_attribute_change_request_t {
  wyx_num_phases_t gs_num_phases;
  wyx_time_limit_t gs_time_limit;
  wyx_group_attributes_t* gs_group_attributes;
  wyx_membership_t* gs_backlevel_providers;
};

/// A request; the entry point called says which member is meant.
struct wyx_proposal_info_t {
  union {
    wyx_join_request_t _gs_join_request;
    wyx_state_change_request_t _gs_state_change_request;
    wyx_message_request_t _gs_message_request;
    wyx_leave_request_t _gs_leave_request;
    wyx_expel_request_t _gs_expel_request;
    wyx_subscribe_request_t _gs_subscribe_request;
    wyx_attribute_change_request_t _gs_attribute_change_request;
  } _gs_protocol_info;
};

#endif
