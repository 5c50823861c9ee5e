#include "recording_api.h"

#include <pthread.h>
#include <stdarg.h>
#include <stdio.h>

namespace recording {

namespace {

RecordingApi* the_api = nullptr;

RecordingApi& api() { return *the_api; }

std::string numbered(const char* name, wyx_token_t token) {
  return std::string(name) + "(" + std::to_string(token) + ")";
}

std::string lowHex(uintptr_t value) {
  char text[16];
  snprintf(text, sizeof text, "%x", static_cast<unsigned>(value));
  return text;
}

void replaceAll(std::string& text, const std::string& what, const char* with) {
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) {
    text.replace(at, what.size(), with);
  }
}

void captureTrace(int level, char* text) {
  const char channel = level == GSCL_TRC_API ? 'A' : level == GSCL_TRC_DETAIL ? 'D' : 'W';
  std::string line(text);
  if (!line.empty() && line.back() == '\n') {
    line.pop_back();
  } else {
    line += "<no line end>";
  }
  api().record(std::string(1, channel) + " " + line);
}

wyx_rc_t setUp(int version, int count, wyx_descriptor_t* fd, wyx_socket_ctrl_t socket,
               const wyx_responsiveness_t* responsiveness, const char* path,
               wyx_responsiveness_cb_t* responsiveness_cb, wyx_delayed_error_cb_t* error_cb,
               wyx_query_cb_t* query_cb, ...) {
  RecordingApi& a = api();
  a.setup = {version, count, socket, *responsiveness, path, responsiveness_cb, error_cb, query_cb, nullptr};
  va_list rest;
  va_start(rest, query_cb);
  if (count == 8) a.setup.domain_cb = va_arg(rest, void (*)(const wyx_domain_control_notification_t*));
  va_end(rest);
  *fd = a.descriptor;
  return a.enter("wyx_setup");
}

wyx_rc_t join(wyx_token_t* token, const wyx_proposal_info_t* proposal) {
  RecordingApi& a = api();
  a.proposal = *proposal;
  const wyx_join_request_t& request = proposal->_gs_protocol_info._gs_join_request;
  a.join_text = std::string(request.gs_group_attributes->gs_group_name) + "/" +
                std::to_string(request.gs_provider_instance) + "/" + request.gs_provider_local_name;
  const wyx_rc_t rc = a.enter(numbered("wyx_join", *token));
  *token = a.token;
  return rc;
}

wyx_rc_t subscribe(wyx_token_t* token, const wyx_proposal_info_t* proposal) {
  RecordingApi& a = api();
  a.proposal = *proposal;
  a.subscribed_group = proposal->_gs_protocol_info._gs_subscribe_request.gs_subscription_group;
  const wyx_rc_t rc = a.enter(numbered("wyx_subscribe", *token));
  *token = a.token;
  return rc;
}

// The proposal of a caller may be filled in part only; copying it all would read what was never written.
template <class Request>
wyx_rc_t propose(const char* name, wyx_token_t token, const Request& request) {
  reinterpret_cast<Request&>(api().proposal) = request;
  return api().enter(numbered(name, token));
}

}  // namespace

RecordingApi& RecordingApi::current() { return api(); }

RecordingApi::RecordingApi(int level) : table(), table_before_(GSAPIRtns) {
  the_api = this;
  table.wyx_setup = setUp;
  table.wyx_join = join;
  table.wyx_subscribe = subscribe;
  table.wyx_quit = [] { return api().enter("wyx_quit"); };
  table.wyx_dispatch = [](wyx_dispatch_flag_t flag) { return api().enter(numbered("wyx_dispatch", flag)); };
  table.wyx_change_state_value = [](wyx_token_t t, const wyx_proposal_info_t* p) {
    return propose("wyx_change_state_value", t, p->_gs_protocol_info._gs_state_change_request);
  };
  table.wyx_send_message = [](wyx_token_t t, const wyx_proposal_info_t* p) {
    return propose("wyx_send_message", t, p->_gs_protocol_info._gs_message_request);
  };
  table.wyx_leave = [](wyx_token_t t, const wyx_proposal_info_t* p) {
    return propose("wyx_leave", t, p->_gs_protocol_info._gs_leave_request);
  };
  table.wyx_expel = [](wyx_token_t t, const wyx_proposal_info_t* p) {
    return propose("wyx_expel", t, p->_gs_protocol_info._gs_expel_request);
  };
  table.wyx_change_attributes = [](wyx_token_t t, const wyx_proposal_info_t* p) {
    return propose("wyx_change_attributes", t, p->_gs_protocol_info._gs_attribute_change_request);
  };
  table.wyx_goodbye = [](wyx_token_t t) { return api().enter(numbered("wyx_goodbye", t)); };
  table.wyx_unsubscribe = [](wyx_token_t t) { return api().enter(numbered("wyx_unsubscribe", t)); };
  table.wyx_vote = [](wyx_token_t t, wyx_vote_value_t vote, const wyx_state_value_t* value,
                      const wyx_provider_message_t* message, wyx_vote_value_t default_vote) {
    return api().enter("wyx_vote(" + std::to_string(t) + ", " + std::to_string(vote) + ", " +
                       (value == nullptr ? "null" : std::string(value->gs_state, value->gs_length)) + ", " +
                       (message == nullptr ? "null" : std::string(message->gs_message, message->gs_length)) +
                       ", " + std::to_string(default_vote) + ")");
  };
  table.wyx_change_responsiveness = [](const wyx_responsiveness_t* r) {
    api().responsiveness = *r;
    return api().enter("wyx_change_responsiveness");
  };
  GSAPIRtns = &table;
  routine_before_ = GSSetTraceRtn(captureTrace);
  GSSetDebugLevel(level);
}

