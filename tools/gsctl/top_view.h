// What top has on its screen, and what keys make of it. Knows no terminal.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "common/clock.h"
#include "tools/gsctl/screen.h"
#include "tools/gsctl/top_source.h"

namespace gsctl {

class TopView {
 public:
  static constexpr int kLeastWidth = 60;
  static constexpr int kLeastHeight = 10;

  void told(Snapshot snapshot);
  void lost(const std::string& why) { trouble_ = why; }

  /// False: the user has had enough.
  bool key(const Key& key);
  Wanted wanted() const;
  std::vector<ScreenLine> lines(int width, int height);

 private:
  enum class View { kGroups, kSessions, kGroup, kHelp };
  struct Entry {
    std::string key;  // by which a selection finds it again
    std::vector<std::string> cells;
  };
  struct Column {
    const char* name;
    std::size_t width;  // 0: what is left
  };
  struct Table {
    std::vector<Column> columns;
    std::vector<Entry> entries;
  };

  void key_while_filtering(const Key& key);
  bool character(char c);
  void move(const Key& key);
  void go(View view);
  void count_rates(const Snapshot& now);
  double rate_of(const std::string& group) const;

  std::vector<const inspect::GroupT*> sorted_groups() const;
  std::vector<const inspect::SessionT*> sorted_sessions() const;
  Table groups() const;
  Table sessions() const;
  Table members() const;
  Table table() const;
  const char* order() const;

  void add_head(std::vector<ScreenLine>& to) const;
  void add_group(std::vector<ScreenLine>& to) const;
  void add_help(std::vector<ScreenLine>& to) const;
  void add_table(std::vector<ScreenLine>& to, const Table& table, int width, int height);
  std::string foot() const;

  View view_ = View::kGroups;
  View before_ = View::kGroups;  // where help was asked for
  std::string group_;            // that is looked into
  std::string filter_;
  bool filtering_ = false;
  std::map<View, std::size_t> order_;
  bool reversed_ = false;
  std::size_t selected_ = 0;
  std::string selected_key_;
  std::size_t first_ = 0;          // entry on the screen
  std::size_t page_ = 1;           // entries on it
  std::vector<std::string> keys_;  // of the entries as they are shown

  Snapshot snapshot_;
  std::string trouble_ = "asks the daemon";
  platform::Time told_at_{0};
  std::map<std::string, double> rates_;  // events a second
  double events_ = 0;
  double requests_ = 0;
};

}  // namespace gsctl
