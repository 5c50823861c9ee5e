// A base API that records its calls between the trace lines, so that a test can hold the whole order of steps; and
// the notifications that a base API sends.
#ifndef TESTS_GSCL_RECORDING_API_H
#define TESTS_GSCL_RECORDING_API_H

#include <pthread.h>
#include <stdarg.h>

#include <functional>
#include <mutex>
#include <regex>
#include <string>
#include <utility>
#include <vector>

#include "gscl/gscl.h"

namespace recording {

using namespace zelt_gscl;
using zelt_gscl_V1::GSClient;
using zelt_gscl_V1::GSController;
using zelt_gscl_V1::GSMembershipList;
using zelt_gscl_V1::GSProvider;
using zelt_gscl_V1::GSStateValue;
using zelt_gscl_V1::GSSubscriber;
using zelt_gscl_V1::wyx_notification_summary_t;
using Lines = std::vector<std::string>;

constexpr int kAllLevels = GSCL_TRC_API | GSCL_TRC_DETAIL | GSCL_TRC_WARNING;
constexpr wyx_token_t kToken = 12;
constexpr wyx_provider_t kOwn = {{3, 7}};  // instance 3 on node 7, which joined() gives
constexpr wyx_provider_t kOther = {{4, 8}};
constexpr wyx_state_value_t kNoValue = {0, nullptr};

inline std::string lowHex(uintptr_t value) {
  char text[16];
  snprintf(text, sizeof text, "%x", static_cast<unsigned>(value));
  return text;
}

/// One event is a call of the base API with its numbers, "wyx_goodbye(12)", a callback, "-> approvedCb", a result,
/// "= WYX_OK", or a trace line with its channel, "A text" (D: detail, W: warning), without its line end. Before it
/// stands "[<state>/<token> <current value>/<proposed value> <members>]" of the watched client, when that has
/// changed. Addresses of the watched client read "@", the calling thread's id "#", numbers of requests "seq=S";
/// "Prov[g,Id=3/7,T=12]" is cut to "P[3/7,T=12]" and "GSController::" to "C::".
class RecordingApi {
 public:
  explicit RecordingApi(int level = kAllLevels) : table_before_(GSAPIRtns) {
    the_api = this;
    fillTable();
    GSAPIRtns = &table;
    routine_before_ = GSSetTraceRtn([](int line_level, char* text) {
      const char* channel = line_level == GSCL_TRC_API ? "A " : line_level == GSCL_TRC_DETAIL ? "D " : "W ";
      std::string line = channel + std::string(text);
      line.back() == '\n' ? line.pop_back() : (void)line.append("<no line end>");
      the_api->record(line);
    });
    GSSetDebugLevel(level);
  }
  ~RecordingApi() {
    GSSetDebugLevel(0);
    GSSetTraceRtn(routine_before_);
    GSAPIRtns = table_before_;
  }
  RecordingApi(const RecordingApi&) = delete;
  RecordingApi& operator=(const RecordingApi&) = delete;

  /// Drops what was recorded and names this client's state from here on.
  void watch(GSClient* client) {
    take();
    watched_ = client;
  }
  void record(std::string what) {
    const auto replace = [&](const char* pattern, const char* with) {
      what = std::regex_replace(what, std::regex(pattern), with);
    };
    std::string state;
    if (watched_ != nullptr) {
      replace(lowHex(reinterpret_cast<uintptr_t>(watched_)).c_str(), "@");
      state = stateOf(*watched_);
    }
    replace(lowHex(pthread_self()).c_str(), "#");
    replace("Prov\\[g,Id=", "P[");
    replace("GSController::", "C::");
    replace("seq=[0-9]+", "seq=S");
    std::lock_guard<std::mutex> lock(mutex_);
    if (std::exchange(state_, state) != state) events_.push_back(state);
    events_.push_back(what);
  }
  /// What was recorded since the last call.
  Lines take() {
    std::lock_guard<std::mutex> lock(mutex_);
    return std::exchange(events_, {});
  }

  wyx_rc_t answer = WYX_OK;
  wyx_token_t token = kToken;         // what join and subscribe give
  std::function<void()> during;       // runs inside every entry point
  wyx_proposal_info_t proposal = {};  // of the last join or subscription
  std::string entered;  // "<group>/<instance>/<local name>" of the last join, the group of the last subscription
  struct Setup {
    int version, count;
    wyx_socket_ctrl_t socket;
    wyx_responsiveness_t responsiveness;
    const char* path;
    std::vector<void*> callbacks;
  } setup = {};
  GSAPIRtnCollection_t table = {};
  static inline RecordingApi* the_api = nullptr;

 private:
  using Info = const wyx_proposal_info_t*;

