// The requests of providers and subscribers.
//
// A request is traced, goes to the base API and is recorded on the client (token, state, protocol awaited) under
// the client's transaction lock, so that a notification that another thread routes meanwhile finds the record
// complete. Join and subscribe also hold the controller's write lock, taken first, because a look-up for the new
// token must wait until the client has it.
#include "gscl/GSControllerData_internal.h"
#include "gscl/GSProvider.h"
#include "gscl/GSSubscriber.h"
#include "gscl/GSTransaction_internal.h"
#include "gscl/base_api_internal.h"
#include "gscl/scopes_internal.h"
#include "gscl/trace_text_internal.h"

namespace zelt_gscl_V1 {

using gscl_internal::baseApi;
using gscl_internal::callBaseApi;
using gscl_internal::CancellationHold;
using Api = GSAPIRtnCollection;

namespace {

/// The current controller's write lock; nothing when there is no controller, and the base API then decides.
class RegistryHold {
 public:
  RegistryHold() : controller_(GSController::theController()) {
    if (controller_ != nullptr) controller_->WriteLock(nullptr);
  }
  ~RegistryHold() {
    if (controller_ != nullptr) controller_->WriteUnlock();
  }
  RegistryHold(const RegistryHold&) = delete;
  RegistryHold& operator=(const RegistryHold&) = delete;

 private:
  GSController* controller_;
};

}  // namespace

/// The two shapes that several requests share. A cancelled thread finishes its request first: what the daemon has
/// accepted is always recorded.
class GSRequest {
 public:
  /// Join and subscribe: the client gets a new token and waits in the state `pending` for its first notification.
  template <auto Entry>
  static wyx_rc_t enter(GSClient* client, const wyx_proposal_info_t* proposal, const char* name,
                        GSClientState pending, wyx_request_t protocol) {
    CancellationHold hold;
    wyx_token_t token = -1;
    client->eraseMembers();
    GS_TRACE(GSCL_TRC_API, "%s(%s) is issued\n", name, GSCL_ID(client));
    client->setToken(-1);
    const wyx_rc_t rc = [&] {
      RegistryHold registry;
      baseApi();
      GSTransaction transaction(client);
      const wyx_rc_t answer = callBaseApi<Entry>(&token, proposal);
      if (answer == WYX_OK) {
        client->setToken(token);
        client->setClientState(pending);
        client->setCurrentStateValue(nullptr);
        client->setProposedStateValue(nullptr);
        client->startProtocolRequested(protocol);
      } else {
        client->setClientState(zelt_gscl::GS_IAM_IDLE);
      }
      transaction.end();
      return answer;
    }();
    traceResult(client, name, rc);
    return rc;
  }

  /// A proposal of a member: when it is accepted, `protocol` is awaited.
  template <auto Entry>
  static wyx_rc_t propose(GSClient* client, const wyx_proposal_info_t* proposal, const char* name,
                          wyx_request_t protocol) {
    CancellationHold hold;
    GS_TRACE(GSCL_TRC_API, "%s(%s) is issued\n", name, GSCL_ID(client));
    baseApi();
    GSTransaction transaction(client);
    const wyx_rc_t rc = callBaseApi<Entry>(client->getToken(), proposal);
    if (rc == WYX_OK) client->startProtocolRequested(protocol);
    transaction.end();
    traceResult(client, name, rc);
    return rc;
  }

