// Deep equality of messages, so that a round trip can be held against what went in.
#pragma once

#include "gs/engine_equal.h"
#include "wire/messages.h"

namespace gs::wire {

using gs::same;

inline bool same(const Hello& a, const Hello& b) {
  return a.protocol_version == b.protocol_version && a.api_version == b.api_version &&
         a.socket_control == b.socket_control && a.program == b.program;
}
inline bool same(const Attach& a, const Attach& b) {
  return a.session_number == b.session_number && a.cookie == b.cookie;
}
inline bool same(const Call& a, const Call& b) { return a.request == b.request; }
inline bool same(const SetResponsiveness& a, const SetResponsiveness& b) {
  return a.type == b.type && a.interval == b.interval && a.time_limit == b.time_limit;
}
inline bool same(const QueryNode&, const QueryNode&) { return true; }
inline bool same(const PingAnswer& a, const PingAnswer& b) { return a.number == b.number && a.ok == b.ok; }
inline bool same(const Quit&, const Quit&) { return true; }
inline bool same(const Welcome& a, const Welcome& b) {
  return a.node_number == b.node_number && a.session_number == b.session_number && a.cookie == b.cookie;
}
inline bool same(const Answer& a, const Answer& b) { return a.rc == b.rc; }
inline bool same(const NodeInfo& a, const NodeInfo& b) {
  return a.node_number == b.node_number && a.domain_master_node == b.domain_master_node;
}
inline bool same(const Notify& a, const Notify& b) { return a.token == b.token && same(*a.what, *b.what); }
inline bool same(const Ping& a, const Ping& b) { return a.number == b.number; }
inline bool same(const Farewell&, const Farewell&) { return true; }

}  // namespace gs::wire
