#include "tools/gsctl/chart_drawing.h"

#include <algorithm>

#include "common/printable.h"
#include "tools/gsctl/chart_labels.h"
#include "tools/gsctl/chart_scale.h"
#include "tools/gsctl/status.h"
#include "tools/gsctl/svg.h"

namespace gsctl {
namespace {

constexpr double kPlot = 900;  // wide, without names
constexpr double kEdge = 20;   // around everything
constexpr double kText = 12;   // high
constexpr double kRow = 16;    // of labels
constexpr double kLine = 22;   // of a lane, without its labels
constexpr double kGroupBar = 20;
constexpr std::size_t kMostRows = 6;  // of labels of a lane; more are only marks
constexpr std::size_t kMostMarks = 20'000;
constexpr std::size_t kMostLanes = 200;
constexpr double kMostWide = 12'000;
constexpr std::size_t kNameLength = 24;

constexpr char kStyle[] =
    "text{font:12px system-ui,'DejaVu Sans',Verdana,sans-serif;fill:#24292f}"
    ".page{fill:#fff;stroke:#d0d7de}.title{font-weight:600;font-size:14px}.dim{fill:#656d76}"
    ".grid{stroke:#eaeef2}.axis{stroke:#8c959f}.cut{fill:#f6f8fa}"
    ".stay{stroke:#57606a;stroke-width:2}.joining{stroke:#8c959f;stroke-width:2;stroke-dasharray:3 4}"
    ".under{fill:#fff;fill-opacity:.86}"
    ".approved{fill:#2da44e;fill-opacity:.28;stroke:#1a7f37}.rejected{fill:#fa4549;fill-opacity:.25;stroke:#"
    "cf222e}"
    ".open{fill:#afb8c1;fill-opacity:.4;stroke:#6e7781}.phase{stroke:#57606a;stroke-dasharray:4 3}"
    ".end-approved{stroke:#2da44e;stroke-opacity:.55}.end-rejected{stroke:#cf222e;stroke-opacity:.55}"
    ".ask{stroke:#0969da;stroke-opacity:.55}"
    ".wait{fill:#d4a72c;fill-opacity:.28}.late{fill:url(#late);stroke:#bf8700}.late-text{fill:#7d4e00;font-weight:"
    "600}"
    ".request{fill:#0969da}.approve{fill:#2da44e;stroke:#fff}.reject{fill:#cf222e;stroke:#fff}"
    ".continue{fill:#8250df;stroke:#fff}.default{fill:#fff;stroke:#bf8700;stroke-width:2}"
    ".failure{stroke:#cf222e;stroke-width:3;fill:none}.refused{fill:#fff;stroke:#cf222e;stroke-width:2}"
    ".note{fill:#6e7781}.bad{fill:#a40e26}.good{fill:#116329}";

constexpr char kHatch[] =
    "<defs><pattern id=\"late\" width=\"8\" height=\"8\" patternUnits=\"userSpaceOnUse\" "
    "patternTransform=\"rotate(45)\"><rect width=\"8\" height=\"8\" fill=\"#fff8c5\"/>"
    "<rect width=\"3\" height=\"8\" fill=\"#eac54f\"/></pattern></defs>\n";

const char* look_of(Mark::Shape shape) {
  switch (shape) {
    case Mark::Shape::kRequest:
      return "request";
    case Mark::Shape::kRefused:
      return "refused";
    case Mark::Shape::kApprove:
      return "approve";
    case Mark::Shape::kReject:
      return "reject";
    case Mark::Shape::kContinue:
      return "continue";
    case Mark::Shape::kDefault:
      return "default";
    case Mark::Shape::kFailure:
      return "failure";
    default:
      return "note";
  }
}

const char* look_of(Protocol::End end) {
  if (end == Protocol::End::kOpen) return "open";
  return end == Protocol::End::kApproved ? "approved" : "rejected";
}

void paint_mark(Svg& svg, Mark::Shape shape, double x, double y, const std::string& tip) {
  const auto at = [&](double dx, double dy) { return Svg::number(x + dx) + " " + Svg::number(y + dy); };
  const std::string look = look_of(shape);
  if (shape == Mark::Shape::kRequest || shape == Mark::Shape::kRefused) {
    svg.path("M" + at(0, -6) + "L" + at(5, 0) + "L" + at(0, 6) + "L" + at(-5, 0) + "Z", look, tip);
  } else if (shape == Mark::Shape::kFailure) {
    svg.path("M" + at(-6, -6) + "L" + at(6, 6) + "M" + at(6, -6) + "L" + at(-6, 6), look, tip);
  } else {
    svg.circle(x, y, 5, look, tip);
  }
}

std::string shortened(const std::string& name) {
  return platform::width_of(name) <= kNameLength ? name
                                                 : platform::printable(name).substr(0, kNameLength - 1) + "…";
}

std::string name_of(const Lane& lane) {
  const std::string id = to_text(provider_of(lane.id));
  return lane.name.empty() ? id : shortened(lane.name) + " " + id;
}

std::string words(std::string name) {
  std::replace(name.begin(), name.end(), '_', ' ');
  return name;
}

/// A wait that a person who asks "why so long?" wants to see: about as long as its phase.
bool is_late(const Wait& wait, const Phase& phase) {
  return 10 * (wait.to - wait.from) > 9 * (phase.to - phase.from);
}

std::string wait_text(const Lane& lane, const Wait& wait) {
  const std::string who = lane.name.empty() ? to_text(provider_of(lane.id)) : shortened(lane.name);
  const std::string time = time_span_text(wait.to - wait.from);
  if (wait.voted) return "waits " + time + " for " + who;
  return wait.default_vote.empty() ? who + " has not voted for " + time : who + " has not voted in " + time;
}

/// One group: where its parts go, and then how they look.
class Block {
 public:
  Block(const Story& story, const TimeScale& scale, const Stretch& shown, double left);

