// Everybody who may make a request with a token, and be sent something.
#pragma once

#include <map>
#include <string>

#include "engine/member.h"

namespace gs {

struct Client {
  std::string group;
  MemberPtr provider;              // null: a subscriber
  std::uint64_t subscription = 0;  // its number in the subscriber table
};

class ClientTable {
 public:
  using OfSession = std::map<Token, Client>;
  using Sessions = std::map<SessionId, OfSession>;

  /// Null: nobody.
  const Client* find(const Endpoint& who) const {
    const OfSession& clients = of(who.session);
    const auto found = clients.find(who.token);
    return found == clients.end() ? nullptr : &found->second;
  }
  const OfSession& of(SessionId session) const {
    static const OfSession kNone;
    const auto found = sessions_.find(session);
    return found == sessions_.end() ? kNone : found->second;
  }
  const Sessions& sessions() const { return sessions_; }

  void add(const Endpoint& who, Client client) { sessions_[who.session][who.token] = std::move(client); }
  void erase(const Endpoint& who) {
    const auto session = sessions_.find(who.session);
    if (session == sessions_.end()) return;
    session->second.erase(who.token);
    if (session->second.empty()) sessions_.erase(session);
  }
  /// Takes out one session from `first` to `last`; an empty node: there is none.
  Sessions::node_type take_session(SessionId first, SessionId last) {
    const auto found = sessions_.lower_bound(first);
    return found == sessions_.end() || found->first > last ? Sessions::node_type() : sessions_.extract(found);
  }

 private:
  Sessions sessions_;  // those with clients
};

}  // namespace gs
