// Columns for people.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace platform {

using Row = std::vector<std::string>;

/// Characters of UTF-8.
std::size_t width_of(std::string_view text);
/// With blanks behind it.
std::string padded(const std::string& text, std::size_t width);

/// A line for each row, the columns under one another; the first row has the most columns. Nothing of it is made
/// printable.
std::string table(const std::vector<Row>& rows);

}  // namespace platform
