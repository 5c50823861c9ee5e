// gsctl stats: the daemon's counts, for people and for collectors of metrics.
#include "common/printable.h"
#include "tools/gsctl/listing.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/reports.h"

namespace gsctl {
namespace {

struct Options {
  bool openmetrics = false;
  Repetition repetition;
};

void stats(gs::inspect::Inspector& inspector, Listing& listing) {
  listing.rows = {{"Name", "Value", "Unit", "Type", "What it counts"}};
  for (const auto& count : inspector.daemon().counts) {
    const auto row = [&]() -> platform::Row {
      return {count->name, std::to_string(count->value), count->unit.empty() ? "-" : count->unit,
              count->gauge ? "gauge" : "counter", count->help};
    };
    listing.add(row, [&] { return to_json(*count); });
  }
}

/// A name may have letters, digits and underscores only.
std::string metric_name(std::string name) {
  const auto fits = [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_';
  };
  for (char& c : name) {
    if (!fits(c)) c = '_';
  }
  return name;
}

/// As it stands in a help text and between quotation marks.
std::string escaped(const std::string& text) {
  std::string result;
  for (const char c : text) {
    if (c == '\\' || c == '"') result += '\\';
    result += c == '\n' ? std::string("\\n") : std::string(1, c);
  }
  return result;
}

/// A metric with one sample; `suffix` is that of the sample's name, with its labels.
std::string metric(const std::string& name, const std::string& type, const std::string& unit,
                   const std::string& help, const std::string& suffix, const std::string& value) {
  const bool has_unit = unit.empty() || name.ends_with("_" + unit);
  const std::string family = "gsd_" + metric_name(has_unit ? name : name + "_" + unit);
  std::string text = "# TYPE " + family + " " + type + "\n";
  if (!unit.empty()) text += "# UNIT " + family + " " + metric_name(unit) + "\n";
  return text + "# HELP " + family + " " + escaped(help) + "\n" + family + suffix + " " + value + "\n";
}

std::string seconds_text(std::int64_t milliseconds) {
  const std::string fraction = std::to_string(1000 + milliseconds % 1000).substr(1);
  return std::to_string(milliseconds / 1000) + "." + fraction;
}

std::string openmetrics(const inspect::DaemonT& daemon) {
  const std::string labels = "_info{version=\"" + escaped(daemon.version) + "\",ordering=\"" +
                             escaped(daemon.ordering) + "\",node=\"" + std::to_string(daemon.node) + "\"}";
  std::string text = metric("build", "info", "", "The daemon's version, ordering and node.", labels, "1");
  text += metric("serving", "gauge", "", "1 while the daemon serves its clients.", "", daemon.serving ? "1" : "0");
  if (daemon.age_ms >= 0) {
    text += metric("uptime", "gauge", "seconds", "Since the daemon was started.", "", seconds_text(daemon.age_ms));
  }
  for (const auto& count : daemon.counts) {
    text += metric(count->name, count->gauge ? "gauge" : "counter", count->unit, count->help,
                   count->gauge ? "" : "_total", std::to_string(count->value));
  }
  return text + "# EOF\n";
}

int run(const Options& options, const Settings& settings) {
  if (!options.openmetrics) return print_listing(settings, options.repetition, stats);
  if (settings.json || options.repetition.watch)
    throw Error(kWrongUse, "--openmetrics goes without --json and --watch");
  print_raw(platform::printable(openmetrics(connected(settings).daemon()), "\n"));
  return kDone;
}

}  // namespace

Run add_stats(CLI::App& command) {
  auto options = std::make_shared<Options>();
  command.add_flag("--openmetrics", options->openmetrics, "As a collector of metrics reads them");
  add_repetition(command, options->repetition);
  return [options](const Settings& settings) { return run(*options, settings); };
}

}  // namespace gsctl