  static void traceResult(GSClient* client, const char* name, wyx_rc_t rc) {
    GS_TRACE(GSCL_TRC_API, "%s(%s) token=%d sync_rc=%s\n", name, GSCL_ID(client), client->getToken(),
             gscl_rc_name(rc));
  }
};

wyx_rc_t GSController::stub_join_group(GSProvider* provider, const wyx_proposal_info_t* proposal) {
  return GSRequest::enter<&Api::wyx_join>(provider, proposal, "stub_join_group", zelt_gscl::GS_IAM_JOINING,
                                          WYX_JOIN);
}

wyx_rc_t GSController::stub_subscribe_group(GSSubscriber* subscriber, const wyx_proposal_info_t* proposal) {
  return GSRequest::enter<&Api::wyx_subscribe>(subscriber, proposal, "stub_subscribe_group",
                                               zelt_gscl::GS_IAM_SUBSCRIBING, WYX_SUBSCRIPTION);
}

wyx_rc_t GSController::stub_unsubscribe_group(GSSubscriber* subscriber) {
  CancellationHold hold;
  const GSClientState state = subscriber->getClientState();
  if (state != zelt_gscl::GS_IAM_SUBSCRIBED && state != zelt_gscl::GS_IAM_SUBSCRIBING) {
    GS_TRACE(GSCL_TRC_API, "stub_unsubscribe_group(%s) cannot be issued because it is not subscribed.\n",
             GSCL_ID(subscriber));
    return WYX_BAD_MEMBER_TOKEN;
  }
  baseApi();
  GSTransaction transaction(subscriber);
  const wyx_rc_t rc = callBaseApi<&Api::wyx_unsubscribe>(subscriber->getToken());
  if (rc == WYX_OK) {
    subscriber->setClientState(zelt_gscl::GS_IAM_IDLE);
    subscriber->setToken(-1);
  }
  transaction.end();
  GS_TRACE(GSCL_TRC_API, "stub_unsubscribe_group(%s) returns sync_rc=%s\n", GSCL_ID(subscriber), gscl_rc_name(rc));
  return rc;
}

wyx_rc_t GSController::stub_change_state_value(GSProvider* provider, const wyx_proposal_info_t* proposal) {
  return GSRequest::propose<&Api::wyx_change_state_value>(provider, proposal, "stub_change_state_value",
                                                          WYX_STATE_VALUE_CHANGE);
}

wyx_rc_t GSController::stub_send_message(GSProvider* provider, const wyx_proposal_info_t* proposal) {
  return GSRequest::propose<&Api::wyx_send_message>(provider, proposal, "stub_send_message", WYX_PROVIDER_MESSAGE);
}

wyx_rc_t GSController::stub_leave(GSProvider* provider, const wyx_proposal_info_t* proposal) {
  return GSRequest::propose<&Api::wyx_leave>(provider, proposal, "stub_leave", WYX_LEAVE);
}

wyx_rc_t GSController::stub_expel(GSProvider* provider, const wyx_proposal_info_t* proposal) {
  return GSRequest::propose<&Api::wyx_expel>(provider, proposal, "stub_expel", WYX_EXPEL);
}

wyx_rc_t GSController::stub_change_attributes(GSProvider* provider, const wyx_proposal_info_t* proposal) {
  return GSRequest::propose<&Api::wyx_change_attributes>(provider, proposal, "stub_change_attributes",
                                                         WYX_GROUP_ATTRIBUTE_CHANGE);
}

wyx_rc_t GSController::stub_vote(GSProvider* provider, wyx_vote_value_t vote, const wyx_state_value_t* proposed,
                                 const wyx_provider_message_t* message, wyx_vote_value_t default_vote) {
  CancellationHold hold;
  GS_TRACE(GSCL_TRC_API, "stub_vote(%s) vote=%s defvote=%s issued\n", GSCL_ID(provider),
           gscl_vote_value_name(vote), gscl_vote_value_name(default_vote));
  const wyx_rc_t rc = callBaseApi<&Api::wyx_vote>(provider->getToken(), vote, proposed, message, default_vote);
  if (rc == WYX_OK) provider->setVoteIsSubmitted();
  GSRequest::traceResult(provider, "stub_vote", rc);
  return rc;
}

wyx_rc_t GSController::stub_goodbye_group(GSProvider* provider) {
  CancellationHold hold;
  const GSClientState state = provider->getClientState();
  if (state != zelt_gscl::GS_IAM_JOINED && state != zelt_gscl::GS_IAM_JOINING) {
    GS_TRACE(GSCL_TRC_API, "GSController::stub_goodbye_group(%s) not started, clientState=%s\n", GSCL_ID(provider),
             zelt_gscl::gscl_GSClientStateName(state));
    return WYX_BAD_MEMBER_TOKEN;
  }
  GS_TRACE(GSCL_TRC_API, "GSController::stub_goodbye_group(%s) is issued\n", GSCL_ID(provider));
  baseApi();
  GSTransaction transaction(provider);
  const wyx_rc_t rc = callBaseApi<&Api::wyx_goodbye>(provider->getToken());
  // A token that the daemon no longer knows is as good as given back.
  if (rc == WYX_OK || rc == WYX_BAD_MEMBER_TOKEN) {
    GS_TRACE(GSCL_TRC_API, "stub_goodbye_group(%s) token=%d sync_rc=%s, and removed\n", GSCL_ID(provider),
             provider->getToken(), gscl_rc_name(rc));
    provider->setToken(-1);
    provider->setClientState(zelt_gscl::GS_IAM_IDLE);
    provider->eraseMembers();
  } else {
    GSRequest::traceResult(provider, "stub_goodbye_group", rc);
  }
  transaction.end();
  return rc;
}

}  // namespace zelt_gscl_V1
