#include "common/log_writer.h"

#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <ctime>
#include <exception>
#include <system_error>

namespace platform {
namespace {

constexpr std::size_t kMaxWaiting = 1024 * 1024;  // bytes
constexpr std::size_t kPiece = PIPE_BUF;          // bytes written at once: a pipe that takes any takes so many
constexpr int kLookAgain = 1000;                  // milliseconds, at what standard error is by then
constexpr long kPatience = 500'000'000;           // nanoseconds, at the end
constexpr long kSecond = 1'000'000'000;

/// Waits while standard error takes nothing, also where somebody has made it not block, and goes on with another
/// file when that is put in its place meanwhile. What was written.
std::size_t write_all(std::string_view text) {
  std::size_t done = 0;
  while (done < text.size()) {
    pollfd writable{STDERR_FILENO, POLLOUT, 0};
    if (poll(&writable, 1, kLookAgain) == 0) continue;
    const ssize_t written = ::write(STDERR_FILENO, text.data() + done, std::min(kPiece, text.size() - done));
    if (written >= 0) {
      done += static_cast<std::size_t>(written);
    } else if (errno != EAGAIN && errno != EINTR) {
      break;
    }
  }
  return done;
}

std::uint64_t lines_in(std::string_view text) {
  return static_cast<std::uint64_t>(std::count(text.begin(), text.end(), '\n'));
}

}  // namespace

LogWriter::LogWriter(LostLine lost_line) : queue_(std::make_shared<Queue>(lost_line)) {
  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  auto shared = std::make_unique<std::shared_ptr<Queue>>(queue_);
  pthread_sigmask(SIG_SETMASK, &all, &before);
  const int error = pthread_create(&thread_, nullptr, run, shared.get());
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  if (error != 0) throw std::system_error(error, std::generic_category(), "cannot make the thread of the log");
  shared.release();  // the thread's
  pthread_setname_np(thread_, "log");
}

LogWriter::~LogWriter() {
  timespec until{};
  clock_gettime(CLOCK_MONOTONIC, &until);
  until.tv_nsec += kPatience;
  until.tv_sec += until.tv_nsec / kSecond;
  until.tv_nsec %= kSecond;
  bool written = false;
  {
    MutexLock lock(queue_->mutex);
    queue_->ended = true;
    queue_->changed.notify_all();
    while (!queue_->written && queue_->changed.wait_until(queue_->mutex, until)) {
    }
    written = queue_->written;
  }
  if (written) {
    pthread_join(thread_, nullptr);
  } else {
    pthread_detach(thread_);
  }
}

void LogWriter::write(std::string_view line) {
  MutexLock lock(queue_->mutex);
  // Nothing gets past what was lost: the count stands where the lines are missing.
  if (queue_->lost != 0 || queue_->lines.size() + line.size() > kMaxWaiting) {
    ++queue_->lost;
    return;
  }
  if (queue_->lines.empty()) queue_->changed.notify_all();
  queue_->lines += line;
}

void* LogWriter::run(void* queue) noexcept {
  const std::unique_ptr<std::shared_ptr<Queue>> shared(static_cast<std::shared_ptr<Queue>*>(queue));
  Queue& q = **shared;
  std::uint64_t missing = 0;
  const auto tell_missing = [&] {
    if (missing == 0) return;
    try {
      const std::string line = q.lost_line(missing);
      if (write_all(line) == line.size()) missing = 0;
    } catch (const std::exception&) {  // no memory: told with a later line
    }
  };
  std::string lines;
  for (;;) {
    lines.clear();
    std::uint64_t lost = 0;
    {
      MutexLock lock(q.mutex);
      while (q.lines.empty() && !q.ended) q.changed.wait(q.mutex);
      if (q.lines.empty()) {
        q.written = true;
        q.changed.notify_all();
        return nullptr;
      }
      lines.swap(q.lines);
      std::swap(lost, q.lost);
    }
    tell_missing();
    const std::size_t written = write_all(lines);
    missing += lines_in(std::string_view(lines).substr(written)) + lost;
    if (written == lines.size()) tell_missing();
  }
}

}  // namespace platform
