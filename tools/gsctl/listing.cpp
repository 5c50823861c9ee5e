#include "tools/gsctl/listing.h"

#include <unistd.h>

#include "common/command_line.h"
#include "common/printable.h"
#include "tools/gsctl/loop.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/session.h"

namespace gsctl {
namespace {

constexpr char kClearScreen[] = "\033[H\033[2J";

void print(const Listing& listing, const Settings& settings) {
  if (settings.json) {
    for (const Json& object : listing.objects) print_json(object);
    return;
  }
  auto rows = listing.rows;
  for (platform::Row& row : rows) {
    for (std::string& cell : row) cell = platform::printable(cell, "");
  }
  print_raw(platform::table(rows));
}

/// A round of --watch. Tables follow one another where they cannot be repainted.
void print_again(Listing listing, const Settings& settings, bool first) {
  if (settings.json) {
    for (Json& object : listing.objects) object["time"] = utc_text();
  } else if (isatty(STDOUT_FILENO) != 0) {
    print_raw(kClearScreen);
  } else if (!first) {
    print_raw("\n");
  }
  print(listing, settings);
}

Listing seen(const Look& look, gs::inspect::Inspector& inspector, const Settings& settings) {
  Listing listing{settings.json};
  look(inspector, listing);
  return listing;
}

}  // namespace

void add_repetition(CLI::App& command, Repetition& repetition) {
  constexpr double kShortest = 0.05;
  constexpr double kLongest = 86'400;
  command.add_flag("--watch", repetition.watch, "Show it again and again, until interrupted");
  command.add_option("--interval", repetition.interval, "Between two times of --watch")
      ->capture_default_str()
      ->type_name("SECONDS")
      ->check(platform::between(kShortest, kLongest));
}

int print_listing(const Settings& settings, const Repetition& repetition, const Look& look) {
  gs::inspect::Inspector inspector = connected(settings);
  if (!repetition.watch) {
    print(seen(look, inspector, settings), settings);
    return kDone;
  }
  Loop loop;
  const auto limit = end_in_time(loop, settings, "shown for as long as --timeout says");
  Loop::Handle next;
  bool first = true;
  const std::function<void()> show = [&] {
    print_again(seen(look, inspector, settings), settings, first);
    first = false;
    next = loop.after(std::chrono::duration<double>(repetition.interval), show);
  };
  show();
  loop.run();
  return kDone;
}

}  // namespace gsctl
