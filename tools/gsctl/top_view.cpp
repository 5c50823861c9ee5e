#include "tools/gsctl/top_view.h"

#include <algorithm>
#include <array>
#include <cstdio>

#include "common/clock.h"
#include "common/printable.h"
#include "common/table.h"

namespace gsctl {
namespace {

using Look = ScreenLine::Look;

constexpr std::array<const char*, 5> kGroupOrders = {"name", "members", "events", "age", "waiting"};
constexpr std::array<const char*, 4> kSessionOrders = {"to read", "program", "members", "age"};

std::string rate_text(double rate) {
  std::array<char, 32> text{};
  snprintf(text.data(), text.size(), rate > 0 && rate < 10 ? "%.1f" : "%.0f", rate);
  return text.data();
}

/// What stands in a column: at most so many characters.
std::string fitted(const std::string& text, std::size_t width) {
  const std::string shown = platform::printable(text, "");
  if (platform::width_of(shown) <= width) return platform::padded(shown, width);
  std::string cut;
  for (std::size_t at = 0; platform::width_of(cut) + 1 < width && at < shown.size(); ++at) cut += shown[at];
  while (platform::utf8_length(cut) < cut.size()) cut.pop_back();
  return platform::padded(cut + "~", width);
}

std::string waits_text(const inspect::GroupT& group) {
  if (!group.running) return "-";
  const inspect::ProtocolT& running = *group.running;
  std::string text = running.kind;
  if (running.n_phase) text += " " + std::to_string(running.phase) + ", " + duration_text(running.age_ms);
  return running.missing.empty() ? text : text + ": " + to_text(running.missing);
}

std::int64_t wait_of(const inspect::GroupT& group) { return group.running ? group.running->age_ms : -1; }

bool has(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

}  // namespace

// ------------------------------------------------------------------------------------------------ what is known

void TopView::count_rates(const Snapshot& now) {
  const double seconds = static_cast<double>((platform::now() - told_at_).count()) / 1000;
  std::map<std::string, std::uint64_t> before;
  for (const auto& group : snapshot_.groups) before[group->name] = group->event_number;
  rates_.clear();
  events_ = requests_ = 0;
  if (snapshot_.daemon.pid != now.daemon.pid || seconds <= 0) return;
  for (const auto& group : now.groups) {
    constexpr std::uint64_t kBornAgain = 100'000'000;  // no group has as many events in the time
    const auto found = before.find(group->name);
    if (found == before.end() || group->event_number - found->second > kBornAgain) continue;
    rates_[group->name] = static_cast<double>(group->event_number - found->second) / seconds;
    events_ += rates_[group->name];
  }
  const std::uint64_t requests = count_of(now.daemon, "requests") - count_of(snapshot_.daemon, "requests");
  requests_ = static_cast<double>(requests) / seconds;
}

void TopView::told(Snapshot snapshot) {
  count_rates(snapshot);
  told_at_ = platform::now();
  snapshot_ = std::move(snapshot);
  trouble_.clear();
}

double TopView::rate_of(const std::string& group) const {
  const auto found = rates_.find(group);
  return found == rates_.end() ? 0 : found->second;
}

Wanted TopView::wanted() const { return {view_ == View::kSessions, view_ == View::kGroup ? group_ : ""}; }

// ------------------------------------------------------------------------------------------------ the tables

std::vector<const inspect::GroupT*> TopView::sorted_groups() const {
  std::vector<const inspect::GroupT*> list;
  for (const auto& group : snapshot_.groups) {
    if (has(group->name, filter_)) list.push_back(group.get());
  }
  const std::size_t order = order_.contains(View::kGroups) ? order_.at(View::kGroups) : 0;
  const auto before = [&](const inspect::GroupT* a, const inspect::GroupT* b) {
    switch (order) {
      case 1:
        return a->members.size() > b->members.size();
      case 2:
        return rate_of(a->name) > rate_of(b->name);
      case 3:
        return a->age_ms < b->age_ms;
      case 4:
        return wait_of(*a) > wait_of(*b);
      default:
        return a->name < b->name;
    }
  };
  std::stable_sort(list.begin(), list.end(), before);
  if (reversed_) std::reverse(list.begin(), list.end());
  return list;
}

std::vector<const inspect::SessionT*> TopView::sorted_sessions() const {
  const auto program = [](const inspect::SessionT* s) { return s->process ? s->process->program : ""; };
  std::vector<const inspect::SessionT*> list;
  for (const auto& session : snapshot_.sessions) {
    if (has(program(session.get()), filter_)) list.push_back(session.get());
  }
  const std::size_t order = order_.contains(View::kSessions) ? order_.at(View::kSessions) : 0;
  const auto before = [&](const inspect::SessionT* a, const inspect::SessionT* b) {
    switch (order) {
      case 1:
        return program(a) < program(b);
      case 2:
        return a->providers > b->providers;
      case 3:
        return a->age_ms < b->age_ms;
      default:
        return a->notification_bytes > b->notification_bytes;
    }
  };
  std::stable_sort(list.begin(), list.end(), before);
  if (reversed_) std::reverse(list.begin(), list.end());
  return list;
}

TopView::Table TopView::groups() const {
  Table table{{{"Group", 20}, {"Members", 7}, {"Subs", 5}, {"Event/s", 7}, {"Age", 7}, {"Runs, and waits for", 0}},
              {}};
  for (const inspect::GroupT* group : sorted_groups()) {
    table.entries.push_back(
        {group->name,
         {group->name, std::to_string(group->members.size()), std::to_string(group->subscribers),
          rate_text(rate_of(group->name)), duration_text(group->age_ms), waits_text(*group)}});
  }
  return table;
}

TopView::Table TopView::sessions() const {
  Table table{{{"Program", 18}, {"PID", 8}, {"Members", 7}, {"Subs", 5}, {"To read", 9}, {"Age", 7}, {"User", 0}},
              {}};
  for (const inspect::SessionT* session : sorted_sessions()) {
    const inspect::ProcessT* process = session->process.get();
    const std::string silent = session->responsive ? "" : " (does not answer)";
    table.entries.push_back({std::to_string(session->number),
                             {process ? process->program : "-", process ? std::to_string(process->pid) : "-",
                              std::to_string(session->providers), std::to_string(session->subscribers),
                              size_text(session->notification_bytes), duration_text(session->age_ms),
                              (process ? user_text(process->uid) : "-") + silent}});
  }
  return table;
}

TopView::Table TopView::members() const {
  Table table{{{"Member", 11}, {"Name", 18}, {"State", 8}, {"PID", 8}, {"Age", 7}, {"Program", 0}}, {}};
  for (const auto& member : snapshot_.members) {
    const inspect::ProcessT* process = member->process.get();
    const std::string silent = member->responsive ? "" : " (does not answer)";
    table.entries.push_back(
        {to_text(member->id),
         {to_text(member->id), member->name, member->state, process ? std::to_string(process->pid) : "-",
          duration_text(member->age_ms), (process ? process->program : "-") + silent}});
  }
  return table;
}

TopView::Table TopView::table() const {
  if (view_ == View::kSessions) return sessions();
  return view_ == View::kGroup ? members() : groups();
}

const char* TopView::order() const {
  const std::size_t order = order_.contains(view_) ? order_.at(view_) : 0;
  return view_ == View::kSessions ? kSessionOrders[order] : kGroupOrders[order];
}

// ------------------------------------------------------------------------------------------------ the screen

void TopView::add_head(std::vector<ScreenLine>& to) const {
  const inspect::DaemonT& daemon = snapshot_.daemon;
  const auto count = [&](const char* name) { return std::to_string(count_of(daemon, name)); };
  const std::string nodes = daemon.nodes.size() > 1 ? " of " + std::to_string(daemon.nodes.size()) : "";
  to.push_back({"gsd " + daemon.version + ", node " + std::to_string(daemon.node) + nodes + ", " +
                    daemon.ordering + ", up " + duration_text(daemon.age_ms) +
                    (daemon.serving ? "" : ", does not serve"),
                Look::kBold});
  to.push_back({"groups " + count("groups") + "  members " + count("members") + "  subscribers " +
                count("subscribers") + "  sessions " + count("sessions")});
  to.push_back({"events " + rate_text(events_) + "/s  requests " + rate_text(requests_) + "/s  running " +
                count("running_protocols") + "  to read " + size_text(count_of(daemon, "waiting_bytes"))});
  constexpr platform::Duration kLate(3000);
  const auto since = platform::now() - told_at_;
  if (!trouble_.empty()) {
    to.push_back({trouble_, Look::kBold});
  } else if (since > kLate) {
    to.push_back({"the daemon has not answered for " + duration_text(since.count()), Look::kBold});
  } else if (filtering_ || !filter_.empty()) {
    to.push_back({"filter: " + filter_ + (filtering_ ? "_" : ""), Look::kBold});
  } else {
    to.emplace_back();
  }
  for (ScreenLine& line : to) line.text = platform::printable(line.text, "");
}

void TopView::add_group(std::vector<ScreenLine>& to) const {
  const auto found = std::find_if(snapshot_.groups.begin(), snapshot_.groups.end(),
                                  [&](const auto& group) { return group->name == group_; });
  if (found == snapshot_.groups.end()) {
    to.push_back({platform::printable("There is no group '" + group_ + "' any more."), Look::kBold});
    return;
  }
  const inspect::GroupT& group = **found;
  std::string size = std::to_string(group.members.size()) + " members, " + std::to_string(group.subscribers) +
                     " subscribers, " + std::to_string(group.waiting) + " waiting, state of " +
                     size_text(group.state_size);
  to.push_back({platform::printable("Group " + group.name + ": " + size), Look::kBold});
  to.push_back({"Event " + std::to_string(group.event_number) + ", " + duration_text(group.age_ms) + " ago, " +
                rate_text(rate_of(group.name)) + "/s"});
  to.push_back({platform::printable("Runs: " + to_text(group.running))});
  to.push_back({platform::printable("Waits for: " + (group.running ? to_text(group.running->missing) : "-"))});
}

void TopView::add_help(std::vector<ScreenLine>& to) const {
  for (const char* line :
       {"up, down, page up, page down   choose", "Enter                          look into a group",
        "Tab                            groups, or programs and their queues",
        "s                              sort by something else",
        "r                              the other way round",
        "/                              show only names with a text in them",
        "Esc                            back; no filter", "q                              quit"}) {
    to.push_back({line});
  }
}

void TopView::add_table(std::vector<ScreenLine>& to, const Table& table, int width, int height) {
  const auto line_of = [&](const char* begin, const auto& cell) {
    std::string line = begin;
    for (std::size_t i = 0; i < table.columns.size(); ++i) {
      const auto whole = static_cast<std::size_t>(width);
      const std::size_t left = whole - std::min(platform::width_of(line), whole);
      line += fitted(cell(i), table.columns[i].width == 0 ? left : table.columns[i].width) + " ";
    }
    return line;
  };
  keys_.clear();
  for (const Entry& entry : table.entries) keys_.push_back(entry.key);
  const auto kept = std::find(keys_.begin(), keys_.end(), selected_key_);
  if (kept != keys_.end()) selected_ = static_cast<std::size_t>(kept - keys_.begin());
  selected_ = std::min(selected_, keys_.empty() ? 0 : keys_.size() - 1);
  selected_key_ = keys_.empty() ? "" : keys_[selected_];

  to.push_back({line_of(" ", [&](std::size_t i) { return std::string(table.columns[i].name); }), Look::kReverse});
  page_ = static_cast<std::size_t>(std::max(height - static_cast<int>(to.size()) - 1, 1));
  first_ = std::min(first_, selected_);
  if (selected_ >= first_ + page_) first_ = selected_ - page_ + 1;
  for (std::size_t i = first_; i < table.entries.size() && i < first_ + page_; ++i) {
    const bool is_selected = i == selected_;
    const auto cell = [&](std::size_t column) { return table.entries[i].cells[column]; };
    to.push_back({line_of(is_selected ? ">" : " ", cell), is_selected ? Look::kReverse : Look::kPlain});
  }
}

std::string TopView::foot() const {
  const std::string place =
      keys_.empty() ? "" : std::to_string(selected_ + 1) + "/" + std::to_string(keys_.size()) + "  ";
  switch (view_) {
    case View::kHelp:
      return "Esc back  q quit";
    case View::kGroup:
      return place + "Esc back  q quit  ? help";
    default:
      return place + "Enter look  Tab " + (view_ == View::kGroups ? "sessions" : "groups") +
             "  s sort: " + order() + "  / filter  ? help  q quit";
  }
}

std::vector<ScreenLine> TopView::lines(int width, int height) {
  if (width < kLeastWidth || height < kLeastHeight) {
    return {{"needs " + std::to_string(kLeastWidth) + " x " + std::to_string(kLeastHeight) + ": make it larger"}};
  }
  std::vector<ScreenLine> all;
  add_head(all);
  if (view_ == View::kHelp) {
    add_help(all);
  } else {
    if (view_ == View::kGroup) add_group(all);
    add_table(all, table(), width, height);
  }
  all.resize(static_cast<std::size_t>(height) - 1);
  all.push_back({foot(), Look::kReverse});
  return all;
}

// ------------------------------------------------------------------------------------------------ the keys

void TopView::go(View view) {
  view_ = view;
  selected_ = first_ = 0;
  selected_key_ = view == View::kGroups ? group_ : "";
  filter_.clear();
}

void TopView::key_while_filtering(const Key& key) {
  if (key.kind == Key::Kind::kCharacter) filter_ += key.character;
  if (key.kind == Key::Kind::kErase && !filter_.empty()) filter_.pop_back();
  if (key.kind == Key::Kind::kEscape) filter_.clear();
  filtering_ = key.kind != Key::Kind::kEnter && key.kind != Key::Kind::kEscape;
}

bool TopView::character(char c) {
  switch (c) {
    case 'q':
      return false;
    case '/':
      filtering_ = view_ == View::kGroups || view_ == View::kSessions;
      return true;
    case 's':
      order_[view_] =
          (order_[view_] + 1) % (view_ == View::kSessions ? kSessionOrders.size() : kGroupOrders.size());
      return true;
    case 'r':
      reversed_ = !reversed_;
      return true;
    case '?':
    case 'h':
      if (view_ != View::kHelp) before_ = view_;
      view_ = View::kHelp;
      return true;
    default:
      return true;
  }
}

void TopView::move(const Key& key) {
  const std::size_t last = keys_.empty() ? 0 : keys_.size() - 1;
  switch (key.kind) {
    case Key::Kind::kUp:
      selected_ -= selected_ > 0 ? 1 : 0;
      break;
    case Key::Kind::kDown:
      selected_ = std::min(selected_ + 1, last);
      break;
    case Key::Kind::kPageUp:
      selected_ -= std::min(selected_, page_);
      break;
    case Key::Kind::kPageDown:
      selected_ = std::min(selected_ + page_, last);
      break;
    case Key::Kind::kHome:
      selected_ = 0;
      break;
    case Key::Kind::kEnd:
      selected_ = last;
      break;
    default:
      return;
  }
  selected_key_ = keys_.empty() ? "" : keys_[selected_];
}

bool TopView::key(const Key& key) {
  if (filtering_) {
    key_while_filtering(key);
    return true;
  }
  switch (key.kind) {
    case Key::Kind::kCharacter:
      return character(key.character);
    case Key::Kind::kEnter:
      if (view_ == View::kGroups && !selected_key_.empty()) {
        group_ = selected_key_;
        go(View::kGroup);
      }
      return true;
    case Key::Kind::kEscape:
      if (view_ == View::kHelp) return view_ = before_, true;
      if (view_ == View::kGroup) go(View::kGroups);
      filter_.clear();
      return true;
    case Key::Kind::kTab:
      if (view_ == View::kGroups || view_ == View::kSessions) {
        go(view_ == View::kGroups ? View::kSessions : View::kGroups);
      }
      return true;
    default:
      move(key);
      return true;
  }
}

}  // namespace gsctl
