#include "engine/checks.h"

#include <algorithm>

namespace gs {
namespace {

bool valid_phases(wyx_num_phases_t phases) { return phases == WYX_1_PHASE || phases == WYX_N_PHASE; }

wyx_rc_t check_name(const std::string& name) {
  if (name.empty()) return WYX_BAD_PARAMETER;
  return name.size() > kMaxGroupName ? WYX_NAME_TOO_LONG : WYX_OK;
}

wyx_rc_t check_terms(const ProtocolTerms& terms) {
  return valid_phases(terms.num_phases) ? WYX_OK : WYX_BAD_PARAMETER;
}

wyx_rc_t check_length(const Bytes& bytes, std::size_t limit) {
  return bytes.size() > limit ? WYX_BAD_PARAMETER : WYX_OK;
}

wyx_rc_t first_wrong(std::initializer_list<wyx_rc_t> results) {
  for (wyx_rc_t rc : results)
    if (rc != WYX_OK) return rc;
  return WYX_OK;
}

bool has_duplicates(Membership ids) {
  std::sort(ids.begin(), ids.end());
  return std::adjacent_find(ids.begin(), ids.end()) != ids.end();
}

}  // namespace

wyx_rc_t check_attributes(const GroupAttributes& a) {
  if (wyx_rc_t rc = check_name(a.group_name); rc != WYX_OK) return rc;
  if (!a.source_group_name.empty()) return WYX_NOT_SUPPORTED;
  constexpr std::uint32_t kBatchFlags = WYX_BATCH_BOTH | WYX_DEACTIVATE_ON_FAILURE | WYX_COLLECT_ALL_RESULT;
  const bool in_range = (static_cast<std::uint32_t>(a.batch_control) & ~kBatchFlags) == 0 &&
                        valid_phases(a.num_phases) && a.source_reflection_num_phases >= 0 &&
                        a.source_reflection_num_phases <= WYX_N_PHASE &&
                        (a.default_vote == WYX_NULL_VOTE || a.default_vote == WYX_VOTE_APPROVE ||
                         a.default_vote == WYX_VOTE_REJECT) &&
                        a.merge_control >= WYX_FIRST_MERGE_TYPE && a.merge_control <= WYX_LAST_MERGE_TYPE;
  return in_range ? WYX_OK : WYX_BAD_GROUP_ATTRIBUTES;
}

wyx_rc_t check_values(const JoinRequest& request) {
  if (request.local_name.size() > kMaxLocalName) return WYX_NAME_TOO_LONG;
  return check_attributes(request.attributes);
}

wyx_rc_t check_values(const StateChangeRequest& request) {
  return first_wrong({check_terms(request.terms), check_length(request.new_state, kMaxStateValue)});
}

wyx_rc_t check_values(const MessageRequest& request) {
  return first_wrong({check_terms(request.terms), check_length(request.message, kMaxProviderMessage)});
}

wyx_rc_t check_values(const LeaveRequest& request) { return check_terms(request.terms); }

wyx_rc_t check_values(const ExpelRequest& request) {
  wyx_rc_t rc = first_wrong({check_terms(request.terms), check_length(request.deactivate_flag, kMaxExpelFlag)});
  if (rc != WYX_OK) return rc;
  if (request.expelled.empty() || request.expelled.size() > kMaxExpelList) return WYX_BAD_PARAMETER;
  const bool one_phase = request.terms.num_phases == WYX_1_PHASE;
  if (request.deactivate_phase < 0 || (one_phase && request.deactivate_phase > 1))
    return WYX_INVALID_DEACTIVATE_PHASE;
  return has_duplicates(request.expelled) ? WYX_PROVIDER_APPEARS_TWICE : WYX_OK;
}

wyx_rc_t check_values(const AttributeChangeRequest& request) {
  return first_wrong({check_terms(request.terms), check_attributes(request.attributes)});
}

wyx_rc_t check_values(const VoteRequest& request) {
  if (request.vote < WYX_VOTE_APPROVE || request.vote > WYX_VOTE_REJECT) return WYX_VOTE_VALUE_NOT_ALLOWED;
  const wyx_vote_value_t def = request.default_vote;
  if (def != WYX_NULL_VOTE && def != WYX_VOTE_APPROVE && def != WYX_VOTE_REJECT) return WYX_VOTE_VALUE_NOT_ALLOWED;
  if (request.proposed_state && request.proposed_state->size() > kMaxStateValue) return WYX_BAD_PARAMETER;
  if (request.message && request.message->size() > kMaxProviderMessage) return WYX_BAD_PARAMETER;
  return WYX_OK;
}

wyx_rc_t check_values(const SubscribeRequest& request) {
  if (wyx_rc_t rc = check_name(request.group_name); rc != WYX_OK) return rc;
  constexpr std::uint32_t kWanted = WYX_SUBSCRIBE_STATE_AND_MEMBERSHIP;
  constexpr std::uint32_t kUnsupported = WYX_SUBSCRIBE_ADAPTER_INFO | WYX_SUBSCRIBE_SPECIAL_DATA;
  if (request.control & ~(kWanted | kUnsupported | WYX_SUBSCRIBE_PERSISTENCE)) return WYX_BAD_PARAMETER;
  if (request.control & kUnsupported) return WYX_NOT_SUPPORTED;
  return request.control & kWanted ? WYX_OK : WYX_BAD_PARAMETER;
}

std::size_t room_for(const JoinRequest& request) {
  constexpr std::size_t kProvider = 1024;  // with its place in every table, and a group that may be its own
  return kProvider + request.local_name.size();
}
std::size_t room_for(const StateChangeRequest& request) { return request.new_state.size(); }
std::size_t room_for(const MessageRequest& request) { return request.message.size(); }
std::size_t room_for(const ExpelRequest& request) {
  return request.deactivate_flag.size() + request.expelled.size() * (sizeof(ProviderId) + sizeof(LeaveCode));
}
std::size_t room_for(const VoteRequest& request) {
  return (request.proposed_state ? request.proposed_state->size() : 0) +
         (request.message ? request.message->size() : 0);
}
std::size_t room_for(const SubscribeRequest&) { return 512; }  // with its place in every table

}  // namespace gs
