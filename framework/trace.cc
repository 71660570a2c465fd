#include "framework/trace.h"

#include <pthread.h>
#include <spdlog/logger.h>
#include <spdlog/sinks/rotating_file_sink.h>
#include <spdlog/sinks/stdout_sinks.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cassert>
#include <cctype>
#include <cerrno>
#include <charconv>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <exception>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "framework/mutex.h"
#include "framework/status.h"
#include "framework/trace_capture.h"

namespace fw {
namespace {

// Masks in force. Published tables are never changed; each unit appears at most once.
struct MaskTable {
  unsigned star = kTraceError;
  std::vector<std::pair<std::string, unsigned>> units;

  unsigned Lookup(std::string_view unit) const {
    for (const auto& [name, mask] : units) {
      if (name == unit) {
        return mask;
      }
    }
    return star;
  }
};

// Readers load the table pointer without a lock. A replaced table is kept alive (not freed)
// because a reader may still hold it; tables change only at start-up and in tests, so the
// retained set stays small.
std::atomic<const MaskTable*> g_masks{nullptr};  // null: the default (error class only)
constinit Mutex g_publish_mutex;

void PublishMasks(std::unique_ptr<MaskTable> table) {
  // Deliberately leaked so tables stay valid for threads that trace during exit.
  static auto* retained PT_GUARDED_BY(g_publish_mutex) =
      new std::vector<std::unique_ptr<const MaskTable>>;
  MutexLock lock(g_publish_mutex);
  const MaskTable* raw = table.get();
  retained->push_back(std::move(table));
  g_masks.store(raw, std::memory_order_release);
}

// The destination and the capture buffer. mu serialises every record, so records from
// different threads never interleave and sinks can be the single-threaded kind.
struct Writer {
  Mutex mu;
  std::shared_ptr<spdlog::logger> logger GUARDED_BY(mu);  // null until first use (stderr)
  bool capturing GUARDED_BY(mu) = false;
  std::vector<std::string> captured GUARDED_BY(mu);
};

// Never destroyed: detached threads may still trace while static destructors run.
Writer& GetWriter() {
  static auto* writer = new Writer;
  return *writer;
}

std::shared_ptr<spdlog::logger> MakeLogger(std::shared_ptr<spdlog::sinks::sink> sink) {
  auto logger = std::make_shared<spdlog::logger>("q7trace", std::move(sink));
  logger->set_level(spdlog::level::trace);
  logger->set_pattern("%Y-%m-%d %H:%M:%S.%e %v");  // local time is spdlog's default
  return logger;
}

std::shared_ptr<spdlog::logger> MakeStderrLogger() {
  return MakeLogger(std::make_shared<spdlog::sinks::stderr_sink_st>());
}

thread_local std::string t_thread_name;

// A label bit names the record; else the highest class bit set does, and bits without a name
// show in hex.
std::string ClassLabel(unsigned cls) {
  if ((cls & kTraceWarning & ~kTraceAll) != 0) {
    return "WARN";
  }
  if ((cls & kTraceInfo & ~kTraceAll) != 0) {
    return "INFO";
  }
  for (int bit = 7; bit >= 0; --bit) {
    const unsigned b = 1u << bit;
    if ((cls & b) == 0) {
      continue;
    }
    switch (b) {
      case kTraceError:
        return "ERROR";
      case kTraceFlow:
        return "FLOW";
      case kTraceDetail:
        return "DETAIL";
      case kTraceSummary:
        return "SUMMARY";
      case kTraceDebug:
        return "DEBUG";
      default: {
        char hex[8];
        snprintf(hex, sizeof(hex), "0x%02X", b);
        return hex;
      }
    }
  }
  return "NONE";
}

// "[thread] unit CLASS func: text": the record without its time stamp.
std::string FormatBody(std::string_view unit, unsigned cls, std::string_view func,
                       std::string_view text) {
  // printf-style callers often end with "\n"; spdlog adds the line end itself.
  while (!text.empty() && (text.back() == '\n' || text.back() == '\r')) {
    text.remove_suffix(1);
  }
  std::string body;
  const std::string thread = ThreadName();
  body.reserve(thread.size() + unit.size() + func.size() + text.size() + 16);
  body.append("[").append(thread).append("] ").append(unit).append(" ");
  body.append(ClassLabel(cls)).append(" ");
  if (!func.empty()) {
    body.append(func).append(": ");
  }
  body.append(text);
  return body;
}

void VTrace(std::string_view unit, unsigned cls, std::string_view func, const char* fmt,
            va_list ap) {
  char buffer[8192];
  int n = vsnprintf(buffer, sizeof(buffer), fmt, ap);
  if (n < 0) {
    n = 0;
  }
  const std::size_t len = std::min<std::size_t>(static_cast<std::size_t>(n), sizeof(buffer) - 1);
  TraceWrite(unit, cls, func, std::string_view(buffer, len));
}

bool EqualsIgnoreCase(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) {
    return false;
  }
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (std::toupper(static_cast<unsigned char>(a[i])) != b[i]) {
      return false;
    }
  }
  return true;
}

