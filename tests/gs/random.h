// What the seeded simulations share.
#pragma once

#include <cstdint>
#include <cstdlib>
#include <iterator>

namespace gs::test {

/// The same numbers on every platform.
class Random {
 public:
  explicit Random(std::uint64_t seed) : state_(seed) {}
  std::uint64_t next() {  // splitmix64
    std::uint64_t z = state_ += 0x9E3779B97F4A7C15u;
    z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9u;
    z = (z ^ (z >> 27)) * 0x94D049BB133111EBu;
    return z ^ (z >> 31);
  }
  std::uint8_t byte() { return static_cast<std::uint8_t>(next()); }
  int below(int bound) { return static_cast<int>(next() % static_cast<std::uint64_t>(bound)); }
  bool chance(int percent) { return below(100) < percent; }
  template <typename List>
  auto& one_of(List& list) {
    return *std::next(list.begin(), below(static_cast<int>(list.size())));
  }

 private:
  std::uint64_t state_;
};

inline std::uint64_t number_from(const char* variable, std::uint64_t otherwise) {
  const char* value = std::getenv(variable);
  return value ? std::strtoull(value, nullptr, 10) : otherwise;
}

}  // namespace gs::test
