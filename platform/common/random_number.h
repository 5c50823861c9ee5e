// 64 bits that nobody can guess.
#pragma once

#include <sys/random.h>

#include <cerrno>
#include <cstdint>
#include <system_error>

namespace platform {

/// Throws std::system_error.
inline std::uint64_t random_number() {
  std::uint64_t value = 0;
  if (getrandom(&value, sizeof value, 0) != sizeof value) throw std::system_error(errno, std::generic_category());
  return value;
}

}  // namespace platform
