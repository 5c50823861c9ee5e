// Writes a daemon's log to standard error, and never holds up who logs.
#pragma once

#include <pthread.h>

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "common/mutex.h"

namespace platform {

/// A bounded queue of lines and the thread that writes them. What finds the queue full, or cannot be written, is
/// lost and counted; a line says how many were lost once writing works again. The thread takes no signals.
///
/// Safe for concurrent use. Whoever forks makes it in the process that goes on.
class LogWriter {
 public:
  /// Makes the line that says how much was lost, from that many lines.
  using LostLine = std::string (*)(std::uint64_t lines);

  /// Throws std::system_error when there can be no thread.
  explicit LogWriter(LostLine lost_line);
  /// What waits is written, if that takes no longer than half a second: a reader that does not read holds up
  /// nobody.
  ~LogWriter();
  LogWriter(const LogWriter&) = delete;
  LogWriter& operator=(const LogWriter&) = delete;

  /// A whole line with its end. Does not block.
  void write(std::string_view line);

 private:
  /// Shared with the thread, which outlives the writer when it is stuck.
  struct Queue {
    explicit Queue(LostLine made) : lost_line(made) {}

    const LostLine lost_line;
    Mutex mutex;
    Condition changed;  // notified when lines come to an empty queue, and at both ends
    std::string lines ZN_GUARDED_BY(mutex);
    std::uint64_t lost ZN_GUARDED_BY(mutex) = 0;  // behind those lines
    bool ended ZN_GUARDED_BY(mutex) = false;      // no more lines come
    bool written ZN_GUARDED_BY(mutex) = false;    // and none waits: the thread ends
  };

  static void* run(void* queue) noexcept;

  std::shared_ptr<Queue> queue_;
  pthread_t thread_{};
};

}  // namespace platform
