#include "gscl/GSDebug.h"

#include <algorithm>
#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <mutex>
#include <utility>

#include "gscl/GSLocalVar.h"
#include "gscl/GSUtils.h"
#include "gscl/trace.h"

namespace {

using zelt_gscl_V1::GSLocalVar;

constexpr unsigned int kMessageBytes = 2048;
constexpr int kMaxIndentation = 30;

constinit std::mutex init_mutex;                // makes the first reading of the environment happen once
constinit std::atomic<bool> dbg_inited{false};  // level_mask holds the level word

constinit std::mutex file_mutex;  // guards debugout, and keeps it open while a line is written
FILE* debugout = nullptr;         // null: standard error

constinit std::atomic<const char*> dbg_trace_name{nullptr};
constinit std::atomic<int> dbg_trace_indent{0};

/// Where and when a line is written, as every line says it. Taken under file_mutex: times do not run backwards in
/// the file, and setting the time zone does not race with itself.
struct LinePrefix {
  char time[16];
  char thread[16];
};

LinePrefix line_prefix() {
  LinePrefix prefix{};
  char full[32] = "";
  const time_t now = time(nullptr);
  tzset();  // ctime_r, unlike ctime, need not notice a change of TZ
  if (ctime_r(&now, full) != nullptr) memcpy(prefix.time, full + 4, 15);
  const auto id = static_cast<unsigned int>(zelt_gscl::gscl_thread_self());
  snprintf(prefix.thread, sizeof(prefix.thread), "0x%x", id);
  return prefix;
}

FILE* stream() { return debugout != nullptr ? debugout : stderr; }

void standard_trace(int, char* text) {
  const std::lock_guard<std::mutex> lock(file_mutex);
  const LinePrefix prefix = line_prefix();
  fprintf(stream(), "%s TID=%s TRC_GSCL %s", prefix.time, prefix.thread, text);
  fflush(stream());
}

void standard_debug(int, char* text) {
  const char* name = dbg_trace_name.load(std::memory_order_relaxed);
  const int depth = std::clamp(dbg_trace_indent.load(std::memory_order_relaxed), 0, kMaxIndentation);
  const std::lock_guard<std::mutex> lock(file_mutex);
  const LinePrefix prefix = line_prefix();
  if (name != nullptr)
    fprintf(stream(), "%s TID=%s %*s %s:%s", prefix.time, prefix.thread, depth, "", name, text);
  else
    fprintf(stream(), "%s TID=%s %s", prefix.time, prefix.thread, text);
  fflush(stream());
}

int parse_level(const char* text) {
  const bool hexadecimal = strncmp(text, "0x", 2) == 0 || strncmp(text, "0X", 2) == 0;
  if (hexadecimal) return static_cast<int>(strtoul(text + 2, nullptr, 16));
  return static_cast<int>(strtol(text, nullptr, 10));
}

void read_environment() {
  const std::lock_guard<std::mutex> lock(init_mutex);
  if (dbg_inited.load(std::memory_order_relaxed)) return;
  const char* level = getenv("GSCL_DBGLVL");
  gscl_set_debug_file(getenv("GSCL_DBGFILE"));
  zelt_gscl_trace::level_mask.store(level != nullptr ? parse_level(level) : 0, std::memory_order_relaxed);
  dbg_inited.store(true, std::memory_order_release);
}

// The routines are plain exported variables, because applications may assign them.
template <class Routine>
Routine routine(Routine& variable) {
  return __atomic_load_n(&variable, __ATOMIC_ACQUIRE);
}

/// Ends the arguments also when a routine throws.
struct EndOfArguments {
  va_list& args;
  ~EndOfArguments() { va_end(args); }
};

template <class Routine>
void write_message(Routine& variable, int level, const char* format, va_list args) {
  if (routine(variable) == nullptr || GSDebugging(level) == 0) return;
  GSLocalVar<char> text(kMessageBytes);
  text[0] = '\0';
  vsnprintf(text, kMessageBytes, format, args);
  const Routine write = routine(variable);
  if (write != nullptr) write(level, text);
}

}  // namespace

constinit std::atomic<int> zelt_gscl_trace::level_mask{-1};

bool zelt_gscl_trace::trace_wanted_slow(int level) {
  return routine(_gs_tracef_) != nullptr && GSDebugging(level) != 0;
}

bool zelt_gscl_trace::debug_wanted_slow(int level) {
  return routine(_gs_debugf_) != nullptr && GSDebugging(level) != 0;
}

extern "C" {

gscl_debugf_rtn _gs_debugf_ = standard_debug;
gscl_tracef_rtn _gs_tracef_ = standard_trace;

int GSDebugLevel() {
  if (!dbg_inited.load(std::memory_order_acquire)) read_environment();
  return zelt_gscl_trace::level_mask.load(std::memory_order_relaxed);
}

int GSDebugging(int level) { return level == 0 || (GSDebugLevel() & level) != 0 ? 1 : 0; }

void GSSetDebugLevel(int level) {
  const std::lock_guard<std::mutex> lock(init_mutex);
  zelt_gscl_trace::level_mask.store(level, std::memory_order_relaxed);
  dbg_inited.store(true, std::memory_order_release);
}

const char* GSTraceDebugName() { return dbg_trace_name.load(std::memory_order_relaxed); }

// A message that is off goes no further than one load: before the arguments are gathered, without a look at the
// environment.
void GSdebugf(int level, const char* format, ...) {
  if (!zelt_gscl_trace::may_be_on(level)) return;
  va_list args;
  va_start(args, format);
  const EndOfArguments end{args};
  write_message(_gs_debugf_, level, format, args);
}

void GStracef(int level, const char* format, ...) {
  if (!zelt_gscl_trace::may_be_on(level)) return;
  va_list args;
  va_start(args, format);
  const EndOfArguments end{args};
  write_message(_gs_tracef_, level, format, args);
}

}  // extern "C"

gscl_debugf_rtn GSSetDebugRtn(gscl_debugf_rtn rtn) {
  return __atomic_exchange_n(&_gs_debugf_, rtn, __ATOMIC_ACQ_REL);
}

gscl_tracef_rtn GSSetTraceRtn(gscl_tracef_rtn rtn) {
  return __atomic_exchange_n(&_gs_tracef_, rtn, __ATOMIC_ACQ_REL);
}

void gscl_set_debug_file(const char* path) {
  const std::lock_guard<std::mutex> lock(file_mutex);
  // Closing and opening are cancellation points: debugout never names a closed file.
  FILE* old = std::exchange(debugout, nullptr);
  if (old != nullptr) fclose(old);
  if (path != nullptr) debugout = fopen(path, "w");
}

namespace {

/// Takes a GSTraceFn's name and depth back at the end of its scope.
struct Unwind {
  const char* name;
  ~Unwind() {
    dbg_trace_indent.fetch_sub(1, std::memory_order_relaxed);
    dbg_trace_name.store(name, std::memory_order_relaxed);
  }
};

}  // namespace

GSTraceFn::GSTraceFn(const char* name) {
  dbg_trace_indent.fetch_add(1, std::memory_order_relaxed);
  last_trace_name = dbg_trace_name.exchange(name, std::memory_order_relaxed);
  try {
    GS_DEBUG(GSCL_TRC_FUNC, "Entering....\n");
  } catch (...) {
    const Unwind unwind{last_trace_name};
    throw;
  }
}

GSTraceFn::~GSTraceFn() noexcept(false) {
  const Unwind unwind{last_trace_name};
  GS_DEBUG(GSCL_TRC_FUNC, "Leaving...\n");
}
