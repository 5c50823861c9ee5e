#include "common/client_log.h"

#include <algorithm>
#include <string>

namespace platform {

bool ClientLog::Bucket::take(Time now, double per_second, double most) {
  const double seconds = static_cast<double>((now - filled).count()) / 1000;
  lines = std::min(most, lines + seconds * per_second);
  filled = now;
  if (lines < 1) return false;
  lines -= 1;
  return true;
}

ClientLog::User& ClientLog::account(std::uint32_t user, Time now) {
  const auto found = users_.find(user);
  if (found != users_.end()) return found->second;
  if (users_.size() >= kMaxUsers) {
    constexpr Time kFull{static_cast<Time::rep>(1000 * kBurst / kPerSecond)};
    std::erase_if(users_, [&](const auto& entry) {
      return entry.second.left_out == 0 && now - entry.second.bucket.filled >= kFull;
    });
  }
  if (users_.size() >= kMaxUsers) user = kOthers;
  return users_.try_emplace(user, User{{kBurst, now}}).first->second;
}

bool ClientLog::write(std::optional<std::uint32_t> user, spdlog::level::level_enum level, std::string_view line,
                      Time now) {
  if (!log_.should_log(level)) return false;
  User& of = account(user.value_or(kOthers), now);
  const bool limited = !log_.should_log(spdlog::level::debug);
  const bool allowed = of.bucket.take(now, kPerSecond, kBurst) && all_.take(now, kPerSecondOfAll, kBurstOfAll);
  if (!limited || allowed) {
    log_.log(level, line);
    return false;
  }
  ++of.left_out;
  return ++left_out_ == 1;
}

void ClientLog::tell_left_out() {
  if (left_out_ == 0) return;
  std::string whom;
  for (auto& [id, user] : users_) {
    if (user.left_out == 0) continue;
    whom += (whom.empty() ? "" : ", ") + std::to_string(user.left_out) + " of " +
            (id == kOthers ? "others" : "uid " + std::to_string(id));
    user.left_out = 0;
  }
  log_.warn("{} lines about clients were left out: {}", left_out_, whom);
  left_out_ = 0;
}

}  // namespace platform
