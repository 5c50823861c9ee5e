// gsctl chart: a recording as a picture.
#include <cmath>
#include <cstring>
#include <fstream>

#include "common/command_line.h"
#include "tools/gsctl/chart_drawing.h"
#include "tools/gsctl/command.h"
#include "tools/gsctl/output.h"

namespace gsctl {
namespace {

struct Options {
  std::string file;
  std::string output;
  std::vector<std::string> groups;
  double from = 0;
  std::optional<double> to;
};

Recording read(const std::string& path) {
  std::ifstream file(path);
  if (!file) throw Error(kRefused, "cannot read " + path + ": " + strerror(errno));
  Recording recording = read_recording(file, path);
  if (recording.cut) complain(path + " ends in the middle of a line, which is left out");
  return recording;
}

Microseconds microseconds(double seconds) { return static_cast<Microseconds>(std::llround(seconds * 1e6)); }

std::vector<Story> stories_of(const Recording& recording, const std::vector<std::string>& wanted) {
  const std::vector<std::string> there = groups_of(recording);
  std::vector<Story> stories;
  for (const std::string& group : wanted.empty() ? there : wanted) {
    if (std::find(there.begin(), there.end(), group) == there.end()) {
      throw Error(kRefused, "nothing of group '" + group + "' is in the recording");
    }
    stories.push_back(story_of(recording, group));
  }
  return stories;
}

void write(const std::string& path, const std::string& picture) {
  if (path.empty()) return print_raw(picture);
  std::ofstream file(path, std::ios::binary);
  file << picture << std::flush;
  if (!file) throw Error(kRefused, "cannot write " + path + ": " + strerror(errno));
}

int chart(const Options& options) {
  const Recording recording = read(options.file);
  Stretch stretch;
  stretch.zero = recording.started_us;
  stretch.from = stretch.zero + microseconds(options.from);
  stretch.to = options.to ? stretch.zero + microseconds(*options.to) : end_of(recording);
  write(options.output, draw(stories_of(recording, options.groups), recording.missed, stretch));
  return kDone;
}

}  // namespace

Run add_chart(CLI::App& command) {
  constexpr double kLongest = 1e9;  // seconds
  auto options = std::make_shared<Options>();
  command.add_option("FILE", options->file, "What gsctl record has written")->type_name("")->required();
  command.add_option("-o,--output", options->output, "The picture; without it, standard output")
      ->type_name("OUT.svg");
  command.add_option("--from", options->from, "Only from there on, counted from the recording's begin")
      ->type_name("SECONDS")
      ->check(platform::between(0.0, kLongest));
  command.add_option("--to", options->to, "Only up to there")
      ->type_name("SECONDS")
      ->check(platform::between(0.0, kLongest));
  command.add_option("--group", options->groups, "Only this one; may be given again")->type_name("GROUP");
  return [options](const Settings& settings) {
    if (settings.json) throw Error(kWrongUse, "a picture is no JSON: the recording is");
    if (options->to && *options->to < options->from) throw Error(kWrongUse, "--to is before --from");
    return chart(*options);
  };
}

}  // namespace gsctl
