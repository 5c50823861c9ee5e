// Session and requests.

#include <climits>
#include <cstdarg>
#include <cstring>

#include "client/arguments.h"
#include "client/entry.h"
#include "client/wyx_entry_points.h"

namespace gs::client {
namespace {

constexpr int kArgumentsWithoutDomainControl = 7;
constexpr int kArgumentsWithDomainControl = 8;

Client provider_of(const wyx_join_request_t& record, ProviderId id) {
  Client client;
  client.kind = Client::Kind::kProvider;
  client.n_phase = record.gs_n_phase_protocol_callback;
  client.approved = record.gs_protocol_approved_callback;
  client.rejected = record.gs_protocol_rejected_callback;
  client.announcement = record.gs_announcement_callback;
  client.merge = record.gs_merge_callback;
  client.id = id;
  return client;
}

Client subscriber_of(const wyx_subscribe_request_t& record) {
  Client client;
  client.kind = Client::Kind::kSubscriber;
  client.subscription = record.gs_subscription_callback;
  return client;
}

/// A request of a provider whose record `read` turns into a T.
template <typename T>
wyx_rc_t propose(wyx_token_t token, const wyx_proposal_info_t* info,
                 wyx_rc_t (*read)(const wyx_proposal_info_t*, T*)) {
  return client_entry(token, Client::Kind::kProvider, [&](Session& session) {
    T request;
    request.token = token;
    const wyx_rc_t rc = read(info, &request);
    return rc == WYX_OK ? session.call(std::move(request)) : rc;
  });
}

}  // namespace
}  // namespace gs::client

using namespace gs;
using namespace gs::client;

wyx_rc_t wyx_setup(int version, int count, wyx_descriptor_t* descriptor, wyx_socket_ctrl_t socket_control,
                   const wyx_responsiveness_t* responsiveness, const char* deactivate_path,
                   wyx_responsiveness_cb_t* responsiveness_routine, wyx_delayed_error_cb_t* delayed_error_routine,
                   wyx_query_cb_t* query_routine, ...) {
  wyx_domain_control_cb_t* domain_control_routine = nullptr;
  if (count == kArgumentsWithDomainControl) {
    va_list rest;
    va_start(rest, query_routine);
    domain_control_routine = va_arg(rest, wyx_domain_control_cb_t*);
    va_end(rest);
  }
  return entry([&] {
    if (version < 1 || descriptor == nullptr) return WYX_BAD_PARAMETER;
    if (count != kArgumentsWithoutDomainControl && count != kArgumentsWithDomainControl) return WYX_BAD_PARAMETER;
    if (deactivate_path != nullptr && strnlen(deactivate_path, PATH_MAX) == PATH_MAX) return WYX_NAME_TOO_LONG;
    SetupOptions options;
    options.api_version = static_cast<std::uint32_t>(version);
    options.socket_control = socket_control;
    if (responsiveness != nullptr) options.responsiveness = *responsiveness;
    options.routines = {responsiveness_routine, delayed_error_routine, domain_control_routine};
    return open_session(options, descriptor);
  });
}

wyx_rc_t wyx_quit() { return entry(quit_session); }

wyx_rc_t wyx_dispatch(wyx_dispatch_flag_t flag) {
  if (flag != WYX_NON_BLOCKING && flag != WYX_BLOCKING) return WYX_BAD_PARAMETER;
  EntryGuard guard;  // what a callback throws is not the library's to catch
  const auto session = current_session();
  return session ? session->dispatch(flag == WYX_BLOCKING, guard.cancel_state()) : WYX_NO_INIT;
}

wyx_rc_t wyx_change_responsiveness(const wyx_responsiveness_t* settings) {
  return session_entry([&](Session& session) {
    return settings == nullptr ? WYX_BAD_PARAMETER : session.set_responsiveness(*settings);
  });
}

wyx_rc_t wyx_join(wyx_token_t* token, const wyx_proposal_info_t* info) {
  return session_entry([&](Session& session) {
    JoinRequest request;
    const wyx_rc_t rc = token == nullptr ? WYX_BAD_PARAMETER : read_join(info, &request);
    if (rc != WYX_OK) return rc;
    const ProviderId id = {request.instance, static_cast<std::int16_t>(session.node_number())};
    return session.enter(provider_of(info->_gs_protocol_info._gs_join_request, id), std::move(request), token);
  });
}

wyx_rc_t wyx_change_state_value(wyx_token_t token, const wyx_proposal_info_t* info) {
  return propose<StateChangeRequest>(token, info, read_state_change);
}

wyx_rc_t wyx_send_message(wyx_token_t token, const wyx_proposal_info_t* info) {
  return propose<MessageRequest>(token, info, read_message);
}

wyx_rc_t wyx_leave(wyx_token_t token, const wyx_proposal_info_t* info) {
  return propose<LeaveRequest>(token, info, read_leave);
}

wyx_rc_t wyx_expel(wyx_token_t token, const wyx_proposal_info_t* info) {
  return propose<ExpelRequest>(token, info, read_expel);
}

wyx_rc_t wyx_change_attributes(wyx_token_t token, const wyx_proposal_info_t* info) {
  return propose<AttributeChangeRequest>(token, info, read_attribute_change);
}

wyx_rc_t wyx_goodbye(wyx_token_t token) {
  return client_entry(token, Client::Kind::kProvider,
                      [&](Session& session) { return session.depart(token, GoodbyeRequest{token}); });
}

wyx_rc_t wyx_vote(wyx_token_t token, wyx_vote_value_t vote, const wyx_state_value_t* proposed_state,
                  const wyx_provider_message_t* message, wyx_vote_value_t default_vote) {
  return client_entry(token, Client::Kind::kProvider, [&](Session& session) {
    VoteRequest request;
    request.token = token;
    const wyx_rc_t rc = read_vote(vote, proposed_state, message, default_vote, &request);
    return rc == WYX_OK ? session.call(std::move(request)) : rc;
  });
}

wyx_rc_t wyx_subscribe(wyx_token_t* token, const wyx_proposal_info_t* info) {
  return session_entry([&](Session& session) {
    SubscribeRequest request;
    const wyx_rc_t rc = token == nullptr ? WYX_BAD_PARAMETER : read_subscribe(info, &request);
    if (rc != WYX_OK) return rc;
    const Client client = subscriber_of(info->_gs_protocol_info._gs_subscribe_request);
    return session.enter(client, std::move(request), token);
  });
}

wyx_rc_t wyx_unsubscribe(wyx_token_t token) {
  return client_entry(token, Client::Kind::kSubscriber,
                      [&](Session& session) { return session.depart(token, UnsubscribeRequest{token}); });
}
