// Standard output and standard error: whole lines, in which nothing of others steers a terminal.
#pragma once

#include <nlohmann/json.hpp>
#include <string>
#include <string_view>

namespace gsctl {

/// Nobody reads standard output any more: there is nothing left to do, and nothing to complain of.
struct OutputGone {};

/// A line for people, written at once. Throws OutputGone; Error where it cannot be written otherwise.
void print_line(std::string_view text);

/// In ASCII: nothing in it steers a terminal.
std::string json_text(const nlohmann::ordered_json& object);

/// An object on a line of its own. Throws as print_line.
void print_json(const nlohmann::ordered_json& object);

/// The bytes as they are. Throws as print_line.
void print_raw(std::string_view bytes);

/// "gsctl: " and the text, on standard error; never throws.
void complain(std::string_view text) noexcept;

}  // namespace gsctl
