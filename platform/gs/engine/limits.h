// What one engine may be made to do and to keep. Replicas must have the same.
#pragma once

#include <cstddef>
#include <cstdint>

namespace gs {

struct Limits {
  /// Units of work after which an event leaves the rest to a ContinueEvent (see work.h); at least 1.
  std::size_t slice = 128;
  // Bytes of what is kept for a session, for all sessions of a user, and in all (see ledger.h).
  std::size_t session_bytes = std::size_t{128} << 20;
  std::size_t user_bytes = std::size_t{256} << 20;
  std::size_t total_bytes = std::size_t{1} << 30;
  /// Seconds that a phase may last, whatever its protocol asks for; 0: as long as it asks for.
  std::uint16_t max_phase_time = 0;
};

}  // namespace gs
