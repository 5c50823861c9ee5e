// All that an engine knows.
#pragma once

#include <deque>
#include <map>
#include <string>

#include "engine/clients.h"
#include "engine/group.h"
#include "engine/hosts.h"
#include "engine/ledger.h"
#include "engine/subscribers.h"

namespace gs {

struct EngineState {
  using Groups = std::map<std::string, Group>;

  explicit EngineState(const Limits& wanted) : limits(wanted) {}

  const Limits limits;
  Ledger ledger{limits};  // before all that is charged
  Groups groups;
  std::deque<std::string> line;  // the unfinished groups, in the order in which they are gone on with
  SubscriberTable subscribers;
  ClientTable clients;
  HostTable hosts;
  std::uint64_t last_protocol = 0;
  std::uint64_t numbers_above = 0;  // every event of a group is numbered above it
  std::uint64_t ended_number = 0;   // the highest of any group that has ended: no later one starts below it
};

}  // namespace gs
