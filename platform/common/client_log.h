// Lines about clients, so many and no more: what a client does must not fill the disk.
#pragma once

#include <spdlog/logger.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <string_view>

#include "common/clock.h"

namespace platform {

/// Lets through kBurst lines for each user and kBurstOfAll for all of them together, then so many a second. It
/// goes by the user, since a client that comes back has another process id. What it leaves out it counts and
/// tells. With the log's level at debug it lets everything through: the operator has asked for it.
///
/// Not safe for concurrent use. It knows no clock: it is told the time, which never goes back.
class ClientLog {
 public:
  using Time = platform::Time;
  static constexpr double kBurst = 100;
  static constexpr double kPerSecond = 10;
  static constexpr double kBurstOfAll = 400;
  static constexpr double kPerSecondOfAll = 40;
  static constexpr std::size_t kMaxUsers = 64;  // known at a time; the others count as one
  static constexpr Time kTellAfter{5'000};

  /// `log` outlives it.
  explicit ClientLog(spdlog::logger& log) : log_(log) {}

  /// `user`: on whose account the line is written, nothing: nobody's. True: a line was left out, the first since
  /// that was told last: call tell_left_out kTellAfter later.
  [[nodiscard]] bool write(std::optional<std::uint32_t> user, spdlog::level::level_enum level,
                           std::string_view line, Time now);
  /// In one line, how many were left out and for whom.
  void tell_left_out();

 private:
  /// Of lines that may be written at once.
  struct Bucket {
    double lines;
    Time filled;

    bool take(Time now, double per_second, double most);
  };
  struct User {
    Bucket bucket;
    std::uint64_t left_out = 0;
  };
  static constexpr std::uint32_t kOthers = UINT32_MAX;  // no user's id

  User& account(std::uint32_t user, Time now);

  spdlog::logger& log_;
  Bucket all_{kBurstOfAll, Time{}};
  std::map<std::uint32_t, User> users_;
  std::uint64_t left_out_ = 0;
};

}  // namespace platform
