// The axis of time of a chart: to scale wherever something goes on; a long time in which nothing does is cut out.
#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

namespace gsctl {

class TimeScale {
 public:
  struct Stretch {
    std::int64_t from, to;  // microseconds
    double x_from, x_to;
  };
  struct Tick {
    double x;
    std::string text;
  };

  /// `busy`: from and to of what goes on, in any order, one at least. `left` is where the first begins; it is as
  /// wide as `width`, or wider where so much is cut out that it must be.
  TimeScale(std::vector<std::pair<std::int64_t, std::int64_t>> busy, double left, double width);

  double x(std::int64_t time) const;
  double right() const { return stretches_.back().x_to; }
  /// Between two of them time was cut out.
  const std::vector<Stretch>& stretches() const { return stretches_; }
  /// Counted from `zero`; at least `apart` from one another.
  std::vector<Tick> ticks(std::int64_t zero, double apart) const;

 private:
  std::vector<Stretch> stretches_;
};

/// "85 µs", "2.00 s": three digits.
std::string time_span_text(std::int64_t microseconds);

}  // namespace gsctl