  double height() const { return bottom_; }
  void paint(Svg& svg, double top) const;

 private:
  struct Row {
    const Lane* lane;
    LabelRows labels;
    double y = 0;  // of its line
  };

  bool is_shown(Microseconds from, Microseconds to) const { return to >= shown_.from && from <= shown_.to; }
  double x(Microseconds time) const { return scale_.x(std::clamp(time, shown_.from, shown_.to)); }
  std::string text_of(const Protocol& protocol) const;
  void label_waits(const Protocol& protocol);
  void label_marks(const std::vector<Mark>& marks, LabelRows& labels) const;
  void place();
  void paint_protocol(Svg& svg, double top, const Protocol& protocol) const;
  void paint_waits(Svg& svg, double top, const Phase& phase) const;
  void paint_row(Svg& svg, double top, const Row& row) const;
  void paint_requests(Svg& svg, double top) const;
  void paint_labels(Svg& svg, const LabelRows& labels, double lowest) const;

  const Story& story_;
  const TimeScale& scale_;
  const Stretch& shown_;
  LabelRows group_labels_;
  std::vector<Row> rows_;
  double bar_ = 0;  // its upper edge
  double bottom_ = 0;
};

Block::Block(const Story& story, const TimeScale& scale, const Stretch& shown, double left)
    : story_(story), scale_(scale), shown_(shown), group_labels_(left, scale.right(), kText) {
  for (const Lane& lane : story.lanes) rows_.push_back({&lane, LabelRows(left, scale.right(), kText)});
  for (const Protocol& protocol : story.protocols) {
    if (!is_shown(protocol.from, protocol.to)) continue;
    const bool bad = protocol.end == Protocol::End::kRejected;
    group_labels_.add(x(protocol.from), text_of(protocol), bad ? "bad" : "");
    label_waits(protocol);
  }
  label_marks(story.marks, group_labels_);
  for (Row& row : rows_) label_marks(row.lane->marks, row.labels);
  place();
}

std::string Block::text_of(const Protocol& protocol) const {
  std::string text = words(protocol.kind) + (protocol.by.empty() ? "" : " by " + shortened(protocol.by));
  if (protocol.kind == "failure") text = "failure of " + shortened(protocol.by);
  if (protocol.end == Protocol::End::kOpen) return text + ": still runs";
  text += protocol.end == Protocol::End::kApproved ? ": approved" : ": rejected";
  return protocol.phases.empty() ? text : text + " after " + time_span_text(protocol.to - protocol.from);
}

void Block::label_waits(const Protocol& protocol) {
  for (const Phase& phase : protocol.phases) {
    for (const Wait& wait : phase.waits) {
      const bool wide = x(wait.to) - x(wait.from) >= kText;
      if (!wide || !is_late(wait, phase) || !is_shown(wait.from, wait.to)) continue;
      rows_[wait.lane].labels.add(x(wait.from), wait_text(story_.lanes[wait.lane], wait), "late-text");
    }
  }
}

void Block::label_marks(const std::vector<Mark>& marks, LabelRows& labels) const {
  for (const Mark& mark : marks) {
    if (!is_shown(mark.time, mark.time)) continue;
    const bool bad = mark.shape == Mark::Shape::kReject || mark.shape == Mark::Shape::kFailure ||
                     mark.shape == Mark::Shape::kRefused;
    labels.add(x(mark.time) - 3, words(mark.label), bad ? "bad" : "dim");
  }
}

void Block::place() {
  double y = kRow + 8;  // the group's name
  y += static_cast<double>(std::min(group_labels_.rows(), kMostRows)) * kRow;
  bar_ = y;
  y += kGroupBar + 8;
  for (Row& row : rows_) {
    y += static_cast<double>(std::min(row.labels.rows(), kMostRows)) * kRow;
    row.y = y + kLine / 2;
    y += kLine + 6;
  }
  bottom_ = y + 4;
}

void Block::paint_labels(Svg& svg, const LabelRows& labels, double lowest) const {
  for (const LabelRows::Label& label : labels.labels()) {
    if (label.row >= kMostRows) continue;
    const double y = lowest - static_cast<double>(label.row) * kRow;
    svg.rectangle(label.x - 2, y - kText, text_width(label.text, kText) + 4, kRow - 1, "under");
    svg.text(label.x, y, label.text, label.look);
  }
}

void Block::paint_protocol(Svg& svg, double top, const Protocol& protocol) const {
  const double from = x(protocol.from);
  const double wide = std::max(x(protocol.to) - from, 3.0);
  const std::string tip =
      text_of(protocol) + (protocol.event_number == 0 ? "" : ", event " + std::to_string(protocol.event_number));
  svg.rectangle(from, top + bar_, wide, kGroupBar, look_of(protocol.end), 3, tip);
  for (const Phase& phase : protocol.phases) {
    if (&phase != &protocol.phases.front()) {
      svg.line(x(phase.from), top + bar_, x(phase.from), top + bottom_, "phase");
    }
    const std::string name = "phase " + std::to_string(phase.number);
    if (x(phase.to) - x(phase.from) > text_width(name, kText) + 8) {
      svg.text(x(phase.from) + 5, top + bar_ + kGroupBar - 6, name, "dim");
    }
    paint_waits(svg, top, phase);
  }
  if (protocol.end == Protocol::End::kOpen) return;
  svg.line(x(protocol.to), top + bar_ + kGroupBar, x(protocol.to), top + bottom_,
           std::string("end-") + look_of(protocol.end));
}

void Block::paint_waits(Svg& svg, double top, const Phase& phase) const {
  for (const Wait& wait : phase.waits) {
    if (!is_shown(wait.from, wait.to)) continue;
    const double wide = x(wait.to) - x(wait.from);
    const bool late = is_late(wait, phase) && wide >= kText;
    const double high = late ? 14 : 8;
    svg.rectangle(x(wait.from), top + rows_[wait.lane].y - high / 2, std::max(wide, 1.0), high,
                  late ? "late" : "wait", 2, wait_text(story_.lanes[wait.lane], wait));
  }
}

void Block::paint_requests(Svg& svg, double top) const {
  for (const Row& row : rows_) {
    for (const Mark& mark : row.lane->marks) {
      if (mark.shape != Mark::Shape::kRequest || !is_shown(mark.time, mark.time)) continue;
      svg.line(x(mark.time), top + row.y, x(mark.time), top + bar_ + kGroupBar, "ask");
    }
  }
}

void Block::paint_row(Svg& svg, double top, const Row& row) const {
  const double y = top + row.y;
  for (const Mark& mark : row.lane->marks) {
    if (is_shown(mark.time, mark.time)) {
      paint_mark(svg, mark.shape, x(mark.time), y, mark.label + " at " + time_span_text(mark.time - shown_.zero));
    }
  }
}

void Block::paint(Svg& svg, double top) const {
  svg.text(kEdge, top + kRow, "group " + shortened(story_.group), "title");
  for (const Row& row : rows_) {
    svg.text(kEdge, top + row.y + 4, name_of(*row.lane), "");
    for (const Stay& stay : row.lane->stays) {
      if (!is_shown(stay.from, stay.to)) continue;
      svg.line(x(stay.from), top + row.y, x(stay.to), top + row.y, stay.member ? "stay" : "joining");
    }
  }
  paint_requests(svg, top);
  for (const Protocol& protocol : story_.protocols) {
    if (is_shown(protocol.from, protocol.to)) paint_protocol(svg, top, protocol);
  }
  paint_labels(svg, group_labels_, top + bar_ - 5);
  for (const Row& row : rows_) {
    paint_labels(svg, row.labels, top + row.y - kLine / 2 + 1);
    paint_row(svg, top, row);
  }
  for (const Mark& mark : story_.marks) {
    if (is_shown(mark.time, mark.time)) {
      paint_mark(svg, mark.shape, x(mark.time), top + bar_ + kGroupBar / 2, mark.label);
    }
  }
}

std::vector<std::pair<Microseconds, Microseconds>> busy_times(const std::vector<Story>& stories,
                                                              const Stretch& shown) {
  std::vector<std::pair<Microseconds, Microseconds>> busy;
  const auto add = [&](Microseconds from, Microseconds to) {
    if (to >= shown.from && from <= shown.to)
      busy.emplace_back(std::max(from, shown.from), std::min(to, shown.to));
  };
  const auto add_marks = [&](const std::vector<Mark>& marks) {
    for (const Mark& mark : marks) add(mark.time, mark.time);
  };
  for (const Story& story : stories) {
    for (const Protocol& protocol : story.protocols) add(protocol.from, protocol.to);
    for (const Lane& lane : story.lanes) add_marks(lane.marks);
    add_marks(story.marks);
  }
  return busy;
}

void check_size(const std::vector<Story>& stories, std::size_t marks) {
  std::size_t lanes = 0;
  for (const Story& story : stories) lanes += story.lanes.size();
  if (lanes > kMostLanes) {
    throw Error(kRefused, std::to_string(lanes) + " members do not fit into a picture: choose with --group");
  }
  if (marks > kMostMarks)
    throw Error(kRefused, "too much happens for one picture: choose with --from, --to or --group");
}

void paint_axis(Svg& svg, const TimeScale& scale, Microseconds zero, double top, double bottom) {
  constexpr double kApart = 70;
  LabelRows labels(0, scale.right() + kEdge, kText);
  for (const TimeScale::Tick& tick : scale.ticks(zero, kApart)) {
    svg.line(tick.x, top, tick.x, bottom + 4, "grid");
    const std::size_t before = labels.labels().size();
    labels.add(tick.x - text_width(tick.text, kText) / 2, tick.text, "dim");
    const LabelRows::Label& label = labels.labels()[before];
    if (label.row == 0) svg.text(label.x, bottom + 18, label.text, label.look);
  }
  const auto& stretches = scale.stretches();
  for (std::size_t i = 0; i < stretches.size(); ++i) {
    svg.line(stretches[i].x_from, bottom, stretches[i].x_to, bottom, "axis");
    if (i == 0) continue;
    const double from = stretches[i - 1].x_to;
    const double wide = stretches[i].x_from - from;
    const std::string text = time_span_text(stretches[i].from - stretches[i - 1].to) + " cut";
    svg.rectangle(from, top, wide, bottom - top, "cut");
    svg.text(from + (wide - text_width(text, kText) * 0.9) / 2, bottom - 4, text, "dim");
  }
}

void paint_legend(Svg& svg, double y) {
  using Shape = Mark::Shape;
  constexpr std::pair<Shape, const char*> kShapes[] = {
      {Shape::kRequest, "request"},   {Shape::kRefused, "refused"},      {Shape::kApprove, "approve"},
      {Shape::kContinue, "continue"}, {Shape::kReject, "reject"},        {Shape::kDefault, "default vote"},
      {Shape::kFailure, "failure"},   {Shape::kNote, "the group itself"}};
  double x = kEdge + 6;
  for (const auto& [shape, name] : kShapes) {
    paint_mark(svg, shape, x, y - 4, "");
    svg.text(x + 12, y, name, "dim");
    x += text_width(name, kText) + 34;
  }
  svg.rectangle(x - 5, y - 11, 18, 14, "late", 2);
  svg.text(x + 20, y, "the vote that is waited for", "dim");
}

double names_width(const std::vector<Story>& stories) {
  double width = 0;
  for (const Story& story : stories) {
    for (const Lane& lane : story.lanes) width = std::max(width, text_width(name_of(lane), kText));
  }
  return width;
}

}  // namespace

std::string draw(const std::vector<Story>& stories, const std::vector<Recording::Gap>& missed,
                 const Stretch& shown) {
  auto busy = busy_times(stories, shown);
  if (busy.empty()) throw Error(kRefused, "nothing happens in it: choose another stretch or --group");
  check_size(stories, busy.size());
  const double left = kEdge + names_width(stories) + 16;
  const TimeScale scale(std::move(busy), left, kPlot);
  const double width = scale.right() + kEdge;
  if (width > kMostWide)
    throw Error(kRefused, "too much happens for one picture: choose with --from, --to or --group");

  std::vector<Block> blocks;
  double height = kEdge;
  for (const Story& story : stories) {
    blocks.emplace_back(story, scale, shown, left);
    height += blocks.back().height();
  }
  const double axis = height;
  std::uint64_t gaps = 0;
  for (const Recording::Gap& gap : missed)
    gaps += gap.time_us >= shown.from && gap.time_us <= shown.to ? gap.count : 0;
  height += gaps > 0 ? 90 : 70;

  Svg svg(width, height, "What happened in " + std::to_string(stories.size()) + " groups", kStyle);
  svg.raw(kHatch);
  svg.rectangle(0.5, 0.5, width - 1, height - 1, "page", 8);
  paint_axis(svg, scale, shown.zero, kEdge + kRow + 8, axis);
  double top = kEdge;
  for (const Block& block : blocks) {
    block.paint(svg, top);
    top += block.height();
  }
  paint_legend(svg, axis + 48);
  if (gaps > 0)
    svg.text(kEdge, axis + 70, std::to_string(gaps) + " happenings are missing in the recording", "bad");
  return svg.finish();
}

}  // namespace gsctl
