// What a daemon tells of itself, as values: the tables of inspect.fbs, and their way to bytes and back.
#pragma once

#include <optional>
#include <span>
#include <string>

#include "inspect_generated.h"

namespace gs::inspect {

inline constexpr std::size_t kMaxGroupsAsked = 256;
inline constexpr std::size_t kMaxBytes = 8 * 1024 * 1024;  // of a question or report

// Bytes fit any message; nothing that was received is used before it is verified.
std::string write(const AskT& ask);
std::string write(const ReportT& report);
std::optional<AskT> read_ask(std::span<const std::byte> bytes, std::string* error);
std::optional<ReportT> read_report(std::span<const std::byte> bytes, std::string* error);

}  // namespace gs::inspect
