// The clients of a storm: processes that join and leave, propose and vote at random and log what they are told.
#pragma once

#include <cstdint>
#include <string>

namespace storm {

struct ClientSettings {
  std::string role;    // member, subscriber, or deaf: asks for notifications and never takes them
  std::string folder;  // of the round: the board and the logs
  int serial = 0;      // of this process in the round
  std::uint64_t seed = 0;
  int lifeline = -1;  // at its end what a client has left behind ends too
};

/// Runs until the standard input ends or says "quit". The other commands, each a line:
///   fork     leave a process behind that lives on, with the descriptors of the session
///   rally    make no more requests at random; join, or subscribe to, whatever one is out of, and approve of all
///   report   tell where it stands: "P GROUP INSTANCE SEQNUM MEMBERS OPEN" for each provider, "T GROUP MEMBERS"
///   for
///            each subscriber, then "."; INSTANCE 0: out, OPEN: requests that nothing has come of yet
int run_client(const ClientSettings& settings);

}  // namespace storm