RecordingApi::~RecordingApi() {
  GSSetDebugLevel(0);
  GSSetTraceRtn(routine_before_);
  GSAPIRtns = table_before_;
  the_api = nullptr;
}

void RecordingApi::record(const std::string& what) {
  std::string text = what;
  std::string prefix;
  if (watched_ != nullptr) {
    replaceAll(text, lowHex(reinterpret_cast<uintptr_t>(watched_)), "@");
    prefix = std::string(zelt_gscl::gscl_GSClientStateName(watched_->getClientState())).substr(7) + "/" +
             std::to_string(watched_->getToken()) + " ";
  }
  replaceAll(text, lowHex(pthread_self()), "#");
  std::lock_guard<std::mutex> lock(mutex_);
  events_.push_back(prefix + text);
}

std::vector<std::string> RecordingApi::take() {
  std::lock_guard<std::mutex> lock(mutex_);
  return std::move(events_);
}

wyx_rc_t RecordingApi::enter(const std::string& call) {
  record(call);
  if (auto act = during) act();
  return answer;
}

wyx_provider_t ownId() { return wyx_provider_t{{3, 7}}; }
wyx_provider_t otherId() { return wyx_provider_t{{4, 8}}; }

Proposal::Proposal(wyx_provider_t by, int changed) {
  record.gs_proposed_by = by;
  record.gs_whats_changed = static_cast<wyx_whats_changed_t>(changed);
  record.gs_phase_info = {1, 1};
}

void Proposal::current(std::string value) {
  current_text_ = std::move(value);
  current_ = {static_cast<int>(current_text_.size()), current_text_.data()};
  record.gs_current_state_value = &current_;
}

void Proposal::proposed(std::string value) {
  proposed_text_ = std::move(value);
  proposed_ = {static_cast<int>(proposed_text_.size()), proposed_text_.data()};
  record.gs_proposed_state_value = &proposed_;
}

void Proposal::members(std::vector<wyx_provider_t> ids) {
  ids_ = std::move(ids);
  members_ = {static_cast<unsigned>(ids_.size()), ids_.data()};
  record.gs_current_providers = &members_;
}

wyx_approved_notification_t Proposal::approved(wyx_request_t protocol, wyx_token_t to) {
  return {WYX_APPROVED_NOTIFICATION, to, protocol, WYX_EXPLICIT_APPROVE, &record, 1};
}

wyx_rejected_notification_t Proposal::rejected(wyx_request_t protocol, wyx_token_t to) {
  return {WYX_REJECTED_NOTIFICATION, to, protocol, WYX_EXPLICIT_REJECT, &record, 1};
}

wyx_n_phase_notification_t Proposal::phase(wyx_request_t protocol, unsigned short number, unsigned short phases,
                                           wyx_token_t to) {
  record.gs_phase_info = {phases, number};
  return {WYX_N_PHASE_NOTIFICATION, to, protocol, WYX_EXPLICIT_APPROVE, 30, &record, 1};
}

wyx_announcement_notification_t announcement(int summary) {
  return {WYX_ANNOUNCEMENT_NOTIFICATION, kToken, static_cast<wyx_summary_code_t>(summary), nullptr};
}

wyx_subscription_notification_t subscription(int type) {
  wyx_subscription_notification_t n = {};
  n.gs_notification_type = WYX_SUBSCRIPTION_NOTIFICATION;
  n.gs_subscriber_token = kToken;
  n.gs_subscription_type = static_cast<wyx_subscription_type_t>(type);
  return n;
}

wyx_delayed_error_notification_t delayedError(wyx_request_t protocol, wyx_rc_t rc) {
  return {WYX_DELAYED_ERROR_NOTIFICATION, kToken, protocol, rc, nullptr, nullptr};
}

void joined(GSProvider& provider) {
  provider.joinGroup();
  Proposal proposal(ownId(), WYX_UPDATED_MEMBERSHIP);
  proposal.members({ownId()});
  const auto n = proposal.approved(WYX_JOIN, provider.getToken());
  GSController::stub_approvedCb(&n);
  RecordingApi::current().take();
}

void subscribed(GSSubscriber& subscriber) {
  subscriber.subscribeGroup();
  auto n = subscription(WYX_SUBSCRIPTION_MEMBERSHIP);
  n.gs_subscriber_token = subscriber.getToken();
  GSController::stub_subscribeCb(&n);
  RecordingApi::current().take();
}

std::string textOf(GSStateValue& value) {
  const wyx_state_value_t* held = value.getValue();
  return held == nullptr ? "" : std::string(held->gs_state, held->gs_length);
}

std::string currentValue(GSClient& client) {
  GSStateValue value;
  client.getCurrentStateValue(value);
  return textOf(value);
}

std::string proposedValue(GSClient& client) {
  GSStateValue value;
  client.getProposedStateValue(value);
  return textOf(value);
}

}  // namespace recording
