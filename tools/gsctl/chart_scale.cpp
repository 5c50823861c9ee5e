#include "tools/gsctl/chart_scale.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdio>

namespace gsctl {
namespace {

using Span = std::pair<std::int64_t, std::int64_t>;

constexpr double kBreak = 84;       // wide, what stands for a time that was cut out
constexpr double kLeastBusy = 400;  // wide, all in which something goes on
constexpr double kCutFrom = 0.5;    // of the time in which something goes on: longer quiet is cut out
constexpr double kMargin = 0.03;    // of it, before and after

std::string formatted(const char* form, int digits, double value) {
  std::array<char, 48> text{};
  snprintf(text.data(), text.size(), form, digits, value);
  return text.data();
}

std::string with_digits(double value, const char* unit) {
  const int digits = value < 9.995 ? 2 : (value < 99.95 ? 1 : 0);
  return formatted("%.*f", digits, value) + unit;
}

/// Spans that touch or overlap become one.
std::vector<Span> merged(std::vector<Span> spans, std::int64_t touch) {
  std::sort(spans.begin(), spans.end());
  std::vector<Span> result = {spans.front()};
  for (const Span& span : spans) {
    if (span.first - result.back().second <= touch)
      result.back().second = std::max(result.back().second, span.second);
    else
      result.push_back(span);
  }
  return result;
}

std::int64_t length_of(const std::vector<Span>& spans) {
  std::int64_t sum = 0;
  for (const Span& span : spans) sum += span.second - span.first;
  return sum;
}

/// A tick on the axis: as many digits as its step needs.
std::string tick_text(std::int64_t time, std::int64_t step) {
  constexpr std::int64_t kMilli = 1000;
  constexpr std::int64_t kSecond = 1'000'000;
  const auto value = static_cast<double>(time);
  const bool in_seconds = step >= kMilli || std::abs(time) >= kSecond;
  int digits = 0;
  for (std::int64_t unit = in_seconds ? kSecond : kMilli; unit > step && unit > 1; unit /= 10) ++digits;
  return formatted("%.*f", digits, value / static_cast<double>(in_seconds ? kSecond : kMilli)) +
         (in_seconds ? " s" : " ms");
}

}  // namespace

std::string time_span_text(std::int64_t microseconds) {
  const auto value = static_cast<double>(microseconds);
  if (microseconds < 1000) return std::to_string(microseconds) + " µs";
  if (microseconds < 1'000'000) return with_digits(value / 1e3, " ms");
  return with_digits(value / 1e6, " s");
}

TimeScale::TimeScale(std::vector<Span> busy, double left, double width) {
  const std::vector<Span> parts = merged(std::move(busy), 0);
  const std::int64_t sum = length_of(parts);
  const std::int64_t whole = parts.back().second - parts.front().first;
  // Where everything is but a moment, the quiet between is all that there is to show.
  const auto basis = static_cast<double>(sum > 0 ? sum : std::max<std::int64_t>(whole, 1000));
  std::vector<Span> spans = merged(parts, static_cast<std::int64_t>(basis * kCutFrom));
  const auto margin = std::max<std::int64_t>(static_cast<std::int64_t>(basis * kMargin), 1);
  for (Span& span : spans) span = {span.first - margin, span.second + margin};

  const double breaks = static_cast<double>(spans.size() - 1) * kBreak;
  const auto shown = static_cast<double>(length_of(spans));
  const double per_microsecond = std::max((width - breaks) / shown, kLeastBusy / basis);
  double x = left;
  for (const Span& span : spans) {
    const double wide = per_microsecond * static_cast<double>(span.second - span.first);
    stretches_.push_back({span.first, span.second, x, x + wide});
    x += wide + kBreak;
  }
}

double TimeScale::x(std::int64_t time) const {
  for (const Stretch& s : stretches_) {
    if (time > s.to) continue;
    const double share = static_cast<double>(time - s.from) / static_cast<double>(s.to - s.from);
    return s.x_from + std::max(share, 0.0) * (s.x_to - s.x_from);
  }
  return right();
}

std::vector<TimeScale::Tick> TimeScale::ticks(std::int64_t zero, double apart) const {
  std::vector<Tick> ticks;
  for (const Stretch& s : stretches_) {
    const double per_pixel = static_cast<double>(s.to - s.from) / (s.x_to - s.x_from);
    std::int64_t step = 1;
    for (int i = 0; static_cast<double>(step) < apart * per_pixel; ++i)
      step = i % 3 == 1 ? step / 2 * 5 : step * 2;
    std::int64_t time = (s.from - zero) / step * step + zero;
    for (; time <= s.to; time += step) {
      if (time >= s.from) ticks.push_back({x(time), tick_text(time - zero, step)});
    }
  }
  return ticks;
}

}  // namespace gsctl
