#include "fake_daemon.h"

namespace fake_daemon {

namespace {

FakeDaemon* the_daemon = nullptr;

char state_text[] = "a state value of sixty-four bytes, as long as a usual one is ...";

}  // namespace

FakeDaemon::FakeDaemon() : table_before_(GSAPIRtns) {
  the_daemon = this;
  clients_.reserve(1 << 16);
  queue_.reserve(1 << 16);
  table_.wyx_join = [](wyx_token_t* t, const wyx_proposal_info_t* p) { return enter(t, p, true); };
  table_.wyx_subscribe = [](wyx_token_t* t, const wyx_proposal_info_t* p) { return enter(t, p, false); };
  table_.wyx_change_state_value = [](wyx_token_t t, const wyx_proposal_info_t*) {
    return propose(t, WYX_STATE_VALUE_CHANGE);
  };
  table_.wyx_send_message = [](wyx_token_t t, const wyx_proposal_info_t*) {
    return propose(t, WYX_PROVIDER_MESSAGE);
  };
  table_.wyx_leave = [](wyx_token_t t, const wyx_proposal_info_t*) { return propose(t, WYX_LEAVE); };
  table_.wyx_goodbye = leave;
  table_.wyx_unsubscribe = leave;
  table_.wyx_vote = [](wyx_token_t, wyx_vote_value_t, const wyx_state_value_t*, const wyx_provider_message_t*,
                       wyx_vote_value_t) { return WYX_OK; };
  table_.wyx_dispatch = dispatch;
  GSAPIRtns = &table_;
}

FakeDaemon::~FakeDaemon() {
  GSAPIRtns = table_before_;
  the_daemon = nullptr;
}

wyx_rc_t FakeDaemon::enter(wyx_token_t* token, const wyx_proposal_info_t* proposal, bool join) {
  FakeDaemon& d = *the_daemon;
  std::lock_guard<std::mutex> lock(d.mutex_);
  *token = static_cast<wyx_token_t>(d.clients_.size());
  Client client = {};
  client.live = true;
  if (join) {
    client.join = proposal->_gs_protocol_info._gs_join_request;
    client.id = wyx_provider_t{{client.join.gs_provider_instance, 1}};
  } else {
    client.subscribed = proposal->_gs_protocol_info._gs_subscribe_request.gs_subscription_callback;
  }
  d.clients_.push_back(client);
  d.queue_.push_back({*token, join ? WYX_JOIN : WYX_SUBSCRIPTION});
  return WYX_OK;
}

wyx_rc_t FakeDaemon::propose(wyx_token_t token, wyx_request_t protocol) {
  FakeDaemon& d = *the_daemon;
  std::lock_guard<std::mutex> lock(d.mutex_);
  if (token < 0 || !d.clients_[token].live) return WYX_BAD_MEMBER_TOKEN;
  d.queue_.push_back({token, protocol});
  return WYX_OK;
}

wyx_rc_t FakeDaemon::leave(wyx_token_t token) {
  FakeDaemon& d = *the_daemon;
  std::lock_guard<std::mutex> lock(d.mutex_);
  if (token < 0 || !d.clients_[token].live) return WYX_BAD_MEMBER_TOKEN;
  d.clients_[token].live = false;
  return WYX_OK;
}

wyx_rc_t FakeDaemon::dispatch(wyx_dispatch_flag_t) {
  FakeDaemon& d = *the_daemon;
  Event event;
  Client client;
  {
    std::lock_guard<std::mutex> lock(d.mutex_);
    if (d.head_ == d.queue_.size()) {
      d.queue_.clear();
      d.head_ = 0;
      return WYX_NOT_OK;
    }
    event = d.queue_[d.head_++];
    client = d.clients_[event.token];
  }
  deliver(client, event);
  return WYX_OK;
}

void FakeDaemon::deliver(const Client& client, const Event& event) {
  wyx_provider_t ids[8] = {client.id};
  for (short i = 1; i < 8; ++i) ids[i] = wyx_provider_t{{i, 2}};
  wyx_membership_t members = {8, ids};
  wyx_state_value_t value = {sizeof state_text - 1, state_text};
  if (event.protocol == WYX_SUBSCRIPTION) {
    wyx_subscription_notification_t n = {};
    n.gs_notification_type = WYX_SUBSCRIPTION_NOTIFICATION;
    n.gs_subscriber_token = event.token;
    n.gs_subscription_type =
        static_cast<wyx_subscription_type_t>(WYX_SUBSCRIPTION_MEMBERSHIP | WYX_SUBSCRIPTION_STATE);
    n.gs_full_membership = &members;
    n.gs_state_value = &value;
    return client.subscribed(&n);
  }
  wyx_proposal_t proposal = {};
  proposal.gs_proposed_by = client.id;
  proposal.gs_whats_changed = WYX_UPDATED_MEMBERSHIP;
  proposal.gs_current_providers = &members;
  proposal.gs_current_state_value = &value;
  const wyx_approved_notification_t n = {WYX_APPROVED_NOTIFICATION, event.token, event.protocol,
                                         WYX_EXPLICIT_APPROVE,      &proposal,   1};
  client.join.gs_protocol_approved_callback(&n);
}

}  // namespace fake_daemon