  static std::string stateOf(GSClient& client) {
    std::string state = std::string("[") + (gscl_GSClientStateName(client.getClientState()) + 7) + "/" +
                        std::to_string(client.getToken());
    const auto text = [](const GSStateValue& value) {
      const wyx_state_value_t* v = value.getValue();
      return v == nullptr ? std::string() : std::string(v->gs_state, static_cast<size_t>(v->gs_length));
    };
    GSStateValue current, proposed;
    client.getCurrentStateValue(current);
    client.getProposedStateValue(proposed);
    state += " " + text(current) + "/" + text(proposed);
    wyx_provider_t id = {};
    for (int i = 0; client.getMemberAt(i, &id) == 1; ++i) {
      state += " " + std::to_string(id._gs_provider_info._gs_instance_number) + "." +
               std::to_string(id._gs_provider_info._gs_node_number);
    }
    return state + "]";
  }
  template <class... Arguments>
  wyx_rc_t enter(const char* name, Arguments... arguments) {
    std::string list;
    ((list += (list.empty() ? "" : ", ") + std::to_string(arguments)), ...);
    record(std::string(name) + "(" + list + ")");
    if (auto act = during) act();
    return answer;
  }
  wyx_rc_t admit(const char* name, const std::string& whom, wyx_token_t* new_token, Info info) {
    proposal = *info;
    entered = whom;
    const wyx_rc_t rc = enter(name, *new_token);
    *new_token = token;
    return rc;
  }
  static wyx_rc_t setUp(int version, int count, wyx_descriptor_t* fd, wyx_socket_ctrl_t socket,
                        const wyx_responsiveness_t* responsiveness, const char* path,
                        wyx_responsiveness_cb_t* alive, wyx_delayed_error_cb_t* error, wyx_query_cb_t* query,
                        ...) {
    the_api->setup = {version, count, socket, *responsiveness, path, {(void*)alive, (void*)error, (void*)query}};
    va_list rest;
    va_start(rest, query);
    if (count == 8) the_api->setup.callbacks.push_back(va_arg(rest, void*));
    va_end(rest);
    *fd = 7;
    return the_api->enter("wyx_setup");
  }
  void fillTable() {
    table.wyx_setup = setUp;
    table.wyx_join = [](wyx_token_t* t, Info info) {
      const wyx_join_request_t& join = info->_gs_protocol_info._gs_join_request;
      const std::string group = join.gs_group_attributes->gs_group_name, name = join.gs_provider_local_name;
      const std::string instance = std::to_string(join.gs_provider_instance);
      return the_api->admit("wyx_join", group + "/" + instance + "/" + name, t, info);
    };
    table.wyx_subscribe = [](wyx_token_t* t, Info info) {
      const char* group = info->_gs_protocol_info._gs_subscribe_request.gs_subscription_group;
      return the_api->admit("wyx_subscribe", group, t, info);
    };
    table.wyx_vote = [](wyx_token_t t, wyx_vote_value_t vote, const wyx_state_value_t* value,
                        const wyx_provider_message_t* message, wyx_vote_value_t default_vote) {
      const int lengths[] = {value == nullptr ? -1 : value->gs_length,
                             message == nullptr ? -1 : message->gs_length};
      return the_api->enter("wyx_vote", t, vote, lengths[0], lengths[1], default_vote);
    };
#define ENTRY(entry) table.entry = [](auto... number) { return the_api->enter(#entry, number...); }
#define PROPOSAL(entry, record, ...)                                                 \
  table.entry = [](wyx_token_t t, Info info) {                                       \
    const auto& r = info->_gs_protocol_info.record;                                  \
    return the_api->enter(#entry, t, r.gs_num_phases, r.gs_time_limit, __VA_ARGS__); \
  }
    ENTRY(wyx_quit);
    ENTRY(wyx_dispatch);
    ENTRY(wyx_goodbye);
    ENTRY(wyx_unsubscribe);
    PROPOSAL(wyx_change_state_value, _gs_state_change_request, r.gs_new_state.gs_length);
    PROPOSAL(wyx_send_message, _gs_message_request, r.gs_message.gs_length);
    PROPOSAL(wyx_leave, _gs_leave_request, r.gs_leave_code);
    PROPOSAL(wyx_expel, _gs_expel_request, r.gs_deactivate_phase);
    PROPOSAL(wyx_change_attributes, _gs_attribute_change_request, r.gs_group_attributes->gs_client_version);
#undef PROPOSAL
#undef ENTRY
    table.wyx_change_responsiveness = [](const wyx_responsiveness_t*) {
      return the_api->enter("wyx_change_responsiveness");
    };
  }

  std::mutex mutex_;
  Lines events_;
  std::string state_;  // at the last event
  GSClient* watched_ = nullptr;
  GSAPIRtnCollection_t* table_before_;
  gscl_tracef_rtn routine_before_;
};

/// A provider whose callbacks are recorded, then do what the test says, else what the library's do.
class Member : public GSProvider {
 public:
  using GSProvider::GSProvider;
#define CALLBACK(name, Base, type)                           \
  void name(const wyx_##type##_notification_t* n) override { \
    RecordingApi::the_api->record("-> " #name);              \
    if (auto act = action) return act();                     \
    Base::name(n);                                           \
  }                                                          \
  static_assert(true)
  CALLBACK(nPhaseCb, GSProvider, n_phase);
  CALLBACK(approvedCb, GSProvider, approved);
  CALLBACK(rejectedCb, GSProvider, rejected);
  CALLBACK(announcementCb, GSProvider, announcement);
  CALLBACK(mergeCb, GSProvider, merge);
  CALLBACK(delayedErrorCb, GSProvider, delayed_error);
  std::function<void()> action;
};

class Watcher : public GSSubscriber {
 public:
  using GSSubscriber::GSSubscriber;
  CALLBACK(subscribeCb, GSSubscriber, subscription);
  std::function<void()> action;
};
#undef CALLBACK

/// What a notification says. An empty text is no state value at all, an empty list no membership.
struct Says {
  wyx_provider_t by = kOwn;
  int changed = 0;
  std::string current = {}, proposed = {};
  std::vector<wyx_provider_t> members = {}, changing = {};
  unsigned short phase = 1, phases = 2;
  wyx_token_t to = kToken;
};

/// The same, as the base API hands it out.
struct Records {
  explicit Records(const Says& says)
      : members(list(says.members)),
        changing(list(says.changing)),
        current(value(says.current)),
        proposed(value(says.proposed)) {
    proposal.gs_phase_info = {says.phases, says.phase};
    proposal.gs_proposed_by = says.by;
    proposal.gs_whats_changed = static_cast<wyx_whats_changed_t>(says.changed);
    if (!says.members.empty()) proposal.gs_current_providers = &members;
    if (!says.current.empty()) proposal.gs_current_state_value = &current;
    if (!says.proposed.empty()) proposal.gs_proposed_state_value = &proposed;
  }
  static wyx_membership_t list(const std::vector<wyx_provider_t>& ids) {
    return {static_cast<unsigned>(ids.size()), const_cast<wyx_provider_t*>(ids.data())};
  }
  static wyx_state_value_t value(const std::string& text) {
    return {static_cast<int>(text.size()), const_cast<char*>(text.data())};
  }
  wyx_membership_t members, changing;
  wyx_state_value_t current, proposed;
  wyx_proposal_t proposal = {};
};

inline void approve(wyx_request_t protocol, const Says& s = {}) {
  Records r(s);
  const auto what = WYX_APPROVED_NOTIFICATION;
  const wyx_approved_notification_t n = {what, s.to, protocol, WYX_EXPLICIT_APPROVE, &r.proposal, 1};
  GSController::stub_approvedCb(&n);
}

inline void reject(wyx_request_t protocol, const Says& s = {}) {
  Records r(s);
  const auto what = WYX_REJECTED_NOTIFICATION;
  const wyx_rejected_notification_t n = {what, s.to, protocol, WYX_EXPLICIT_REJECT, &r.proposal, 1};
  GSController::stub_rejectedCb(&n);
}

inline void phase(wyx_request_t protocol, const Says& s = {}) {
  Records r(s);
  const auto what = WYX_N_PHASE_NOTIFICATION;
  const wyx_n_phase_notification_t n = {what, s.to, protocol, WYX_EXPLICIT_APPROVE, 30, &r.proposal, 1};
  GSController::stub_nPhaseCb(&n);
}

inline void subscription(int type, const Says& s = {}) {
  Records r(s);
  wyx_subscription_notification_t n = {};
  n.gs_notification_type = WYX_SUBSCRIPTION_NOTIFICATION;
  n.gs_subscriber_token = s.to;
  n.gs_subscription_type = static_cast<wyx_subscription_type_t>(type);
  n.gs_state_value = r.proposal.gs_current_state_value;
  n.gs_full_membership = &r.members;
  n.gs_changing_membership = &r.changing;
  GSController::stub_subscribeCb(&n);
}

inline void announce(int summary, wyx_token_t to = kToken) {
  const auto code = static_cast<wyx_summary_code_t>(summary);
  const wyx_announcement_notification_t n = {WYX_ANNOUNCEMENT_NOTIFICATION, to, code, nullptr};
  GSController::stub_announcementCb(&n);
}

inline void merge(wyx_token_t to = kToken) {
  wyx_merge_notification_t n = {};
  n.gs_provider_token = to;
  GSController::stub_mergeCb(&n);
}

inline void delayedError(wyx_request_t protocol, wyx_rc_t rc, wyx_token_t to = kToken) {
  const wyx_delayed_error_notification_t n = {WYX_DELAYED_ERROR_NOTIFICATION, to, protocol, rc, nullptr, nullptr};
  GSController::stub_delayedErrorCb(&n);
}

/// Bring a client where most notifications find it.
inline void joined(GSProvider& provider) {
  provider.joinGroup();
  approve(WYX_JOIN, {.changed = WYX_UPDATED_MEMBERSHIP, .members = {kOwn}, .to = provider.getToken()});
}
inline void subscribed(GSSubscriber& subscriber) {
  subscriber.subscribeGroup();
  subscription(WYX_SUBSCRIPTION_MEMBERSHIP, {.to = subscriber.getToken()});
}

/// A provider and a subscriber of the group "g".
class ClientTest : public testing::Test {
 public:
  ~ClientTest() override { api.watch(nullptr); }

  RecordingApi api;
  GSController controller;
  Member member{"g", 3, nullptr};
  Watcher watcher{"g", WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP};
};

}  // namespace recording

#endif
