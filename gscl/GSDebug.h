// Diagnostic output: two channels, debug and trace, filtered by one process-wide level word.
//
// A message of level L is written when L is 0 or shares a bit with the level word. Level word and output file come
// from the environment the first time that a non-zero level is tested, unless GSSetDebugLevel was called before:
//   GSCL_DBGLVL   the level word, "0x..." as hexadecimal, otherwise decimal; not a number: 0
//   GSCL_DBGFILE  the file to write to, truncated; absent or not to be opened: standard error
// Without either and without GSSetDebugLevel the level word is 0 and the library writes nothing.
//
// Each channel ends in a replaceable routine. The standard ones write one line for each message, at once:
//   Nov 16 20:46:11 TID=0x1a2b TRC_GSCL <message>                                (trace)
//   Nov 16 20:46:11 TID=0x1a2b <indentation> <function>:<message>                (debug, inside a GSTraceFn)
// A message carries its own line end; none is added.
//
// Threads: every function here may be called from any thread at any time. The level word, the routines and the
// function name and depth of GSTraceFn are one for the process. A standard routine takes no lock of this facility:
// it hands its line to the system in one piece, of at most 4095 characters, and so may a process that was forked
// while other threads were writing. Errors: what cannot be written is dropped. Only a failed allocation of the
// message's buffer is thrown. A child that is forked while another thread looks up the time zone keeps the offset
// that was known then, UTC before the first line.
#ifndef GSCL_GSDEBUG_H
#define GSCL_GSDEBUG_H

#include "gscl/export.h"

/// The level bits that the library uses; an application may use the other ones.
enum gscl_trace_level_t : int {
  GSCL_TRC_ALWAYS = 0,              ///< written whatever the level word is
  GSCL_TRC_FUNC = -0x7fffffff - 1,  ///< 0x80000000: function entry and exit
  GSCL_TRC_API = 0x20000000,        ///< requests and results, callbacks, state changes, creation, destruction
  GSCL_TRC_DETAIL = 0x10000000,     ///< inner steps
  GSCL_TRC_WARNING = 0x08000000     ///< anomalies
};

/// Receives each formatted message of a channel, with the level that it was given. The text is the channel's and
/// valid only during the call. It runs on the thread that writes the message, which may hold locks of the library
/// then: it may write messages, but calls no client or controller. What it throws goes to the caller of GSdebugf
/// and GStracef, and out of a GSTraceFn; out of the library's own lines nothing goes on, so that no operation is
/// left half done.
typedef void (*gscl_debugf_rtn)(int level, char* text);
typedef void (*gscl_tracef_rtn)(int level, char* text);

extern "C" {

/// The routines installed, never to be read as a plain variable while other threads may change them. Assigning one
/// directly is the same as GSSetDebugRtn or GSSetTraceRtn, for a process that has no other thread yet.
ZN_GSCL_EXPORT extern gscl_debugf_rtn _gs_debugf_;
ZN_GSCL_EXPORT extern gscl_tracef_rtn _gs_tracef_;

/// The level word; reads the environment first when nobody has yet.
ZN_GSCL_EXPORT int GSDebugLevel();

/// 1 when a message of this level would be written, else 0. Test it before work that only a message needs.
/// Level 0 gives 1 and reads no environment.
ZN_GSCL_EXPORT int GSDebugging(int level);

/// Sets the level word. When this comes first, the environment is never read, for the file neither.
ZN_GSCL_EXPORT void GSSetDebugLevel(int level);

/// The name that the innermost living GSTraceFn gave, null when there is none.
ZN_GSCL_EXPORT const char* GSTraceDebugName();

/// Formats a message as printf does and hands it to the debug routine. A message over 2047 characters is cut.
/// Nothing happens, and the level is not even tested, when the routine is null.
ZN_GSCL_EXPORT void GSdebugf(int level, const char* format, ...) __attribute__((format(printf, 2, 3)));

/// The same for the trace channel.
ZN_GSCL_EXPORT void GStracef(int level, const char* format, ...) __attribute__((format(printf, 2, 3)));

}  // extern "C"

/// Installs a routine, null to silence the channel. Returns the one before. A thread that is just writing may
/// still call the old one after this has returned.
ZN_GSCL_EXPORT gscl_debugf_rtn GSSetDebugRtn(gscl_debugf_rtn rtn);
ZN_GSCL_EXPORT gscl_tracef_rtn GSSetTraceRtn(gscl_tracef_rtn rtn);

/// Closes the debug file and opens `path` for writing, truncated; a new file is writable by its owner alone. Null,
/// or a path that cannot be opened, leaves none open, and the standard routines write to standard error. The file
/// stays open until the next call, through dae_init too (which moves it above the descriptors that it closes, or,
/// where the hard limit leaves no number there, spares it), and is not handed on to programs that are executed.
/// The first test of a level does the same with GSCL_DBGFILE; to keep a file given here before that, call
/// GSSetDebugLevel first.
///
/// The descriptor, once there was one, belongs to the library for good and may change its number. Should the
/// application close it, lines go to standard error, never to what takes its number over.
ZN_GSCL_EXPORT void gscl_set_debug_file(const char* path);

/// Marks the life of a function on the debug channel: writes "Entering....\n" and "Leaving...\n" at GSCL_TRC_FUNC
/// and makes debug lines in between carry the function's name, indented by depth (at most 30).
///
/// To be created on the stack. Name and depth belong to the process: objects of several threads at the same time
/// share them. Depth counts also when nothing is written. When writing fails with an exception (no memory, or a
/// routine that throws) name and depth are put back before it goes on; what is thrown while another exception
/// leaves the function is dropped.
class ZN_GSCL_EXPORT GSTraceFn {
 public:
  /// `name` is not copied; it outlives the object (a literal).
  explicit GSTraceFn(const char* name);
  ~GSTraceFn() noexcept(false);
  GSTraceFn(const GSTraceFn&) = delete;
  GSTraceFn& operator=(const GSTraceFn&) = delete;

 private:
  const char* last_trace_name;
};

#endif
