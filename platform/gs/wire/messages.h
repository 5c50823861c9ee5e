// What a client and its daemon say to each other, as values. codec.h turns them into packets and back.
//
// A client opens two connections to the daemon's socket: the request channel (Hello, then a request and its Answer
// at a time) and the event channel (Attach, then notifications one way, pings and their answers).
#pragma once

#include "engine/types.h"

namespace gs::wire {

inline constexpr std::uint16_t kProtocolVersion = 3;
inline constexpr std::size_t kMaxFanout = kMaxSessionClients;  // tokens

// ---------------------------------------------------------------------------------------- client to daemon

/// First on the request channel.
struct Hello {
  std::uint16_t protocol_version = kProtocolVersion;
  std::uint32_t api_version = 0;  // the base API version the application was built for
  std::uint32_t socket_control = 0;
  std::string program;  // for the daemon's log
};
/// First on the event channel: whose it is. The cookie comes from Welcome.
struct Attach {
  std::uint64_t session_number = 0;
  std::uint64_t cookie = 0;
};
struct Call {
  Request request;
};
/// Replaces the session's responsiveness settings. Only WYX_PING_RESPONSIVENESS and its modifiers.
struct SetResponsiveness {
  std::uint32_t type = 0;        // flags of wyx_responsiveness_type_t
  std::uint32_t interval = 0;    // seconds
  std::uint16_t time_limit = 0;  // seconds
};
/// Asks for NodeInfo; allowed without Hello, so that a node query needs no session.
struct QueryNode {};
/// Answers Ping, on the event channel.
struct PingAnswer {
  std::uint64_t number = 0;
  bool ok = false;
};
/// Answers a quorum notification that is to be answered; its Answer says whether it was expected.
struct QuorumAnswer {
  std::uint64_t sequence = 0;  // of the notification
};
/// Asks for NodeAdapters; allowed without Hello.
struct QueryAdapters {
  std::uint32_t node = 0;
  std::optional<Adapter::Address> address;  // the one adapter that has it, on whatever node
};
/// Asks the daemon about itself; allowed on a connection that has said nothing else, and asked there alone.
struct Inspect {
  Bytes ask;  // an Ask of inspect/inspect.fbs
};
/// The session ends in good order: the daemon fails its providers as for a death but logs no error.
struct Quit {};

using ClientMessage = std::variant<Hello, Attach, Call, SetResponsiveness, QueryNode, PingAnswer, Quit,
                                   QuorumAnswer, QueryAdapters, Inspect>;

// ---------------------------------------------------------------------------------------- daemon to client

/// Answers Hello.
struct Welcome {
  std::uint32_t node_number = 0;
  std::uint64_t session_number = 0;
  std::uint64_t cookie = 0;
};
/// Answers Attach, Call, SetResponsiveness, QuorumAnswer and Quit, and a Hello that is refused.
struct Answer {
  wyx_rc_t rc = WYX_OK;
};
struct NodeInfo {
  std::uint32_t node_number = 0;
  std::uint32_t domain_master_node = 0;
};
/// Of `node`; empty: none are known that were asked for.
struct NodeAdapters {
  std::uint32_t node = 0;
  Adapters adapters;
};
struct Notify {
  Token token = -1;  // -1: those of the Fanout before it
  std::shared_ptr<const Notification> what;
};
/// To the session itself.
struct DomainControl {
  std::shared_ptr<const DomainNotification> what;
};
struct Ping {
  std::uint64_t number = 0;
};
/// The daemon is going away; nothing follows.
struct Farewell {};
/// The Notify that follows, whose own token is -1, is for each of these in turn: 2 to kMaxFanout, none negative.
/// After it comes a FanoutEnd, and nothing in between.
struct Fanout {
  std::vector<Token> tokens;
};
/// A reader leaves it unread until all tokens have their notification, so that its descriptor stays readable.
struct FanoutEnd {};
/// Answers Inspect; a tap's come one after another.
struct Report {
  Bytes report;  // a Report of inspect/inspect.fbs
};

using ServerMessage = std::variant<Welcome, Answer, NodeInfo, Notify, Ping, Farewell, Fanout, FanoutEnd,
                                   DomainControl, NodeAdapters, Report>;

}  // namespace gs::wire
