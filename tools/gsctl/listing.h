// What the commands with a table share: it is printed once, or again and again.
#pragma once

#include <functional>
#include <vector>

#include "common/table.h"
#include "tools/gsctl/inspection.h"
#include "tools/gsctl/text.h"

namespace gsctl {

/// The same for people and for scripts.
struct Listing {
  std::vector<platform::Row> rows;  // the headings first
  std::vector<Json> objects;
};

struct Repetition {
  bool watch = false;
  double interval = 1;  // seconds
};

/// --watch and --interval.
void add_repetition(CLI::App& command, Repetition& repetition);

using Look = std::function<Listing(gs::inspect::Inspector&)>;

/// Prints what `look` makes of the daemon.
int print_listing(const Settings& settings, const Repetition& repetition, const Look& look);

}  // namespace gsctl
