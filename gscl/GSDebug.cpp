#include "gscl/GSDebug.h"

#include <algorithm>
#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>

#include "gscl/GSDebugFile_internal.h"
#include "gscl/GSLocalTime_internal.h"
#include "gscl/GSLocalVar.h"
#include "gscl/GSUtils.h"
#include "gscl/trace.h"

namespace {

using gscl_internal::ForkableGate;
using zelt_gscl_V1::GSLocalVar;

constexpr unsigned int kMessageBytes = 2048;
constexpr int kMaxIndentation = 30;
// Room for a line: not more than a pipe takes in one piece. Only a GSTraceFn's name can be too long for it.
constexpr int kLineBytes = 4096;

constinit std::atomic<pid_t> initialising{0};  // gate of those who set the level word, from the environment or not
constinit std::atomic<bool> dbg_inited{false};  // level_mask holds the level word

constinit std::atomic<const char*> dbg_trace_name{nullptr};
constinit std::atomic<int> dbg_trace_indent{0};

/// Builds a line behind its time and thread, and writes it.
__attribute__((format(printf, 1, 2))) void write_line(const char* format, ...) {
  char line[kLineBytes];
  char now[gscl_internal::kLineTimeBytes];
  gscl_internal::lineTime(now);
  const auto thread = static_cast<unsigned int>(zelt_gscl::gscl_thread_self());
  const int prefix = snprintf(line, sizeof line, "%s TID=0x%x ", now, thread);
  va_list args;
  va_start(args, format);
  const int rest = vsnprintf(line + prefix, static_cast<size_t>(kLineBytes - prefix), format, args);
  va_end(args);
  if (rest < 0) return;
  gscl_internal::writeDebugLine(line, static_cast<size_t>(std::min(prefix + rest, kLineBytes - 1)));
}

void standard_trace(int, char* text) { write_line("TRC_GSCL %s", text); }

void standard_debug(int, char* text) {
  const char* name = dbg_trace_name.load(std::memory_order_relaxed);
  const int depth = std::clamp(dbg_trace_indent.load(std::memory_order_relaxed), 0, kMaxIndentation);
  if (name != nullptr) {
    write_line("%*s %s:%s", depth, "", name, text);
  } else {
    write_line("%s", text);
  }
}

int parse_level(const char* text) {
  const bool hexadecimal = strncmp(text, "0x", 2) == 0 || strncmp(text, "0X", 2) == 0;
  if (hexadecimal) return static_cast<int>(strtoul(text + 2, nullptr, 16));
  return static_cast<int>(strtol(text, nullptr, 10));
}

void read_environment() {
  const ForkableGate gate(initialising);
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
  const ForkableGate gate(initialising);
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
    GSdebugf(GSCL_TRC_FUNC, "Entering....\n");
  } catch (...) {
    const Unwind unwind{last_trace_name};
    throw;
  }
}

GSTraceFn::~GSTraceFn() noexcept(false) {
  const Unwind unwind{last_trace_name};
  const auto leave = [] { GSdebugf(GSCL_TRC_FUNC, "Leaving...\n"); };
  std::uncaught_exceptions() == 0 ? leave() : zelt_gscl_trace::dropThrown(leave);
}
