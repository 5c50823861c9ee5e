// Engine values as short texts, for comparing and for reading failures.
#pragma once

#include <string>

#include "engine/types.h"

namespace gs::test {

/// "3" on node 1, else "3@2".
std::string text(ProviderId id);
/// "1 2 3", or "-" when empty or null.
std::string text(const SharedMembership& ids);
/// One line. Providers by instance number; a part that is absent is not mentioned.
std::string text(const Notification& notification);
/// One line for each run of deliveries with the same text: "1 2: ...". Providers are named by their session's
/// number, subscribers (tokens from kSubscriberToken on) by "s" and their session's number.
std::string text(const std::vector<Delivery>& deliveries);

inline constexpr Token kSubscriberToken = 100;

std::string name_of(const Endpoint& endpoint);

}  // namespace gs::test
