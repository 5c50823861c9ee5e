#include "engine/text.h"

#include <algorithm>
#include <iterator>
#include <span>

#include "engine/protocols.h"

namespace gs {
namespace {

struct Name {
  std::uint32_t bit;
  const char* name;
};

constexpr Name kSummaryNames[] = {{WYX_EXPLICIT_APPROVE, "approve"},
                                  {WYX_EXPLICIT_REJECT, "reject"},
                                  {WYX_DEFAULT_APPROVE, "default-approve"},
                                  {WYX_DEFAULT_REJECT, "default-reject"},
                                  {WYX_TIME_LIMIT_EXCEEDED, "time"},
                                  {WYX_PROVIDER_FAILED, "failed"},
                                  {WYX_RESPONSIVENESS_NO_RESPONSE, "no-response"},
                                  {WYX_RESPONSIVENESS_RESPONSE, "response"},
                                  {WYX_GROUP_DISSOLVED, "dissolved"}};
constexpr Name kSubscriptionNames[] = {
    {WYX_SUBSCRIPTION_STATE, "state"},         {WYX_SUBSCRIPTION_DELTA_JOIN, "join"},
    {WYX_SUBSCRIPTION_DELTA_LEAVE, "leave"},   {WYX_SUBSCRIPTION_MEMBERSHIP, "members"},
    {WYX_SUBSCRIPTION_DISSOLVED, "dissolved"}, {WYX_SUBSCRIPTION_PERSISTENT, "persistent"}};
constexpr Name kLeaveNames[] = {{WYX_VOLUNTARY_LEAVE, "voluntary"},
                                {WYX_PROVIDER_FAILURE, "died"},
                                {WYX_HOST_FAILURE, "host"},
                                {WYX_PROVIDER_EXPELLED, "expelled"},
                                {WYX_PROVIDER_SAID_GOODBYE, "goodbye"}};

std::vector<std::string> names_of(std::uint32_t value, std::span<const Name> names) {
  std::vector<std::string> set;
  for (const Name& n : names)
    if (value & n.bit) set.emplace_back(n.name);
  return set;
}

std::string flags(std::uint32_t value, std::span<const Name> names) {
  std::string all;
  for (const std::string& name : names_of(value, names)) all += (all.empty() ? "" : "|") + name;
  return all.empty() ? "none" : all;
}

std::string protocol_name(wyx_request_t type) {
  if (type == WYX_SUBSCRIPTION) return "subscription";
  for (const ProtocolTraits& traits : kProtocols) {
    if (traits.type == type) return traits.name;
  }
  return "request " + std::to_string(type);
}

/// A state value or message as it may stand in a line of a log.
std::string quoted(const Bytes& bytes) {
  return '\'' + printable(bytes) + '\'' +
         (bytes.size() > kMaxPrinted ? "... (" + std::to_string(bytes.size()) + " bytes)" : "");
}

std::string summary_text(std::uint32_t summary) { return flags(summary, kSummaryNames); }

constexpr Name kChangeNames[] = {{WYX_PROPOSED_MEMBERSHIP, "proposed-members"},
                                 {WYX_ONGOING_MEMBERSHIP, "ongoing-members"},
                                 {WYX_UPDATED_MEMBERSHIP, "updated-members"},
                                 {WYX_REJECTED_MEMBERSHIP, "rejected-members"},
                                 {WYX_PROPOSED_STATE_VALUE, "proposed-state"},
                                 {WYX_ONGOING_STATE_VALUE, "ongoing-state"},
                                 {WYX_UPDATED_STATE_VALUE, "updated-state"},
                                 {WYX_PROPOSED_GROUP_ATTRIBUTES, "proposed-attributes"},
                                 {WYX_ONGOING_GROUP_ATTRIBUTES, "ongoing-attributes"},
                                 {WYX_UPDATED_GROUP_ATTRIBUTES, "updated-attributes"},
                                 {WYX_REJECTED_GROUP_ATTRIBUTES, "rejected-attributes"},
                                 {WYX_UPDATED_PROVIDER_MESSAGE, "message"},
                                 {WYX_EXPEL_INFORMATION, "expel"}};

std::string changes_text(std::uint32_t bits) { return flags(bits, kChangeNames); }

std::string leave_codes_text(const std::vector<LeaveCode>& codes) {
  std::string all;
  for (const LeaveCode& code : codes) {
    all += (all.empty() ? "" : " ") + flags(code.voluntary_or_failure, kLeaveNames);
    if (code.voluntary_code != 0) all += "=" + std::to_string(code.voluntary_code);
  }
  return "(" + all + ")";
}

const char* vote_name(wyx_vote_value_t vote) {
  static constexpr const char* kVotes[] = {"null", "yes", "continue", "no"};
  return vote >= 0 && vote < std::ssize(kVotes) ? kVotes[vote] : "?";
}

std::string vote_results_text(const char* title, const SharedVoteResults& results) {
  if (!results) return "";
  std::string all = std::string(", ") + title + "[";
  for (const VoteResult& r : *results) {
    all += (&r == &results->front() ? "" : "; ") + text(r.voter) + " " + vote_name(r.vote) + " " +
           summary_text(r.summary);
    if (r.leave_code != 0) all += " " + leave_codes_text({{r.leave_code, 0}});
    if (r.proposed_state) all += " " + quoted(*r.proposed_state);
    if (r.message) all += " msg " + quoted(*r.message);
  }
  return all + "]";
}

std::string body(const ProtocolNotification& n) {
  const Proposal& p = n.proposal;
  std::string all;
  if (n.type == WYX_N_PHASE_NOTIFICATION) all = "phase " + std::to_string(p.phase);
  if (n.type == WYX_APPROVED_NOTIFICATION) all = "approved";
  if (n.type == WYX_REJECTED_NOTIFICATION) all = "rejected";
  all += " " + protocol_name(n.protocol) + " by " + text(p.proposed_by);
  if (n.summary != 0) all += " <" + summary_text(n.summary) + ">";
  const std::uint32_t changes = p.whats_changed & ~std::uint32_t{WYX_CURRENT_STATE_VALUE};
  if (changes != 0) all += " {" + changes_text(changes) + "}";
  all += ", members " + text(p.current_providers);
  if (p.changing_providers) all += ", changing " + text(p.changing_providers);
  if (p.leave_codes) all += leave_codes_text(*p.leave_codes);
  if (p.expel_info) {
    all += ", deactivate " + std::to_string(p.expel_info->deactivate_phase) + " " + quoted(p.expel_info->flag);
  }
  if (p.current_state && !p.current_state->empty()) all += ", state " + quoted(*p.current_state);
  if (p.proposed_state) all += ", proposed " + quoted(*p.proposed_state);
  if (p.message) all += ", msg " + quoted(*p.message);
  if (p.new_attributes) all += ", version " + std::to_string(p.new_attributes->client_version);
  all += vote_results_text("votes", p.current_vote_results);
  all += vote_results_text("changing votes", p.changing_vote_results);
  if (n.time_limit != 0) all += ", limit " + std::to_string(n.time_limit);
  return all + ", #" + std::to_string(n.seqnum);
}

std::string body(const AnnouncementNotification& n) {
  return "announcement <" + summary_text(n.summary) + ">" + (n.providers ? " " + text(n.providers) : "");
}

std::string body(const SubscriptionNotification& n) {
  std::string all = "subscription {" + flags(n.type, kSubscriptionNames) + "}";
  if (n.full_membership) all += ", members " + text(n.full_membership);
  if (n.changing_membership) all += ", changing " + text(n.changing_membership);
  if (n.leave_codes) all += leave_codes_text(*n.leave_codes);
  if (n.state) all += ", state " + quoted(*n.state);
  return all + ", #" + std::to_string(n.seqnum);
}

std::string body(const DelayedErrorNotification& n) {
  std::string all = "error " + std::to_string(n.rc) + " for " + protocol_name(n.protocol);
  return n.group_attributes ? all + ", group has version " + std::to_string(n.group_attributes->client_version)
                            : all;
}

std::string members_text(const Membership& ids) {
  std::string all;
  for (const ProviderId id : ids) all += (all.empty() ? "" : " ") + text(id);
  return all.empty() ? "-" : all;
}

std::string body(const JoinRequest& r) {
  return "join " + quoted(r.attributes.group_name) + " as " + std::to_string(r.instance);
}
std::string body(const StateChangeRequest& r) { return "state " + quoted(r.new_state); }
std::string body(const MessageRequest& r) { return "message " + quoted(r.message); }
std::string body(const LeaveRequest& r) { return "leave, code " + std::to_string(r.leave_code); }
std::string body(const ExpelRequest& r) { return "expel " + members_text(r.expelled); }
std::string body(const AttributeChangeRequest& r) {
  return "attributes, version " + std::to_string(r.attributes.client_version);
}
std::string body(const GoodbyeRequest&) { return "goodbye"; }
std::string body(const VoteRequest& r) {
  std::string all = std::string("vote ") + vote_name(r.vote);
  if (r.proposed_state) all += ", proposed " + quoted(*r.proposed_state);
  if (r.message) all += ", msg " + quoted(*r.message);
  return all;
}
std::string body(const SubscribeRequest& r) { return "subscribe to " + quoted(r.group_name); }
std::string body(const UnsubscribeRequest&) { return "unsubscribe"; }

std::string name_of(const SessionId& session) {
  return "session " + std::to_string(session.number) +
         (session.node == 1 ? "" : "@" + std::to_string(session.node));
}

std::string body(const RequestEvent& e) {
  return name_of(e.session) + ": " + std::visit([](const auto& r) { return body(r); }, e.request) + ", token " +
         std::to_string(std::visit([](const auto& r) { return r.token; }, e.request));
}
std::string body(const SessionGoneEvent& e) { return name_of(e.session) + ": gone"; }
std::string body(const HostGoneEvent& e) { return "node " + std::to_string(e.node) + ": gone"; }
std::string body(const HostCameEvent& e) { return "node " + std::to_string(e.node) + ": here"; }
std::string body(const TimerExpiredEvent& e) {
  return "group " + quoted(e.timer.group) + ": time of phase " + std::to_string(e.timer.phase) + " is over";
}
std::string body(const ResponsivenessEvent& e) {
  return name_of(e.session) + (e.responding ? ": responds" : ": does not respond");
}
std::string body(const ContinueEvent&) { return "unfinished work goes on"; }
std::string body(const AdaptersEvent& e) {
  std::string all = "node " + std::to_string(e.node) + ": adapters";
  for (const Adapter& adapter : e.adapters) all += " " + printable(adapter.name);
  return all;
}
std::string body(const NumbersEvent& e) { return "numbers go on above " + std::to_string(e.above); }

}  // namespace

std::string printable(const std::string& bytes) {
  std::string text = bytes.substr(0, kMaxPrinted);
  std::replace_if(
      text.begin(), text.end(), [](unsigned char c) { return c < 0x20 || c > 0x7e || c == '"'; }, '?');
  return text;
}

std::vector<std::string> names_of_summary(std::uint32_t summary) { return names_of(summary, kSummaryNames); }
std::vector<std::string> names_of_leave_code(std::uint32_t code) { return names_of(code, kLeaveNames); }

std::string text(ProviderId id) {
  return std::to_string(id.instance) + (id.node == 1 ? "" : "@" + std::to_string(id.node));
}

std::string text(const SharedMembership& ids) { return ids ? members_text(*ids) : "-"; }

std::string text(const Notification& notification) {
  return std::visit([](const auto& n) { return body(n); }, notification);
}

std::string text(const Event& event) {
  return std::visit([](const auto& e) { return body(e); }, event);
}

}  // namespace gs
