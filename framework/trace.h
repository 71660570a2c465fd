#pragma once

// The framework trace facility.
//
// Each source unit ("tama", "runtime", "analyzer", "intake", "framework", ...) has a mask of
// enabled trace classes. The operator sets the masks with Q7_TRACE: space-separated "unit=mask"
// words, "*" for every unit, a mask in hex ("0x12") or as class names joined by '|'
// ("ERROR|SUMMARY", "ALL", "NONE"). Later words override earlier ones for the units they name.
// The default is the error class for every unit.
//
// A record holds local time with milliseconds, the thread name, the unit, the class and the text:
//   2026-11-23 10:48:18.123 [Main Thread] tama DETAIL prepare_startup: text
// Records go through spdlog to standard error or to a size-rotated file.
//
// Thread safety: every function may be called from any thread. TraceConfigure and TraceOpen
// are meant for start-up but are safe at any time.

#include <cstddef>
#include <string>
#include <string_view>

namespace fw {

// Trace classes: bits of a unit's mask.
inline constexpr unsigned kTraceDebug = 0x01;
inline constexpr unsigned kTraceSummary = 0x02;
inline constexpr unsigned kTraceDetail = 0x10;
inline constexpr unsigned kTraceFlow = 0x40;
inline constexpr unsigned kTraceError = 0x80;
inline constexpr unsigned kTraceAll = 0xFF;

// Records the agent always writes (enabled and flushed with the error class, so the default mask
// keeps them) that are not failures. They carry a label bit above the mask's byte, so that
// `grep ERROR` finds failures only: INFO for what the agent does (processes started, a first
// start without saved state), WARN for settings that will cause trouble.
inline constexpr unsigned kTraceInfo = 0x100 | kTraceError;
inline constexpr unsigned kTraceWarning = 0x200 | kTraceError;

// Parses a Q7_TRACE text and replaces all masks with it (units not named take the "*" mask, or
// the error class when "*" is not named). A "*" word overrides the units named before it. Class
// names are matched in any case; a number above 0xFF is a syntax error. On a syntax error returns
// kParseError, sets *error to a message naming the bad word (when error is non-null) and keeps the
// previous masks.
int TraceConfigure(std::string_view masks, std::string* error);

// Directs records to "path": "-" means standard error, anything else a file rotated at
// max_bytes, keeping max_files old files. The file's directory must exist. Returns kOk or
// kIoError with *error set; on failure the previous destination stays.
int TraceOpen(const std::string& path, std::size_t max_bytes, std::size_t max_files,
              std::string* error);

// Flushes and closes the destination; later records go to standard error.
void TraceClose();

// Flushes buffered records to the destination.
void TraceFlush();

// The masks in force as Q7_TRACE text ("*=0x80 tama=0xFF"); TraceConfigure of it restores them.
std::string TraceMasksText();

// The mask in force for a unit.
unsigned TraceMask(std::string_view unit);

// True when any bit of cls is enabled for the unit.
bool TraceEnabled(std::string_view unit, unsigned cls);

// Writes one record unconditionally. cls names the record's class (the label bits of kTraceInfo
// and kTraceWarning first, else the highest bit set wins for the label; bits without a class
// name show in hex, "0x20"). func may be empty, and then
// the record has no "func: " part. Line ends at the end of text are dropped. Error-class
// records are flushed at once.
void TraceWrite(std::string_view unit, unsigned cls, std::string_view func, std::string_view text);

// Formats printf-style and writes one record when cls is enabled for the unit. Text longer
// than 8191 characters is cut.
void TracePrintf(std::string_view unit, unsigned cls, std::string_view func, const char* fmt, ...)
    __attribute__((format(printf, 4, 5)));

// Formats printf-style and writes one record whatever the masks say.
void TracePrintfAlways(std::string_view unit, unsigned cls, std::string_view func, const char* fmt,
                       ...) __attribute__((format(printf, 4, 5)));

// Writes a function entry or exit event ("ENTER" / "EXIT", with optional text) when the flow
// class is enabled for the unit.
void TraceEvent(std::string_view unit, bool entry, std::string_view func, std::string_view text);

// Names the calling thread for trace records (and, cut to 15 characters, for the OS).
void SetThreadName(const char* name);

// The calling thread's name: the one given to SetThreadName, else the OS name.
std::string ThreadName();

// Entry and exit events of one scope: ENTER on construction, EXIT on destruction.
class TraceFlowScope {
 public:
  TraceFlowScope(std::string_view unit, std::string_view func);
  ~TraceFlowScope();
  TraceFlowScope(const TraceFlowScope&) = delete;
  TraceFlowScope& operator=(const TraceFlowScope&) = delete;

 private:
  std::string_view unit_;
  std::string_view func_;
};

}  // namespace fw

// Traces from agent code: Q7_TRACE(kUnit, fw::kTraceDetail, "KQ1_BaseDir = %s", dir);
#define Q7_TRACE(unit, cls, ...) ::fw::TracePrintf((unit), (cls), __func__, __VA_ARGS__)
// Entry and exit events of the enclosing function.
#define Q7_FLOW(unit) ::fw::TraceFlowScope q7_flow_scope_((unit), __func__)
