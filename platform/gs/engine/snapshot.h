// An engine's whole state as bytes and back, for a replica that has none. The schema is snapshot.fbs.
//
// Equal states are equal bytes. What is read is taken for hostile: it is checked before it is used, against its
// own limits and against the rest of it, so that an engine never stands in a state that no events lead to as far
// as its code relies on it.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include "engine/state.h"

namespace gs {

/// The FlatBuffer's identifier; the digits are the version.
inline constexpr char kSnapshotId[] = "GE02";

/// Nothing: there is more than a FlatBuffer can hold.
std::vector<std::byte> write_snapshot(const EngineState& state);

/// Fills `into`, which is as new. False: `error` says why not, and `into` is not to be used.
bool read_snapshot(const std::vector<std::byte>& snapshot, EngineState& into, std::string* error);

}  // namespace gs
