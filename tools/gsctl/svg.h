// Writes SVG. A picture here is a few hundred rectangles, lines and texts, so what a library of shapes would add
// is less than what it would have to be told.
#pragma once

#include <string>
#include <string_view>

namespace gsctl {

class Svg {
 public:
  /// `style` is its CSS.
  Svg(double width, double height, const std::string& title, const std::string& style);

  /// Shapes are painted one over the other. `look` is a class of the style; `tip`, where there is one, is what a
  /// pointer over the shape shows.
  void rectangle(double x, double y, double width, double height, const std::string& look, double radius = 0,
                 const std::string& tip = "");
  void line(double x1, double y1, double x2, double y2, const std::string& look);
  void circle(double x, double y, double radius, const std::string& look, const std::string& tip = "");
  /// `d` as in SVG.
  void path(const std::string& d, const std::string& look, const std::string& tip = "");
  void text(double x, double y, const std::string& text, const std::string& look);
  /// As it is: definitions.
  void raw(const std::string& markup) { body_ += markup; }

  std::string finish() const { return head_ + body_ + "</svg>\n"; }

  static std::string number(double value);

 private:
  void shape(const std::string& element, const std::string& look, const std::string& tip);

  std::string head_;
  std::string body_;
};

}  // namespace gsctl
