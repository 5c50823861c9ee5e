// The messages of the order as bytes and back: each is one FlatBuffer, whose schema is cluster.fbs.
//
// A Word and a Begin are read whatever version of the protocol wrote them; a Word's `version` says whether its
// sender understands the rest.
//
// All of it is safe to use from several threads at once on different objects.
#pragma once

#include <span>

#include "cluster/messages.h"

namespace gs::cluster {

inline constexpr std::size_t kMaxNodes = kMaxHosts;     // in any list
inline constexpr std::size_t kMaxVotes = 1 << 22;       // of a host, so that the sum of all is a number of 32 bits
inline constexpr std::size_t kMaxPiece = 512 * 1024;    // bytes
inline constexpr std::size_t kMaxAddress = 256;         // bytes; also of a key
inline constexpr std::size_t kMaxMessage = 576 * 1024;  // bytes, the FlatBuffer

/// Why the others would refuse it: a list or text over its limit, a number that nothing has. Empty: they would
/// not.
std::string problem_with(const Message& message);

/// Empty: the others would refuse it.
std::vector<std::byte> encode(const Message& message);

/// Bytes from anybody. Nothing: they are no message, and `error` says why.
std::optional<Message> decode(std::span<const std::byte> bytes, std::string* error);

}  // namespace gs::cluster
