// What the commands with a table share: it is printed once, or again and again.
#pragma once

#include <functional>
#include <vector>

#include "common/table.h"
#include "tools/gsctl/inspection.h"
#include "tools/gsctl/text.h"

namespace gsctl {

/// A table for people, or objects for scripts.
struct Listing {
  bool for_scripts = false;
  std::vector<platform::Row> rows = {};  // the headings first
  std::vector<Json> objects = {};

  /// What `row` makes, or what `object` does.
  template <typename MakeRow, typename MakeObject>
  void add(const MakeRow& row, const MakeObject& object) {
    for_scripts ? objects.push_back(object()) : rows.push_back(row());
  }
};

struct Repetition {
  bool watch = false;
  double interval = 1;  // seconds
};

/// --watch and --interval.
void add_repetition(CLI::App& command, Repetition& repetition);

/// Fills the listing.
using Look = std::function<void(gs::inspect::Inspector&, Listing&)>;

/// Prints what `look` makes of the daemon.
int print_listing(const Settings& settings, const Repetition& repetition, const Look& look);

}  // namespace gsctl
