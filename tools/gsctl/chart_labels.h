// Puts texts beside one another, and under one another where there is no room.
#pragma once

#include <algorithm>
#include <string>
#include <vector>

#include "common/table.h"

namespace gsctl {

/// About as wide as a text is in the widest of the fonts that a viewer may take for it.
inline double text_width(const std::string& text, double size) {
  constexpr double kPerCharacter = 0.62;
  return static_cast<double>(platform::width_of(text)) * size * kPerCharacter;
}

/// Rows of texts that do not overlap.
class LabelRows {
 public:
  struct Label {
    double x;
    std::size_t row;
    std::string text;
    std::string look;
  };

  LabelRows(double left, double right, double size) : left_(left), right_(right), size_(size) {}

  /// In the first row with room at `x`, or as near as the picture's edges let it be.
  void add(double x, const std::string& text, const std::string& look) {
    const double width = text_width(text, size_);
    const double from = std::max(left_, std::min(x, right_ - width));
    std::size_t row = 0;
    while (row < rows_.size() && !has_room(rows_[row], from, from + width)) ++row;
    if (row == rows_.size()) rows_.emplace_back();
    rows_[row].push_back({from, from + width + kBetween});
    labels_.push_back({from, row, text, look});
  }

  std::size_t rows() const { return rows_.size(); }
  const std::vector<Label>& labels() const { return labels_; }

 private:
  static constexpr double kBetween = 8;
  struct Taken {
    double from, to;
  };

  static bool has_room(const std::vector<Taken>& row, double from, double to) {
    return std::none_of(row.begin(), row.end(),
                        [&](const Taken& taken) { return from < taken.to && taken.from < to + kBetween; });
  }

  const double left_;
  const double right_;
  const double size_;
  std::vector<std::vector<Taken>> rows_;
  std::vector<Label> labels_;
};

}  // namespace gsctl
