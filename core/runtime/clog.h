#pragma once

// CLOG: the formatting front end that the analysis and intake classes log through.
//
// Every function formats printf-style into an 8192-byte stack buffer and writes the result as
// one record of the framework trace facility under the unit "analyzer". Each function is gated
// either by trace classes of that unit's mask (0x01 debug, 0x02 summary, 0x10 detail, 0x40 flow,
// 0x80 error) or, for isLogging and trace_padded, by the agent's own numeric level VLevel.
// error() and min() are written whatever the masks say. By convention the caller's location
// text is the first "%s" of the message, so records carry no separate function name.
//
// There is no agent-owned log file: initLog and writeLog do nothing and fd is never used.
//
// Thread safety: every function may be called from any thread; formatting uses stack buffers and
// the trace facility serialises the output. The process-wide mutex is constructed at start-up and
// taken by no operation.

#include <atomic>

#include "core/runtime/cvel_mutex.h"

class CLOG {
 public:
  CLOG() = delete;

  // The agent's numeric log level, default 2. Only setLogLevel changes it.
  static std::atomic<unsigned long> VLevel;
  // Declared for the layout the agent expects; nothing opens or writes it.
  [[maybe_unused]] static int fd;
  // Belongs to the class's layout; constructed with the program's statics, never locked.
  static CvelMutex mutex;

  // Written when mask shares a bit with the unit's enabled classes; the mask is a class mask,
  // not a level (callers pass 2, the summary class). enter/exit prefix "ENTER, " / "EXIT, ".
  static void enter(unsigned long mask, const char* fmt, ...) __attribute__((format(printf, 2, 3)));
  static void exit(unsigned long mask, const char* fmt, ...) __attribute__((format(printf, 2, 3)));
  static void message(unsigned long mask, const char* fmt, ...)
      __attribute__((format(printf, 2, 3)));
  static void trace(unsigned long mask, const char* fmt, ...) __attribute__((format(printf, 2, 3)));

  // Written when the summary class is enabled.
  static void message(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
  static void max(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
  // Always written; bracketed by entry and exit events when the flow class is enabled.
  static void min(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
  // Written when the detail class is enabled.
  static void med(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
  // Always written, at the error class.
  static void error(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
  // Written when the debug class is enabled.
  static void debug(const char* fmt, ...) __attribute__((format(printf, 1, 2)));

  static bool isLogging(unsigned long level) { return level <= VLevel.load(); }
  static void setLogLevel(unsigned long level) { VLevel.store(level); }

  // Traces the first `width` characters of text, trailing blanks dropped (a text of blanks only
  // keeps its first character), through trace(level, fmt, buffer). level is tested both as a
  // numeric level (<= VLevel) and, inside trace, as a class mask: both must pass. text may be
  // null (traced as empty).
  static void trace_padded(unsigned long level, const char* fmt, const char* text, int width);

  static void initLog() {}
  static void writeLog(char*) {}
};
