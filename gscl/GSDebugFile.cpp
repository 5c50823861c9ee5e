#include <errno.h>
#include <fcntl.h>
#include <stdint.h>
#include <stdio.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <algorithm>

#include "gscl/GSDebug.h"
#include "gscl/GSDebugFile_internal.h"

namespace {

/// The descriptor that belongs to the debug file, as one word, which writers read without a lock.
///
/// Once there was a file its number is kept, on something that takes no bytes while there is none, and another
/// file takes it over in one step: a writer that has just read the word never meets a number that has become
/// somebody else's. The application may close it all the same; that is what the mark is for.
struct Place {
  int32_t number = -1;  // -1: none
  uint32_t mark = 0;    // of the file that the number leads to; see markOf
  bool in_use = false;  // whether lines go there

  static Place of(uint64_t word) {
    return {static_cast<int32_t>(word & 0x7fffffff) - 1, static_cast<uint32_t>(word >> 32),
            (word & 0x80000000) != 0};
  }
  uint64_t word() const {
    return static_cast<uint64_t>(mark) << 32 | (in_use ? 0x80000000 : 0) | static_cast<uint32_t>(number + 1);
  }
};

constexpr uint32_t kAnyFile = 0;  // the number is just being given another file

constinit std::atomic<uint64_t> debug_place{0};
constinit std::atomic<pid_t> setting{0};  // gate of those who change it

/// Tells files apart, also one from its successor with the same inode. 0: the number is not open.
uint32_t markOf(int number) {
  struct statx file;
  if (statx(number, "", AT_EMPTY_PATH, STATX_INO | STATX_BTIME, &file) != 0) return 0;
  uint64_t mixed = 0;
  for (const uint64_t part : {uint64_t{file.stx_dev_major}, uint64_t{file.stx_dev_minor}, uint64_t{file.stx_ino},
                              static_cast<uint64_t>(file.stx_btime.tv_sec), uint64_t{file.stx_btime.tv_nsec}}) {
    mixed = (mixed ^ part) * 0xff51afd7ed558ccd;
    mixed ^= mixed >> 32;
  }
  return static_cast<uint32_t>(mixed) | 1;
}

bool isOurs(const Place& place) {
  return place.number >= 0 && (place.mark == kAnyFile || place.mark == markOf(place.number));
}

int outputDescriptor() {
  for (uint64_t word = debug_place.load(); Place::of(word).in_use;) {
    if (isOurs(Place::of(word))) return Place::of(word).number;
    const uint64_t now = debug_place.load();
    if (now == word) break;  // the application has closed it
    word = now;
  }
  return fileno(stderr);
}

/// Not as one of the standard descriptors, to which others write, and never writable by everybody: a daemon's mask
/// is 0. A line that is late, still on its way when the file is opened again and truncated, goes to its end.
int openFile(const char* path) {
  const int number = open(path, O_WRONLY | O_CREAT | O_TRUNC | O_APPEND | O_CLOEXEC | O_NOCTTY, 0644);
  if (number < 0 || number > STDERR_FILENO) return number;
  const int higher = fcntl(number, F_DUPFD_CLOEXEC, STDERR_FILENO + 1);
  close(number);
  return higher;
}

/// While it lives a descriptor may have the number `wanted`, if the system lets it.
class RaisedLimit {
 public:
  explicit RaisedLimit(int wanted) {
    if (getrlimit(RLIMIT_NOFILE, &before_) != 0) return;
    const rlim_t least = static_cast<rlim_t>(wanted) + 1;
    if (before_.rlim_cur >= least) return;
    const rlimit raised = {least, std::max(least, before_.rlim_max)};
    raised_ = setrlimit(RLIMIT_NOFILE, &raised) == 0;
  }
  ~RaisedLimit() {
    if (raised_) setrlimit(RLIMIT_NOFILE, &before_);
  }
  RaisedLimit(const RaisedLimit&) = delete;
  RaisedLimit& operator=(const RaisedLimit&) = delete;

 private:
  rlimit before_ = {};
  bool raised_ = false;
};

/// A file of its own that takes no bytes; -1: there are no descriptors.
int openNothing() {
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) return -1;
  close(ends[1]);
  return ends[0];
}

/// Whether `number`, which may be above the limit, leads to what `next` leads to now.
bool takesOver(int number, int next) {
  if (next < 0) return false;
  const RaisedLimit raised(number);
  int taken;
  do {
    taken = dup3(next, number, O_CLOEXEC);
  } while (taken < 0 && (errno == EINTR || errno == EBUSY));
  return taken >= 0;
}

/// Takes over `file`; -1: none. The caller is inside the gate.
void replaceFile(int file) {
  const Place before = Place::of(debug_place.load());
  if (!isOurs(before)) {
    debug_place.store(file < 0 ? 0 : Place{file, markOf(file), true}.word());
    return;
  }
  const int next = file >= 0 ? file : openNothing();
  debug_place.store(Place{before.number, kAnyFile, before.in_use && file >= 0}.word());
  if (takesOver(before.number, next)) {
    close(next);
    debug_place.store(Place{before.number, markOf(before.number), file >= 0}.word());
  } else {
    debug_place.store(next < 0 ? 0 : Place{next, markOf(next), file >= 0}.word());
    close(before.number);
  }
}

}  // namespace

void gscl_internal::writeDebugLine(const char* line, size_t length) {
  const int output = outputDescriptor();
  while (length > 0) {
    const ssize_t written = write(output, line, length);
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) return;
    line += written;
    length -= static_cast<size_t>(written);
  }
}

int gscl_internal::moveDebugFileUp(int end) {
  const ForkableGate gate(setting);
  Place place = Place::of(debug_place.load());
  if (!isOurs(place) || place.number >= end) return -1;
  const int number = place.number;
  if (place.in_use) {
    const RaisedLimit raised(end);
    place.number = fcntl(number, F_DUPFD_CLOEXEC, end);
    if (place.number < 0) return number;
  } else {
    place = {};
  }
  debug_place.store(place.word());
  close(number);
  return -1;
}

void gscl_set_debug_file(const char* path) {
  const int file = path != nullptr ? openFile(path) : -1;
  const gscl_internal::ForkableGate gate(setting);
  replaceFile(file);
}