// One '|'-separated part of a mask: a class name, "0x" hex or decimal.
bool ParseMaskPart(std::string_view part, unsigned* mask) {
  static constexpr std::pair<std::string_view, unsigned> kNames[] = {
      {"DEBUG", kTraceDebug},
      {"SUMMARY", kTraceSummary},
      {"DETAIL", kTraceDetail},
      {"FLOW", kTraceFlow},
      {"ERROR", kTraceError},
      {"ALL", kTraceAll},
      {"NONE", 0},
  };
  for (const auto& [name, bits] : kNames) {
    if (EqualsIgnoreCase(part, name)) {
      *mask = bits;
      return true;
    }
  }
  int base = 10;
  if (part.size() > 2 && part[0] == '0' && (part[1] == 'x' || part[1] == 'X')) {
    part.remove_prefix(2);
    base = 16;
  }
  if (part.empty()) {
    return false;
  }
  unsigned value = 0;
  auto [end, ec] = std::from_chars(part.data(), part.data() + part.size(), value, base);
  // Masks are eight class bits; anything wider is a typo, not a request.
  if (ec != std::errc() || end != part.data() + part.size() || value > kTraceAll) {
    return false;
  }
  *mask = value;
  return true;
}

bool ParseMask(std::string_view text, unsigned* mask) {
  unsigned result = 0;
  while (true) {
    const std::size_t bar = text.find('|');
    unsigned bits = 0;
    if (!ParseMaskPart(text.substr(0, bar), &bits)) {
      return false;
    }
    result |= bits;
    if (bar == std::string_view::npos) {
      break;
    }
    text.remove_prefix(bar + 1);
  }
  *mask = result;
  return true;
}

bool IsBlank(char c) {
  return c == ' ' || c == '\t' || c == '\n' || c == '\r';
}

bool DirectoryExists(const std::string& path, std::string* reason) {
  const std::size_t slash = path.rfind('/');
  // Built in one step: g++ 12 at -O3 warns falsely (-Wrestrict) on assigning a literal here.
  const std::string dir = slash == std::string::npos ? std::string(".")
                          : slash == 0               ? std::string("/")
                                                     : path.substr(0, slash);
  struct stat st;
  if (stat(dir.c_str(), &st) != 0) {
    *reason = "trace directory " + dir + ": " + std::strerror(errno);
    return false;
  }
  if (!S_ISDIR(st.st_mode)) {
    *reason = "trace directory " + dir + ": not a directory";
    return false;
  }
  return true;
}

}  // namespace

