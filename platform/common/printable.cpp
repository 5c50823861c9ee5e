#include "common/printable.h"

#include <cstddef>
#include <cstdint>

namespace platform {
namespace {

/// The length of the well-formed character that `text` begins with, and its number; 0: none.
std::size_t character_in(std::string_view text, std::uint32_t* number) {
  const auto byte = [&](std::size_t i) { return static_cast<unsigned char>(text[i]); };
  const unsigned char first = byte(0);
  const std::size_t length = first < 0x80   ? 1
                             : first < 0xc2 ? 0
                             : first < 0xe0 ? 2
                             : first < 0xf0 ? 3
                             : first < 0xf5 ? 4
                                            : 0;
  if (length == 0 || length > text.size()) return 0;
  *number = length == 1 ? first : first & (0x7fU >> length);
  for (std::size_t i = 1; i < length; ++i) {
    if ((byte(i) & 0xc0) != 0x80) return 0;
    *number = *number << 6 | (byte(i) & 0x3fU);
  }
  constexpr std::uint32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
  const bool surrogate = *number >= 0xd800 && *number < 0xe000;
  return *number < kSmallest[length] || surrogate || *number > 0x10ffff ? 0 : length;
}

}  // namespace

std::string printable(std::string_view text, std::string_view kept) {
  std::string result;
  while (!text.empty()) {
    std::uint32_t number = 0;
    const std::size_t length = character_in(text, &number);
    const bool control = number < 0x20 || (number >= 0x7f && number < 0xa0);
    const bool fine = length > 0 && (!control || (length == 1 && kept.find(text[0]) != std::string_view::npos));
    result += fine ? text.substr(0, length) : "?";
    text.remove_prefix(length > 0 ? length : 1);
  }
  return result;
}

std::size_t utf8_length(std::string_view text) {
  std::size_t at = 0;
  std::uint32_t number = 0;
  while (at < text.size()) {
    const std::size_t length = character_in(text.substr(at), &number);
    if (length == 0) break;
    at += length;
  }
  return at;
}

}  // namespace platform
