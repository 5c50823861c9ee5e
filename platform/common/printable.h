// Text from others, fit for a terminal and a log.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace platform {

/// UTF-8 in which nothing steers a terminal: "?" for each control character (C0 but for those of `kept`, DEL, C1)
/// and for each byte that is no UTF-8.
std::string printable(std::string_view text, std::string_view kept = "\t");

/// How many bytes from the first on are well-formed UTF-8.
std::size_t utf8_length(std::string_view text);

}  // namespace platform
