// gsctl record: what happens in groups, into a file.
#include <fcntl.h>

#include <cerrno>
#include <chrono>
#include <cstring>

#include "tools/gsctl/inspection.h"
#include "tools/gsctl/loop.h"
#include "tools/gsctl/member.h"
#include "tools/gsctl/output.h"
#include "tools/gsctl/recording.h"
#include "tools/gsctl/session.h"

namespace gsctl {
namespace {

struct Options {
  std::vector<std::string> groups;
  bool all = false;
  bool contents = false;
  std::string file;
};

std::int64_t now_us() {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return std::chrono::duration_cast<std::chrono::microseconds>(now).count();
}

class Output {
 public:
  explicit Output(const std::string& path)
      : path_(path), file_(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600)) {
    if (!file_) fail();
  }

  /// Lines, at once: what has happened is in the file also when gsctl is killed.
  void write(const std::string& lines) {
    std::string_view left = lines;
    while (!left.empty()) {
      const ssize_t written = ::write(file_.get(), left.data(), left.size());
      if (written < 0 && errno != EINTR) fail();
      if (written > 0) left.remove_prefix(static_cast<std::size_t>(written));
    }
  }

 private:
  [[noreturn]] void fail() const { throw Error(kRefused, "cannot write " + path_ + ": " + strerror(errno)); }

  const std::string path_;
  platform::Descriptor file_;
};

/// Who is there when the tap is open: what happens from then on is told by it.
Recording beginning(const Options& options, const Settings& settings) {
  Recording recording;
  recording.started_us = now_us();
  gs::inspect::Inspector inspector = connected(settings);
  for (const auto& group : inspector.groups(options.groups)) {
    auto& members = recording.groups[group->name];
    for (const auto& member : inspector.members(group->name)) {
      if (member->id && member->state != "joining") members.push_back({*member->id, member->name});
    }
  }
  return recording;
}

std::string line_of(const Json& object) { return json_text(object) + "\n"; }

/// What the tap has brought.
std::string lines_of(gs::inspect::Inspector& tap, std::uint64_t* count) {
  std::string lines;
  while (const auto report = tap.next()) {
    if (report->missed > 0) {
      complain(std::to_string(report->missed) + " happenings are missing: they came too fast");
      const bool none = report->happenings.empty();
      lines += line_of(missed_json(report->missed, none ? now_us() : report->happenings.front()->time_us));
    }
    for (const auto& happening : report->happenings) lines += line_of(to_json(*happening));
    *count += report->happenings.size();
  }
  return lines;
}

void check(const Options& options) {
  if (options.all == !options.groups.empty()) throw Error(kWrongUse, "give the GROUPs to record, or --all");
  check_groups(options.groups, "or --all");
}

int record(const Options& options, const Settings& settings) {
  check(options);
  gs::inspect::Inspector tap = connected(Settings{});
  tap.tap(options.groups, options.contents);
  const Recording start = beginning(options, Settings{});
  Output output(options.file);
  output.write(line_of(header_json(start)));

  Loop loop;
  std::uint64_t count = 0;
  const auto readable = loop.on_readable(tap.fd(), [&] { output.write(lines_of(tap, &count)); });
  const auto interrupted = on_interrupt(loop, [&](int) { loop.stop(); });
  Loop::Handle over;
  if (settings.timeout) over = loop.after(std::chrono::duration<double>(*settings.timeout), [&] { loop.stop(); });
  loop.run();
  output.write(lines_of(tap, &count) + line_of(end_json(now_us())));
  if (settings.json) {
    print_json({{"file", options.file}, {"happenings", count}});
  } else {
    print_line(std::to_string(count) + " happenings in " + options.file + ": gsctl chart draws them");
  }
  return kDone;
}

}  // namespace

Run add_record(CLI::App& command) {
  auto options = std::make_shared<Options>();
  command.add_option("GROUP", options->groups, "What happens in it, until interrupted or --timeout (status 0)")
      ->type_name("");
  command.add_flag("--all", options->all, "What happens in all groups");
  command.add_flag("--contents", options->contents,
                   "State values and messages too; see docs/security.md for who may");
  command.add_option("-o,--output", options->file, "The file, written anew")->type_name("FILE")->required();
  return [options](const Settings& settings) { return record(*options, settings); };
}

}  // namespace gsctl