int TraceConfigure(std::string_view masks, std::string* error) {
  auto table = std::make_unique<MaskTable>();
  std::size_t pos = 0;
  while (pos < masks.size()) {
    if (IsBlank(masks[pos])) {
      ++pos;
      continue;
    }
    std::size_t end = pos;
    while (end < masks.size() && !IsBlank(masks[end])) {
      ++end;
    }
    const std::string_view word = masks.substr(pos, end - pos);
    pos = end;

    const std::size_t eq = word.find('=');
    const std::string_view unit = word.substr(0, eq);
    unsigned mask = 0;
    const char* reason = nullptr;
    if (eq == std::string_view::npos) {
      reason = "expected unit=mask";
    } else if (unit.empty()) {
      reason = "missing unit name";
    } else if (!ParseMask(word.substr(eq + 1), &mask)) {
      reason = "mask must be class names joined by '|' or a number up to 0xFF";
    }
    if (reason != nullptr) {
      if (error != nullptr) {
        *error = "bad trace word \"" + std::string(word) + "\": " + reason;
      }
      return kParseError;
    }

    if (unit == "*") {
      // "*" names every unit, so it overrides the units named before it.
      table->star = mask;
      table->units.clear();
      continue;
    }
    bool replaced = false;
    for (auto& entry : table->units) {
      if (entry.first == unit) {
        entry.second = mask;
        replaced = true;
      }
    }
    if (!replaced) {
      table->units.emplace_back(std::string(unit), mask);
    }
  }
  PublishMasks(std::move(table));
  return kOk;
}

std::string TraceMasksText() {
  const MaskTable* table = g_masks.load(std::memory_order_acquire);
  char buffer[16];
  snprintf(buffer, sizeof(buffer), "0x%02X", table != nullptr ? table->star : kTraceError);
  std::string text = std::string("*=") + buffer;
  if (table != nullptr) {
    for (const auto& [name, mask] : table->units) {
      snprintf(buffer, sizeof(buffer), "0x%02X", mask);
      text.append(" ").append(name).append("=").append(buffer);
    }
  }
  return text;
}

int TraceOpen(const std::string& path, std::size_t max_bytes, std::size_t max_files,
              std::string* error) {
  std::shared_ptr<spdlog::logger> logger;
  if (path == "-") {
    logger = MakeStderrLogger();
  } else {
    std::string reason;
    // spdlog would create missing directories; a wrong path should fail instead.
    if (!DirectoryExists(path, &reason)) {
      if (error != nullptr) {
        *error = reason;
      }
      return kIoError;
    }
    try {
      logger = MakeLogger(
          std::make_shared<spdlog::sinks::rotating_file_sink_st>(path, max_bytes, max_files));
    } catch (const std::exception& e) {
      if (error != nullptr) {
        *error = "cannot open trace file " + path + ": " + e.what();
      }
      return kIoError;
    }
  }
  Writer& writer = GetWriter();
  std::shared_ptr<spdlog::logger> previous;
  {
    MutexLock lock(writer.mu);
    previous = std::exchange(writer.logger, std::move(logger));
    if (previous) {
      previous->flush();
    }
  }
  return kOk;
}

void TraceClose() {
  Writer& writer = GetWriter();
  MutexLock lock(writer.mu);
  if (writer.logger) {
    writer.logger->flush();
    writer.logger.reset();
  }
}

void TraceFlush() {
  Writer& writer = GetWriter();
  MutexLock lock(writer.mu);
  if (writer.logger) {
    writer.logger->flush();
  }
}

unsigned TraceMask(std::string_view unit) {
  const MaskTable* table = g_masks.load(std::memory_order_acquire);
  return table != nullptr ? table->Lookup(unit) : kTraceError;
}

bool TraceEnabled(std::string_view unit, unsigned cls) {
  return (TraceMask(unit) & cls) != 0;
}

