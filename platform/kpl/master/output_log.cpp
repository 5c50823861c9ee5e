#include "master/output_log.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <system_error>

#include "common/printable.h"

namespace kpl::master {
namespace {

using platform::Descriptor;

constexpr std::size_t kMaxLine = 500;
constexpr int kLinesPerSecond = 100;
constexpr std::chrono::seconds kSecond{1};
constexpr int kLastReads = 16;              // what a subsystem said last is not lost, and nobody goes on for ever
constexpr std::size_t kAtOnce = 64 * 1024;  // bytes, before others are served again

[[noreturn]] void fail() {
  throw std::system_error(errno, std::generic_category(), "cannot make the output's pipe");
}

}  // namespace

OutputLog::OutputLog(const Loop& loop, spdlog::logger& log, std::string name, std::function<void()> ended)
    : log_(log),
      name_(std::move(name)),
      ended_(std::move(ended)),
      second_over_(loop, [this] { tell_left_out(); }) {
  std::array<int, 2> ends{};
  if (pipe2(ends.data(), O_CLOEXEC) != 0) fail();
  own_end_ = Descriptor(ends[0]);
  subsystem_end_ = Descriptor(ends[1]);
  fcntl(own_end_.get(), F_SETFL, O_NONBLOCK);
  readable_.emplace(loop, own_end_.get(), EV_READ | EV_PERSIST, [this] { on_readable(); });
}

OutputLog::~OutputLog() {
  for (int i = 0; i < kLastReads && read_some(); ++i) {
  }
  if (!line_.empty()) end_line();
  tell_left_out();
}

void OutputLog::on_readable() {
  read_some();
  if (!over_) return;
  const auto ended = ended_;  // it may destroy this object
  ended();
}

bool OutputLog::read_some() {
  std::array<char, kAtOnce> bytes;
  const ssize_t got = read(own_end_.get(), bytes.data(), bytes.size());
  over_ = got == 0 || (got < 0 && errno != EAGAIN && errno != EINTR);
  if (got > 0) take(bytes.data(), static_cast<std::size_t>(got));
  return got > 0;
}

void OutputLog::take(const char* bytes, std::size_t count) {
  for (std::size_t i = 0; i < count; ++i) {
    const bool ends = bytes[i] == '\n';
    if (ends || line_.size() == kMaxLine) end_line();
    if (!ends) line_ += bytes[i];
  }
}

void OutputLog::end_line() {
  if (lines_ == 0 && left_out_ == 0) second_over_.arm(kSecond);
  if (lines_ == kLinesPerSecond) {
    ++left_out_;
  } else {
    ++lines_;
    log_.info("{} says: {}", name_, platform::printable(line_));
  }
  line_.clear();
}

void OutputLog::tell_left_out() {
  if (left_out_ > 0) log_.warn("{}: {} lines of its output are left out", name_, left_out_);
  lines_ = 0;
  left_out_ = 0;
}

}  // namespace kpl::master
