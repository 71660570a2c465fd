#include "core/runtime/clog.h"

#include <algorithm>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>

#include "framework/trace.h"

std::atomic<unsigned long> CLOG::VLevel{2};
int CLOG::fd = -1;
CvelMutex CLOG::mutex;

namespace {

constexpr std::string_view kUnit = "analyzer";
constexpr std::size_t kBufferSize = 8192;

// Trace classes are the low byte of the mask; wider masks from callers keep only those bits.
unsigned ClassesOf(unsigned long mask) {
  return static_cast<unsigned>(mask & fw::kTraceAll);
}

// Formats prefix + fmt into one buffer and writes it at cls. Output is cut at the buffer size,
// which callers are expected never to reach.
void WriteFormatted(unsigned cls, const char* prefix, const char* fmt, va_list args) {
  char buffer[kBufferSize];
  std::size_t used = 0;
  if (prefix != nullptr) {
    used = std::strlen(prefix);
    std::memcpy(buffer, prefix, used + 1);
  }
  std::vsnprintf(buffer + used, sizeof(buffer) - used, fmt != nullptr ? fmt : "", args);
  fw::TraceWrite(kUnit, cls, "", buffer);
}

// Tests the classes before formatting, so that a disabled trace costs only the mask lookup.
// The record is labelled with the class that let it through, not the caller's widest bit.
void WriteIfEnabled(unsigned cls, const char* prefix, const char* fmt, va_list args) {
  const unsigned enabled = cls & fw::TraceMask(kUnit);
  if (enabled != 0) {
    WriteFormatted(enabled, prefix, fmt, args);
  }
}

}  // namespace

void CLOG::enter(unsigned long mask, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  WriteIfEnabled(ClassesOf(mask), "ENTER, ", fmt, args);
  va_end(args);
}

void CLOG::exit(unsigned long mask, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  WriteIfEnabled(ClassesOf(mask), "EXIT, ", fmt, args);
  va_end(args);
}

void CLOG::message(unsigned long mask, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  WriteIfEnabled(ClassesOf(mask), nullptr, fmt, args);
  va_end(args);
}

void CLOG::trace(unsigned long mask, const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  WriteIfEnabled(ClassesOf(mask), nullptr, fmt, args);
  va_end(args);
}

void CLOG::message(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  WriteIfEnabled(fw::kTraceSummary, nullptr, fmt, args);
  va_end(args);
}

void CLOG::max(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  WriteIfEnabled(fw::kTraceSummary, nullptr, fmt, args);
  va_end(args);
}

void CLOG::med(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  WriteIfEnabled(fw::kTraceDetail, nullptr, fmt, args);
  va_end(args);
}

void CLOG::debug(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  WriteIfEnabled(fw::kTraceDebug, nullptr, fmt, args);
  va_end(args);
}

void CLOG::min(const char* fmt, ...) {
  // TraceEvent checks the flow class itself.
  fw::TraceEvent(kUnit, true, "CLOG::min", "");
  va_list args;
  va_start(args, fmt);
  WriteFormatted(fw::kTraceSummary, nullptr, fmt, args);
  va_end(args);
  fw::TraceEvent(kUnit, false, "CLOG::min", "");
}

void CLOG::error(const char* fmt, ...) {
  va_list args;
  va_start(args, fmt);
  WriteFormatted(fw::kTraceError, nullptr, fmt, args);
  va_end(args);
}

void CLOG::trace_padded(unsigned long level, const char* fmt, const char* text, int width) {
  if (!isLogging(level)) {
    return;
  }
  std::string buffer;
  if (text != nullptr && width > 0) {
    buffer.assign(text, strnlen(text, static_cast<std::size_t>(width)));
  }
  std::size_t end = buffer.find_last_not_of(' ');
  // A text of blanks only keeps its first character.
  buffer.resize(end == std::string::npos ? std::min<std::size_t>(buffer.size(), 1) : end + 1);
  trace(level, fmt != nullptr ? fmt : "%s", buffer.c_str());
}