void TraceWrite(std::string_view unit, unsigned cls, std::string_view func, std::string_view text) {
  std::string body = FormatBody(unit, cls, func, text);
  Writer& writer = GetWriter();
  MutexLock lock(writer.mu);
  if (!writer.logger) {
    writer.logger = MakeStderrLogger();
  }
  writer.logger->log(spdlog::level::info, spdlog::string_view_t(body.data(), body.size()));
  // A crash (or kill -9) right after an error, or a record written whatever the masks say
  // (few, and the ones an operator looks for), must still leave it in the file.
  if ((cls & kTraceError) != 0 || (TraceMask(unit) & cls) == 0) {
    writer.logger->flush();
  }
  if (writer.capturing) {
    writer.captured.push_back(std::move(body));
  }
}

void TracePrintf(std::string_view unit, unsigned cls, std::string_view func, const char* fmt, ...) {
  if (!TraceEnabled(unit, cls)) {
    return;
  }
  va_list ap;
  va_start(ap, fmt);
  VTrace(unit, cls, func, fmt, ap);
  va_end(ap);
}

void TracePrintfAlways(std::string_view unit, unsigned cls, std::string_view func, const char* fmt,
                       ...) {
  va_list ap;
  va_start(ap, fmt);
  VTrace(unit, cls, func, fmt, ap);
  va_end(ap);
}

void TraceEvent(std::string_view unit, bool entry, std::string_view func, std::string_view text) {
  if (!TraceEnabled(unit, kTraceFlow)) {
    return;
  }
  std::string event = entry ? "ENTER" : "EXIT";
  if (!text.empty()) {
    event.append(" ").append(text);
  }
  TraceWrite(unit, kTraceFlow, func, event);
}

void SetThreadName(const char* name) {
  if (name == nullptr) {
    return;
  }
  t_thread_name = name;
  char os_name[16];  // the kernel keeps 15 characters and a terminator
  snprintf(os_name, sizeof(os_name), "%s", name);
  pthread_setname_np(pthread_self(), os_name);
}

std::string ThreadName() {
  if (!t_thread_name.empty()) {
    return t_thread_name;
  }
  char os_name[16];
  if (pthread_getname_np(pthread_self(), os_name, sizeof(os_name)) == 0 && os_name[0] != '\0') {
    return os_name;
  }
  return "thread " + std::to_string(gettid());
}

TraceFlowScope::TraceFlowScope(std::string_view unit, std::string_view func)
    : unit_(unit), func_(func) {
  TraceEvent(unit_, true, func_, {});
}

TraceFlowScope::~TraceFlowScope() {
  TraceEvent(unit_, false, func_, {});
}

TraceCapture::TraceCapture(std::string_view masks) : previous_masks_(TraceMasksText()) {
  std::string error;
  const int rc = TraceConfigure(masks, &error);
  assert(rc == kOk && "TraceCapture needs valid trace masks");
  (void)rc;
  Writer& writer = GetWriter();
  MutexLock lock(writer.mu);
  assert(!writer.capturing && "one TraceCapture at a time");
  writer.capturing = true;
  writer.captured.clear();
}

TraceCapture::~TraceCapture() {
  {
    Writer& writer = GetWriter();
    MutexLock lock(writer.mu);
    writer.capturing = false;
    writer.captured.clear();
  }
  TraceConfigure(previous_masks_, nullptr);
}

std::vector<std::string> TraceCapture::lines() const {
  Writer& writer = GetWriter();
  MutexLock lock(writer.mu);
  return writer.captured;
}

bool TraceCapture::contains(std::string_view text) const {
  return count(text) > 0;
}

int TraceCapture::count(std::string_view text) const {
  Writer& writer = GetWriter();
  MutexLock lock(writer.mu);
  int n = 0;
  for (const std::string& line : writer.captured) {
    if (line.find(text) != std::string::npos) {
      ++n;
    }
  }
  return n;
}

void TraceCapture::clear() {
  Writer& writer = GetWriter();
  MutexLock lock(writer.mu);
  writer.captured.clear();
}

}  // namespace fw
