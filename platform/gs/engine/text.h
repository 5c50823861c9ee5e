// The engine's values as short texts, for a trace and for tests.
#pragma once

#include <string>
#include <vector>

#include "engine/types.h"

namespace gs {

inline constexpr std::size_t kMaxPrinted = 64;  // bytes of a client's text, state value or message

/// A client's text as it may stand in a line of a log: its beginning, with '?' for what does not print.
std::string printable(const std::string& bytes);

/// Of the flags of wyx_summary_code_t and wyx_leave_code_t that are set.
std::vector<std::string> names_of_summary(std::uint32_t summary);
std::vector<std::string> names_of_leave_code(std::uint32_t code);

/// "3" on node 1, else "3@2".
std::string text(ProviderId id);
/// "1 2 3", or "-" when empty or null.
std::string text(const SharedMembership& ids);
/// One line. Providers by instance number; a part that is absent is not mentioned.
std::string text(const Notification& notification);
/// One line: whose request it is and what it asks, or what has happened.
std::string text(const Event& event);

}  // namespace gs
