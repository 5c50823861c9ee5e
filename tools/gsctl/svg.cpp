#include "tools/gsctl/svg.h"

#include <array>
#include <cstdio>

#include "common/printable.h"

namespace gsctl {
namespace {

std::string escaped(const std::string& text) {
  std::string result;
  for (const char c : platform::printable(text, "")) {
    switch (c) {
      case '&':
        result += "&amp;";
        break;
      case '<':
        result += "&lt;";
        break;
      case '>':
        result += "&gt;";
        break;
      case '"':
        result += "&quot;";
        break;
      default:
        result += c;
    }
  }
  return result;
}

std::string attribute(const char* name, double value) {
  return std::string(" ") + name + "=\"" + Svg::number(value) + "\"";
}

}  // namespace

std::string Svg::number(double value) {
  std::array<char, 40> text{};
  snprintf(text.data(), text.size(), "%.1f", value);
  const std::string_view shown = text.data();
  return std::string(shown.ends_with(".0") ? shown.substr(0, shown.size() - 2) : shown);
}

Svg::Svg(double width, double height, const std::string& title, const std::string& style) {
  head_ = "<svg xmlns=\"http://www.w3.org/2000/svg\" viewBox=\"0 0 " + number(width) + " " + number(height) +
          "\"" + attribute("width", width) + attribute("height", height) + " role=\"img\">\n<title>" +
          escaped(title) + "</title>\n<style>" + style + "</style>\n";
}

void Svg::shape(const std::string& element, const std::string& look, const std::string& tip) {
  body_ += "<" + element + " class=\"" + look + "\"";
  const std::string name = element.substr(0, element.find(' '));
  body_ += tip.empty() ? "/>\n" : "><title>" + escaped(tip) + "</title></" + name + ">\n";
}

void Svg::rectangle(double x, double y, double width, double height, const std::string& look, double radius,
                    const std::string& tip) {
  shape("rect" + attribute("x", x) + attribute("y", y) + attribute("width", width) + attribute("height", height) +
            (radius > 0 ? attribute("rx", radius) : ""),
        look, tip);
}

void Svg::line(double x1, double y1, double x2, double y2, const std::string& look) {
  shape("line" + attribute("x1", x1) + attribute("y1", y1) + attribute("x2", x2) + attribute("y2", y2), look, "");
}

void Svg::circle(double x, double y, double radius, const std::string& look, const std::string& tip) {
  shape("circle" + attribute("cx", x) + attribute("cy", y) + attribute("r", radius), look, tip);
}

void Svg::path(const std::string& d, const std::string& look, const std::string& tip) {
  shape("path d=\"" + d + "\"", look, tip);
}

void Svg::text(double x, double y, const std::string& text, const std::string& look) {
  body_ +=
      "<text" + attribute("x", x) + attribute("y", y) + " class=\"" + look + "\">" + escaped(text) + "</text>\n";
}

}  // namespace gsctl
