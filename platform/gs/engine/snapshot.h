// An engine's whole state as bytes and back, for a replica that has none. The schema is snapshot.fbs.
//
// Equal states are equal bytes. What is read is taken for hostile: it is checked before it is used, against its
// own limits and against the rest of it, so that an engine never stands in a state that no events lead to as far
// as its code relies on it.
#pragma once

#include <span>
#include <string>

#include "engine/snapshot_bytes.h"
#include "engine/state.h"

namespace gs {

/// The FlatBuffer's identifier; the digits are the version.
inline constexpr char kSnapshotId[] = "GE03";

/// Nothing: there is more than a snapshot can hold.
SnapshotBytes write_snapshot(const EngineState& state);

/// Fills `into`, which is as new. False: `error` says why not, and
/// `into` is not to be used.
bool read_snapshot(const SnapshotBytes& snapshot, EngineState& into, std::string* error);

}  // namespace gs
