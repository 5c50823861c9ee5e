// What an engine sends as text, for comparing and for reading failures.
#pragma once

#include <string>

#include "engine/text.h"

namespace gs::test {

/// One line for each run of deliveries with the same text: "1 2: ...". Providers are named by their session's
/// number, subscribers (tokens from kSubscriberToken on) by "s" and their session's number.
std::string text(const std::vector<Delivery>& deliveries);

inline constexpr Token kSubscriberToken = 100;

std::string name_of(const Endpoint& endpoint);

}  // namespace gs::test
