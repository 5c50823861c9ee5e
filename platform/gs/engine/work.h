// How much an event makes the engine and its caller do, in units that are the same on every replica: about what
// one short notification costs, or 4 KiB of a long one.
#pragma once

#include <span>

#include "engine/types.h"

namespace gs {

std::size_t work_of(std::span<const Delivery> deliveries);

/// Of a step that looks at every one of `members` without telling them anything.
constexpr std::size_t work_of_looking_at(std::size_t members) { return 1 + members / 128; }

}  // namespace gs
