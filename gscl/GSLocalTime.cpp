#include <sched.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <chrono>

#include "gscl/GSLocalTime_internal.h"
#include "gscl/scopes_internal.h"

namespace {

// How far local time is ahead of UTC, in seconds, as it was last looked up, in one word with the minute and the
// time zone for which it was. The C library does that under a lock, and a process that is forked meanwhile finds
// the lock taken for ever. So it is asked once a minute, by one thread, and the others go on with the last answer;
// a process forked just then, too.
constexpr int kOffsetBits = 18;
constexpr int kMinuteBits = 26;
constexpr long kBias = 1 << (kOffsetBits - 1);  // keeps offsets positive; more than a day

constinit std::atomic<uint64_t> known_offset{0};  // 0: nothing is known
constinit std::atomic<pid_t> looking_up{0};       // the process whose thread does it

/// Minute and time zone of a look-up, above the bits of the offset.
uint64_t stampOf(time_t now) {
  uint64_t zone = 0xcbf29ce484222325;
  const char* name = getenv("TZ");
  for (const char* c = name != nullptr ? name : "/"; *c != '\0'; ++c) {
    zone = (zone ^ static_cast<unsigned char>(*c)) * 0x100000001b3;
  }
  const uint64_t minute = static_cast<uint64_t>(now / 60) & ((1 << kMinuteBits) - 1);
  return (zone ^ zone >> 32) << (kOffsetBits + kMinuteBits) | minute << kOffsetBits;
}

long offsetIn(uint64_t word) { return static_cast<long>(word & ((1 << kOffsetBits) - 1)) - kBias; }

long lookUpOffset(time_t now) {
  using namespace std::chrono;
  tm local = {};
  tzset();  // localtime_r need not notice a change of TZ
  if (localtime_r(&now, &local) == nullptr) return 0;
  const auto day = sys_days(year(local.tm_year + 1900) / (local.tm_mon + 1) / local.tm_mday);
  const auto time = day + hours(local.tm_hour) + minutes(local.tm_min) + seconds(local.tm_sec);
  return static_cast<long>(time.time_since_epoch().count() - now);
}

long offsetAt(time_t now) {
  const uint64_t stamp = stampOf(now);
  for (;;) {
    const uint64_t known = known_offset.load();
    if (known != 0 && known >> kOffsetBits == stamp >> kOffsetBits) return offsetIn(known);
    const gscl_internal::CancellationHold hold;
    const pid_t self = getpid();
    pid_t other = 0;
    if (looking_up.compare_exchange_strong(other, self)) {
      const long offset = lookUpOffset(now);
      known_offset.store(stamp | static_cast<uint64_t>(offset + kBias));
      looking_up.store(0);
      return offset;
    }
    if (known != 0) return offsetIn(known);
    if (other != self) return 0;
    sched_yield();  // the first look-up of all
  }
}

}  // namespace

void gscl_internal::lineTime(char (&text)[kLineTimeBytes]) {
  using namespace std::chrono;
  static constexpr char kMonths[] = "JanFebMarAprMayJunJulAugSepOctNovDec";
  const time_t now = time(nullptr);
  const sys_seconds local{seconds(now + offsetAt(now))};
  const auto midnight = floor<days>(local);
  const year_month_day date(midnight);
  const hh_mm_ss clock(local - midnight);
  snprintf(text, sizeof text, "%.3s %2u %02d:%02d:%02d", kMonths + 3 * (static_cast<unsigned>(date.month()) - 1),
           static_cast<unsigned>(date.day()), static_cast<int>(clock.hours().count()),
           static_cast<int>(clock.minutes().count()), static_cast<int>(clock.seconds().count()));
}
