#include "client/records.h"

namespace gs::client {
namespace {

// The records have no const pointers, but a callback only reads what they point at.
char* borrow(const std::string& bytes) { return const_cast<char*>(bytes.data()); }

int length_of(const std::string& bytes) { return static_cast<int>(bytes.size()); }

wyx_provider_t to_record(ProviderId id) {
  wyx_provider_t record{};
  record._gs_provider_info._gs_instance_number = id.instance;
  record._gs_provider_info._gs_node_number = id.node;
  return record;
}

template <typename Record, typename Request>
void set_terms(Record& record, const Request& request) {
  record.gs_num_phases = request.terms.num_phases;
  record.gs_time_limit = request.terms.time_limit;
}

}  // namespace

const wyx_n_phase_notification_t* Records::n_phase(Token token, const ProtocolNotification& n) {
  n_phase_ = {
      n.type,  token, n.protocol, static_cast<wyx_summary_code_t>(n.summary), n.time_limit, proposal(n.proposal),
      n.seqnum};
  return &n_phase_;
}

const wyx_approved_notification_t* Records::approved(Token token, const ProtocolNotification& n) {
  const auto summary = static_cast<wyx_summary_code_t>(n.summary);
  approved_ = {n.type, token, n.protocol, summary, proposal(n.proposal), n.seqnum};
  return &approved_;
}

const wyx_rejected_notification_t* Records::rejected(Token token, const ProtocolNotification& n) {
  const auto summary = static_cast<wyx_summary_code_t>(n.summary);
  rejected_ = {n.type, token, n.protocol, summary, proposal(n.proposal), n.seqnum};
  return &rejected_;
}

const wyx_announcement_notification_t* Records::announcement(Token token, const AnnouncementNotification& n) {
  announcement_ = {WYX_ANNOUNCEMENT_NOTIFICATION, token, static_cast<wyx_summary_code_t>(n.summary),
                   fill(current_, n.providers)};
  return &announcement_;
}

const wyx_subscription_notification_t* Records::subscription(Token token, const SubscriptionNotification& n) {
  subscription_ = {};
  subscription_.gs_notification_type = WYX_SUBSCRIPTION_NOTIFICATION;
  subscription_.gs_subscriber_token = token;
  subscription_.gs_subscription_type = static_cast<wyx_subscription_type_t>(n.type);
  subscription_.gs_state_value = fill(current_state_, n.state);
  subscription_.gs_full_membership = fill(current_, n.full_membership);
  subscription_.gs_changing_membership = fill(changing_, n.changing_membership);
  subscription_.gs_leave_codes = leave_codes(n.leave_codes);
  subscription_.gs_event_seqnum = n.seqnum;
  return &subscription_;
}

const wyx_delayed_error_notification_t* Records::delayed_error(Token token, const DelayedErrorNotification& n,
                                                               const Client& client) {
  delayed_error_ = {WYX_DELAYED_ERROR_NOTIFICATION,
                    token,
                    n.protocol,
                    n.rc,
                    failing_request(n.failing_request, client),
                    n.group_attributes ? fill(old_attributes_, *n.group_attributes) : nullptr};
  return &delayed_error_;
}

const wyx_responsiveness_notification_t* Records::ping(const wyx_responsiveness_t& settings) {
  ping_ = {WYX_RESPONSIVENESS_NOTIFICATION, settings};
  return &ping_;
}

const wyx_domain_control_notification_t* Records::domain(const DomainNotification& n) {
  domain_ = {};
  domain_.notification_type = WYX_DOMAIN_NOTIFICATION;
  std::visit([this](const auto& what) { set(what); }, n);
  return &domain_;
}

void Records::set(const NodesNotification& n) {
  domain_.domain_event_type = WYX_DOMAIN_NODE_CONFIG;
  domain_.info.nodes = {fill(current_nodes_, n.current), fill(added_nodes_, n.added),
                        fill(removed_nodes_, n.removed)};
}

void Records::set(const MasterNotification& n) {
  domain_.domain_event_type = WYX_DOMAIN_MASTER_NODE;
  domain_.info.domain_master_info = {n.master.number, n.master.epoch, n.size};
}

void Records::set(const QuorumNotification& n) {
  domain_.domain_event_type = WYX_OPQUORUM_INFO;
  domain_.info.quorum_val = {n.sequence, n.before, n.now, n.seqnum};
}

void Records::set(const QuorumErrorNotification& n) {
  domain_.domain_event_type = WYX_DOMAINCB_RESP_ERR_INFO;
  auto& error = domain_.info.domaincb_resp_err;
  error.domain_event_type = WYX_OPQUORUM_INFO;
  error.err_info.quorum_resp_err = {{n.sequence, nullptr}, n.rc};
}

wyx_proposal_t* Records::proposal(const Proposal& p) {
  if (built_ == &p) return &proposal_;
  built_ = source_ ? &p : nullptr;
  proposal_ = {};
  proposal_.gs_phase_info = {p.num_phases, p.phase};
  proposal_.gs_proposed_by = to_record(p.proposed_by);
  proposal_.gs_whats_changed = static_cast<wyx_whats_changed_t>(p.whats_changed);
  proposal_.gs_current_providers = fill(current_, p.current_providers);
  proposal_.gs_changing_providers = fill(changing_, p.changing_providers);
  if (p.leave_codes) {
    leave_info_ = {static_cast<unsigned>(p.leave_codes->size()), leave_codes(p.leave_codes)};
    proposal_.gs_leave_info = &leave_info_;
  }
  if (p.expel_info) {
    expel_info_ = {p.expel_info->deactivate_phase, length_of(p.expel_info->flag), borrow(p.expel_info->flag)};
    proposal_.gs_expel_info = &expel_info_;
  }
  proposal_.gs_current_state_value = fill(current_state_, p.current_state);
  proposal_.gs_proposed_state_value = fill(proposed_state_, p.proposed_state);
  if (p.message) {
    message_ = {length_of(*p.message), borrow(*p.message)};
    proposal_.gs_provider_message = &message_;
  }
  if (p.new_attributes) proposal_.gs_new_group_attributes = fill(attributes_, *p.new_attributes);
  proposal_.gs_current_vote_results = fill(current_votes_, p.current_vote_results);
  proposal_.gs_changing_vote_results = fill(changing_votes_, p.changing_vote_results);
  return &proposal_;
}

wyx_leave_code_entry_t* Records::leave_codes(const SharedLeaveCodes& codes) {
  if (!codes) return nullptr;
  leave_codes_.clear();
  for (const LeaveCode& code : *codes) leave_codes_.push_back({code.voluntary_or_failure, code.voluntary_code});
  return leave_codes_.data();
}

namespace {

void put(wyx_proposal_info_t& info, const StateChangeRequest& r) {
  auto& record = info._gs_protocol_info._gs_state_change_request;
  set_terms(record, r);
  record.gs_new_state = {length_of(r.new_state), borrow(r.new_state)};
}

void put(wyx_proposal_info_t& info, const MessageRequest& r) {
  auto& record = info._gs_protocol_info._gs_message_request;
  set_terms(record, r);
  record.gs_message = {length_of(r.message), borrow(r.message)};
}

void put(wyx_proposal_info_t& info, const LeaveRequest& r) {
  auto& record = info._gs_protocol_info._gs_leave_request;
  set_terms(record, r);
  record.gs_leave_code = r.leave_code;
}

void put(wyx_proposal_info_t& info, const ExpelRequest& r, wyx_membership_t* expelled) {
  auto& record = info._gs_protocol_info._gs_expel_request;
  set_terms(record, r);
  record.gs_expel_list = *expelled;
  record.gs_deactivate_phase = r.deactivate_phase;
  record.gs_deactivate_flag = borrow(r.deactivate_flag);
}

void put(wyx_proposal_info_t& info, const AttributeChangeRequest& r, wyx_group_attributes_t* attributes) {
  auto& record = info._gs_protocol_info._gs_attribute_change_request;
  set_terms(record, r);
  record.gs_group_attributes = attributes;
}

void put(wyx_proposal_info_t& info, const JoinRequest& r, wyx_group_attributes_t* attributes,
         const Client& client) {
  info._gs_protocol_info._gs_join_request = {attributes,          r.instance,      borrow(r.local_name),
                                             client.n_phase,      client.approved, client.rejected,
                                             client.announcement, client.merge};
}

void put(wyx_proposal_info_t& info, const SubscribeRequest& r, const Client& client) {
  info._gs_protocol_info._gs_subscribe_request = {static_cast<wyx_subscription_ctrl_t>(r.control),
                                                  borrow(r.group_name), client.subscription};
}

}  // namespace

/// Null for the requests that have no record: vote, goodbye, unsubscribe.
wyx_proposal_info_t* Records::failing_request(const Request& request, const Client& client) {
  failing_request_ = {};
  wyx_proposal_info_t& info = failing_request_;
  if (const auto* join = std::get_if<JoinRequest>(&request)) {
    put(info, *join, fill(attributes_, join->attributes), client);
  } else if (const auto* state = std::get_if<StateChangeRequest>(&request)) {
    put(info, *state);
  } else if (const auto* message = std::get_if<MessageRequest>(&request)) {
    put(info, *message);
  } else if (const auto* leave = std::get_if<LeaveRequest>(&request)) {
    put(info, *leave);
  } else if (const auto* expel = std::get_if<ExpelRequest>(&request)) {
    put(info, *expel, fill(changing_, expel->expelled));
  } else if (const auto* change = std::get_if<AttributeChangeRequest>(&request)) {
    put(info, *change, fill(attributes_, change->attributes));
  } else if (const auto* subscribe = std::get_if<SubscribeRequest>(&request)) {
    put(info, *subscribe, client);
  } else {
    return nullptr;
  }
  return &info;
}

wyx_membership_t* Records::fill(ProviderArray& storage, const Membership& members) {
  storage.providers.clear();
  for (const ProviderId id : members) storage.providers.push_back(to_record(id));
  storage.record = {static_cast<unsigned>(members.size()), storage.providers.data()};
  return &storage.record;
}

wyx_membership_t* Records::fill(ProviderArray& storage, const SharedMembership& members) {
  return members ? fill(storage, *members) : nullptr;
}

wyx_node_list_t* Records::fill(NodeArray& storage, const DomainNodes& nodes) {
  storage.nodes.clear();
  for (const DomainNode& node : nodes)
    storage.nodes.push_back({static_cast<std::int32_t>(node.number), node.epoch, node.number});
  storage.record = {static_cast<unsigned>(nodes.size()), storage.nodes.data()};
  return &storage.record;
}

wyx_state_value_t* Records::fill(wyx_state_value_t& record, const SharedBytes& bytes) {
  if (!bytes) return nullptr;
  record = {length_of(*bytes), borrow(*bytes)};
  return &record;
}

wyx_group_attributes_t* Records::fill(wyx_group_attributes_t& record, const GroupAttributes& attributes) {
  record = {};
  record.gs_sizeof_group_attributes = sizeof(record);
  record.gs_client_version = attributes.client_version;
  record.gs_batch_control = attributes.batch_control;
  record.gs_num_phases = attributes.num_phases;
  record.gs_source_reflection_num_phases = attributes.source_reflection_num_phases;
  record.gs_group_default_vote = attributes.default_vote;
  record.gs_merge_control = attributes.merge_control;
  record.gs_time_limit = attributes.time_limit;
  record.gs_source_reflection_time_limit = attributes.source_reflection_time_limit;
  record.gs_group_name = borrow(attributes.group_name);
  record.gs_source_group_name = borrow(attributes.source_group_name);
  return &record;
}

wyx_vote_results_t* Records::fill(VoteResults& storage, const SharedVoteResults& votes) {
  if (!votes) return nullptr;
  // Sized once: the records point at one another.
  storage.results.assign(votes->size(), {});
  storage.states.assign(votes->size(), {});
  storage.messages.assign(votes->size(), {});
  storage.pointers.clear();
  for (std::size_t i = 0; i < votes->size(); ++i) {
    const VoteResult& vote = (*votes)[i];
    wyx_vote_result_t& result = storage.results[i];
    result.gs_voter = to_record(vote.voter);
    result.gs_vote_value = vote.vote;
    result.gs_summary_code = static_cast<wyx_summary_code_t>(vote.summary);
    result.gs_leave_code = static_cast<wyx_leave_code_t>(vote.leave_code);
    if (vote.proposed_state) {
      storage.states[i] = {length_of(*vote.proposed_state), borrow(*vote.proposed_state)};
      result.gs_proposed_state_value = &storage.states[i];
    }
    if (vote.message) {
      storage.messages[i] = {length_of(*vote.message), borrow(*vote.message)};
      result.gs_provider_message = &storage.messages[i];
    }
    storage.pointers.push_back(&result);
  }
  storage.record = {static_cast<unsigned>(votes->size()), storage.pointers.data()};
  return &storage.record;
}

}  // namespace gs::client
