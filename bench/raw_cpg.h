// What groups over several hosts are set against: Corosync's process groups with nothing around them.
#pragma once

#include "bench/board.h"

namespace zn {

// Slots of a process, after that of what is delivered to it.
constexpr int kViewSlot = 10, kQuorumSlot = 20;

/// A process in a process group of its own on this host's Corosync. It reports what is delivered to it and, in the
/// two other slots, how many members (seqnum) the process group has, and the ring that the latest verdict is on,
/// since when (time). Its input: "echo N BYTES" makes it send N messages one at a time, and print the nanoseconds
/// after which it had each back; "send N BYTES" makes it send them as fast as they are taken. Ends with its
/// Corosync.
int run_raw_cpg(Board& board, int slot);

}  // namespace zn
