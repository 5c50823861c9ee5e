// What the daemons of several hosts say to one another, as values.
//
// All but Confirmed travels in the one order that every member of a view sees; Confirmed travels beside it, and in
// it only where the way beside it is shut.
#pragma once

#include <compare>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "cluster/replica.h"

namespace gs::cluster {

/// Raised when daemons of two versions would not understand one another.
inline constexpr std::uint16_t kProtocolVersion = 1;

using Life = std::uint64_t;  // of a daemon, from one reset to the next; random

/// A daemon in the process group.
struct Process {
  Node node = 0;
  std::uint32_t pid = 0;
  auto operator<=>(const Process&) const = default;
};
inline std::string name_of(const Process& process) {
  return "node " + std::to_string(process.node) + " (pid " + std::to_string(process.pid) + ")";
}

/// A membership of hosts. Of two rings that one host was in, the later has the greater sequence.
struct RingId {
  std::uint64_t sequence = 0;
  Node node = 0;
  auto operator<=>(const RingId&) const = default;
};

/// Names an exchange.
struct BeginId {
  Life life = 0;             // of who ordered it
  std::uint64_t number = 0;  // in that life
  auto operator<=>(const BeginId&) const = default;
};

/// How much a daemon's state has seen; the greater one is ahead.
struct History {
  std::uint64_t ring = 0;       // sequence of the ring in which it last won an exchange
  std::uint64_t exchanges = 0;  // won in that ring
  std::uint64_t messages = 0;   // ordered in that ring since the last of them
  std::uint64_t digest = 0;     // of all ordered since, and of the exchange
  auto operator<=>(const History&) const = default;
};

/// Opens an exchange among those who are in `ring`.
struct Begin {
  BeginId id;
  RingId ring;
  std::vector<Process> asked;
  std::map<Node, std::uint32_t> votes;  // in the quorum
  std::uint32_t needed = 0;             // votes of the holders; 0: one is enough
  std::uint64_t clock = 0;              // milliseconds since 1970
};

/// Answers a begin.
struct Word {
  BeginId begin;
  std::uint16_t version = kProtocolVersion;
  Life life = 0;
  std::optional<History> history;        // none: there is no state
  std::string address;                   // for datagrams
  std::string key;                       // that the sender's datagrams are authenticated with
  std::uint64_t limits = 0;              // and delivery, in one number: all must have the same
  std::map<Node, std::uint32_t> left{};  // leave codes of hosts that have gone since it last took part
};

/// An event of the engine.
struct Ordered {
  Life life = 0;
  std::uint64_t number = 0;  // in that life
  std::shared_ptr<const Event> event;
  std::size_t size = 0;  // bytes that were received for it
};

/// Part of the state as it was when the decision of an exchange was applied.
struct Piece {
  std::uint32_t index = 0;
  std::uint32_t count = 0;
  std::vector<std::byte> bytes;
};

/// All up to `position` has been received: 1 is the decision of the exchange, each event after it counts one more.
struct Confirmed {
  BeginId begin;
  std::uint64_t position = 0;
  std::vector<Node> ask;  // who is to repeat its own
};

/// These hold up the others: the next exchange does not ask them.
struct Evict {
  RingId ring;
  std::vector<Process> who;
};

using Message = std::variant<Begin, Word, Ordered, Piece, Confirmed, Evict>;

}  // namespace gs::cluster
