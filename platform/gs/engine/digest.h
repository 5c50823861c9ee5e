// A running hash over a state, for comparing replicas. Not for security.
#pragma once

#include <cstdint>
#include <cstring>
#include <string_view>
#include <type_traits>

#include "engine/limits.h"
#include "engine/types.h"

namespace gs {

class Digest {
 public:
  template <typename T>
  requires(std::is_integral_v<T> || std::is_enum_v<T>) void add(T value) {
    mix(static_cast<std::uint64_t>(value));
  }
  void add(std::string_view bytes) {
    mix(bytes.size());
    while (bytes.size() >= sizeof(std::uint64_t)) {
      std::uint64_t word = 0;
      std::memcpy(&word, bytes.data(), sizeof word);
      mix(word);
      bytes.remove_prefix(sizeof word);
    }
    std::uint64_t rest = 0;
    std::memcpy(&rest, bytes.data(), bytes.size());
    mix(rest);
  }
  void add(const std::string& bytes) { add(std::string_view(bytes)); }
  void add(const SharedBytes& bytes) {
    add(bytes != nullptr);
    if (bytes) add(std::string_view(*bytes));
  }
  void add(const Endpoint& to) {
    add(to.session.node);
    add(to.session.number);
    add(to.token);
  }
  void add(ProviderId id) {
    add(id.instance);
    add(id.node);
  }
  void add(const Limits& limits) {
    add(limits.slice);
    add(limits.session_bytes);
    add(limits.user_bytes);
    add(limits.total_bytes);
    add(limits.max_phase_time);
  }
  void add(const ProtocolTerms& terms) {
    add(terms.num_phases);
    add(terms.time_limit);
  }
  void add(const GroupAttributes& a) {
    add(a.client_version);
    add(a.batch_control);
    add(a.num_phases);
    add(a.source_reflection_num_phases);
    add(a.default_vote);
    add(a.merge_control);
    add(a.time_limit);
    add(a.source_reflection_time_limit);
    add(a.group_name);
    add(a.source_group_name);
  }
  std::uint64_t value() const { return value_; }

 private:
  void mix(std::uint64_t word) {
    value_ = (value_ ^ word) * 0x9E3779B97F4A7C15u;
    value_ ^= value_ >> 29;
  }
  std::uint64_t value_ = 0xCBF29CE484222325u;
};

}  // namespace gs
