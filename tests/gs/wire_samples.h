// One of every message, every field set to a value of its own, for the tests that must see all of them.
#pragma once

#include <vector>

#include "engine/protocols.h"
#include "gs/same.h"

namespace gs::wire::samples {

inline GroupAttributes attributes() {
  GroupAttributes a;
  a.client_version = 7;
  a.batch_control = static_cast<wyx_batch_ctrl_t>(WYX_BATCH_BOTH | WYX_COLLECT_VOTE_RESULT);
  a.num_phases = WYX_N_PHASE;
  a.source_reflection_num_phases = WYX_N_PHASE;
  a.default_vote = WYX_VOTE_REJECT;
  a.merge_control = WYX_ANYORDER_MERGE;
  a.time_limit = 11;
  a.source_reflection_time_limit = 12;
  a.group_name = "a group";
  a.source_group_name = "its source";
  return a;
}

inline std::vector<Request> requests() {
  const ProtocolTerms terms{WYX_N_PHASE, 65535};
  const Bytes binary("\0\xff\x80 bytes", 9);
  return {JoinRequest{3, attributes(), -4, "local name"},
          StateChangeRequest{4, terms, binary},
          MessageRequest{5, terms, binary},
          LeaveRequest{6, terms, 0xdeadbeef},
          ExpelRequest{7, terms, {{1, 2}, {-3, 4}}, -9, "\xff\x80 flag"},
          AttributeChangeRequest{8, terms, attributes()},
          GoodbyeRequest{9},
          VoteRequest{10, WYX_VOTE_CONTINUE, binary, Bytes(), WYX_VOTE_APPROVE},
          VoteRequest{10, WYX_VOTE_CONTINUE_AND_SWITCH_ALPHA_OMEGA, std::nullopt, std::nullopt, WYX_NULL_VOTE},
          SubscribeRequest{11, 0x20f, "watched"},
          UnsubscribeRequest{12}};
}

inline Adapters adapters() {
  return {{"eth0", {0x20, 1, 0xd, 0xb8, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 7}},
          {"fifteen-letters", {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xff, 0xff, 192, 0, 2, 9}}};
}

inline std::vector<ClientMessage> client_messages() {
  std::vector<ClientMessage> messages = {Hello{kProtocolVersion, 0x03020600, 0x1001, "program"},
                                         Attach{77, 0x8877665544332211},
                                         SetResponsiveness{WYX_PING_RESPONSIVENESS, 30, 20},
                                         QueryNode{},
                                         PingAnswer{5, true},
                                         Quit{},
                                         QuorumAnswer{0x8877665544332211},
                                         QueryAdapters{6, {}},
                                         QueryAdapters{0, adapters()[0].address}};
  for (Request& request : requests()) messages.push_back(Call{std::move(request)});
  return messages;
}

inline SharedMembership members(std::initializer_list<ProviderId> ids) {
  return std::make_shared<const Membership>(ids);
}
template <typename T>
std::shared_ptr<const std::vector<T>> list(std::vector<T> values) {
  return std::make_shared<const std::vector<T>>(std::move(values));
}
inline SharedBytes bytes(Bytes value) { return std::make_shared<const Bytes>(std::move(value)); }

/// `state_size`: bytes of each state value, so that a message of many packets can be had.
inline ProtocolNotification full_protocol(std::size_t state_size = 5) {
  ProtocolNotification n;
  n.type = WYX_REJECTED_NOTIFICATION;
  n.protocol = WYX_EXPEL;
  n.summary = WYX_DEFAULT_REJECT | WYX_TIME_LIMIT_EXCEEDED;
  n.time_limit = 9;
  n.seqnum = 0x123456789abcdef0;
  Proposal& p = n.proposal;
  p.num_phases = 2;
  p.phase = 3;
  p.proposed_by = {1, 2};
  p.whats_changed = WYX_EXPEL_INFORMATION | WYX_CURRENT_STATE_VALUE;
  p.current_providers = members({{1, 2}, {3, 4}});
  p.changing_providers = members({{3, 4}});
  p.leave_codes = list<LeaveCode>({{WYX_PROVIDER_EXPELLED, 17}});
  p.expel_info = ExpelInfo{4, "flag"};
  p.current_state = bytes(Bytes(state_size, 's'));
  p.proposed_state = bytes(Bytes(state_size, 't'));
  p.message = bytes("message");
  p.new_attributes = std::make_shared<const GroupAttributes>(attributes());
  p.current_vote_results =
      list<VoteResult>({{{1, 2}, WYX_VOTE_APPROVE, WYX_EXPLICIT_APPROVE, 0, bytes("x"), nullptr},
                        {{3, 4}, WYX_VOTE_REJECT, WYX_PROVIDER_FAILED, WYX_HOST_FAILURE, nullptr, bytes("")}});
  p.changing_vote_results = list<VoteResult>({{{5, 6}, WYX_VOTE_CONTINUE, 0, 0, nullptr, nullptr}});
  return n;
}

/// With what every one has, and nothing else.
inline ProtocolNotification plain_protocol() {
  ProtocolNotification n;
  n.proposal.current_providers = members({});
  n.proposal.current_state = bytes("");
  return n;
}

inline std::vector<Notification> notifications() {
  std::vector<Notification> all = {
      full_protocol(),
      plain_protocol(),
      AnnouncementNotification{WYX_RESPONSIVENESS_NO_RESPONSE, members({{8, 9}})},
      AnnouncementNotification{WYX_GROUP_DISSOLVED, nullptr},
      SubscriptionNotification{WYX_SUBSCRIPTION_STATE | WYX_SUBSCRIPTION_DELTA_LEAVE, bytes("state"),
                               members({{1, 1}}), members({{2, 2}}), list<LeaveCode>({{WYX_PROVIDER_FAILURE, 3}}),
                               44},
      SubscriptionNotification{WYX_SUBSCRIPTION_MEMBERSHIP, bytes(""), members({}), nullptr, {}, 45}};
  for (const Request& request : requests()) {
    all.push_back(DelayedErrorNotification{protocol_of(request), WYX_COLLIDE, request,
                                           std::make_shared<const GroupAttributes>(attributes())});
  }
  return all;
}

inline std::vector<ServerMessage> server_messages() {
  std::vector<ServerMessage> messages = {Welcome{4, 77, 0x8877665544332211},
                                         Answer{WYX_UNEXPECTED_QUORUM_RESP},
                                         NodeInfo{4, 5},
                                         Ping{6},
                                         Farewell{},
                                         Fanout{{0, 7, 2'000'000'000}},
                                         FanoutEnd{},
                                         NodeAdapters{4, adapters()}};
  const DomainNotification news[] = {
      NodesNotification{{{1, 10}, {32767, 11}}, {{1, 10}}, {{2, 9}, {3, 8}}}, MasterNotification{{1, 10}, 2},
      QuorumNotification{1, WYX_QUORUM_STATE_HAS, WYX_QUORUM_STATE_NONE, 1ull << 40},
      QuorumErrorNotification{2, WYX_BAD_QUORUM_MSG_SEQNUM}};
  for (const auto& n : news) messages.push_back(DomainControl{std::make_shared<const DomainNotification>(n)});
  Token token = 0;
  for (Notification& n : notifications()) {
    messages.push_back(Notify{token++, std::make_shared<const Notification>(std::move(n))});
  }
  return messages;
}

}  // namespace gs::wire::samples
