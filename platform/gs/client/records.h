// The base API's records for one callback, built from the engine's values.
#pragma once

#include <vector>

#include "client/registry.h"

namespace gs::client {

/// Keeps the storage behind the records of one callback and uses it again for the next: what a function returns
/// lives until the next call, and no longer than the notification that it was built from, into whose bytes it
/// points. A part that the notification does not carry is a null pointer. One thread at a time.
class Records {
 public:
  /// What the following calls get their values from: what was built from it already is used again. Null: nothing.
  void begin(std::shared_ptr<const Notification> source) {
    if (source == source_) return;
    source_ = std::move(source);
    built_ = nullptr;
  }

  const wyx_n_phase_notification_t* n_phase(Token token, const ProtocolNotification& n);
  const wyx_approved_notification_t* approved(Token token, const ProtocolNotification& n);
  const wyx_rejected_notification_t* rejected(Token token, const ProtocolNotification& n);
  const wyx_announcement_notification_t* announcement(Token token, const AnnouncementNotification& n);
  const wyx_subscription_notification_t* subscription(Token token, const SubscriptionNotification& n);
  /// `client` gives back the routines that its join or subscribe request named.
  const wyx_delayed_error_notification_t* delayed_error(Token token, const DelayedErrorNotification& n,
                                                        const Client& client);
  const wyx_responsiveness_notification_t* ping(const wyx_responsiveness_t& settings);
  const wyx_domain_control_notification_t* domain(const DomainNotification& n);

 private:
  struct ProviderArray {
    std::vector<wyx_provider_t> providers;
    wyx_membership_t record;
  };
  struct VoteResults {
    std::vector<wyx_vote_result_t> results;
    std::vector<wyx_state_value_t> states;
    std::vector<wyx_provider_message_t> messages;
    std::vector<wyx_vote_result_ptr_t> pointers;
    wyx_vote_results_t record;
  };

  struct NodeArray {
    std::vector<wyx_node_info_t> nodes;
    wyx_node_list_t record;
  };

  void set(const NodesNotification& n);
  void set(const MasterNotification& n);
  void set(const QuorumNotification& n);
  void set(const QuorumErrorNotification& n);
  wyx_proposal_t* proposal(const Proposal& p);
  wyx_leave_code_entry_t* leave_codes(const SharedLeaveCodes& codes);
  wyx_proposal_info_t* failing_request(const Request& request, const Client& client);

  static wyx_membership_t* fill(ProviderArray& storage, const Membership& members);
  static wyx_membership_t* fill(ProviderArray& storage, const SharedMembership& members);
  static wyx_node_list_t* fill(NodeArray& storage, const DomainNodes& nodes);
  static wyx_state_value_t* fill(wyx_state_value_t& record, const SharedBytes& bytes);
  static wyx_group_attributes_t* fill(wyx_group_attributes_t& record, const GroupAttributes& attributes);
  static wyx_vote_results_t* fill(VoteResults& storage, const SharedVoteResults& votes);

  std::shared_ptr<const Notification> source_;
  const Proposal* built_ = nullptr;  // of source_: proposal_ was built from it

  wyx_n_phase_notification_t n_phase_;
  wyx_approved_notification_t approved_;
  wyx_rejected_notification_t rejected_;
  wyx_announcement_notification_t announcement_;
  wyx_subscription_notification_t subscription_;
  wyx_delayed_error_notification_t delayed_error_;
  wyx_responsiveness_notification_t ping_;
  wyx_domain_control_notification_t domain_;

  wyx_proposal_t proposal_;
  wyx_proposal_info_t failing_request_;
  ProviderArray current_;
  ProviderArray changing_;
  NodeArray current_nodes_;
  NodeArray added_nodes_;
  NodeArray removed_nodes_;
  std::vector<wyx_leave_code_entry_t> leave_codes_;
  wyx_leave_info_t leave_info_;
  wyx_expel_info_t expel_info_;
  wyx_state_value_t current_state_;
  wyx_state_value_t proposed_state_;
  wyx_provider_message_t message_;
  wyx_group_attributes_t attributes_;
  wyx_group_attributes_t old_attributes_;
  VoteResults current_votes_;
  VoteResults changing_votes_;
};

}  // namespace gs::client
