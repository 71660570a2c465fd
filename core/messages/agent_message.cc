#include "core/messages/agent_message.h"

#include <unicode/fieldpos.h>
#include <unicode/locid.h>
#include <unicode/msgfmt.h>
#include <unicode/resbund.h>
#include <unicode/unistr.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <deque>
#include <string_view>
#include <utility>

#include "framework/agent_runtime.h"
#include "framework/clock.h"
#include "framework/events.h"
#include "framework/mutex.h"
#include "framework/trace.h"

namespace {

constexpr char kUnit[] = "tama";
constexpr char kWebAgentOrigin[] = "WebAgent";
constexpr char kEventTable[] = "Q7AGNTMSGS";
constexpr int kSampleRequestType = 3;

struct Bundle {
  fw::Mutex mutex;
  std::unique_ptr<icu::ResourceBundle> bundle GUARDED_BY(mutex);
};

Bundle& TheBundle() {
  static Bundle bundle;
  return bundle;
}

struct MessageList {
  fw::Mutex mutex;
  std::deque<std::unique_ptr<AgentMessage>> messages GUARDED_BY(mutex);  // oldest first
};

MessageList& TheList() {
  static MessageList list;
  return list;
}

// The longest prefix of text that fits max_bytes without splitting a UTF-8 character.
std::string_view Utf8Prefix(std::string_view text, std::size_t max_bytes) {
  if (text.size() <= max_bytes) {
    return text;
  }
  std::size_t end = max_bytes;
  while (end > 0 && (static_cast<unsigned char>(text[end]) & 0xC0) == 0x80) {
    --end;
  }
  return text.substr(0, end);
}

// Copies text into a terminated field of N bytes, cut to fit.
template <std::size_t N>
void CopyTerminated(char (&field)[N], std::string_view text) {
  const std::string_view fitting = Utf8Prefix(text, N - 1);
  std::memcpy(field, fitting.data(), fitting.size());
  field[fitting.size()] = '\0';
}

// KQ1_CopyPad: text into a fixed column, blank-padded, unterminated, cut when longer.
template <std::size_t N>
void CopyPad(char (&column)[N], std::string_view text) {
  const std::size_t length = std::min(text.size(), N);
  std::memcpy(column, text.data(), length);
  std::memset(column + length, ' ', N - length);
}

std::string ToUtf8(const icu::UnicodeString& text) {
  std::string out;
  text.toUTF8String(out);
  return out;
}

// The message pattern of key; empty (and traced) when the key is missing. False when no bundle
// is open.
bool LookUpPattern(const char* key, icu::UnicodeString* pattern) {
  Bundle& bundle = TheBundle();
  fw::MutexLock lock(bundle.mutex);
  if (bundle.bundle == nullptr) {
    return false;
  }
  UErrorCode status = U_ZERO_ERROR;
  *pattern = bundle.bundle->getStringEx(key, status);
  if (U_FAILURE(status)) {
    Q7_TRACE(kUnit, fw::kTraceError, "Could not find message for key %s", key);
    pattern->remove();
  }
  return true;
}

}  // namespace

void AgentMessage::setResourceBundle(const char* path) {
  const icu::Locale& locale = icu::Locale::getDefault();
  if (locale.isBogus() || *locale.getLanguage() == '\0') {
    Q7_TRACE(kUnit, fw::kTraceError, "Could not get locale");
    return;
  }
  char name[ULOC_FULLNAME_CAPACITY * 2 + 2];
  std::snprintf(name, sizeof(name), "%s_%s", locale.getLanguage(), locale.getCountry());
  Q7_TRACE(kUnit, fw::kTraceDetail, "Attempting to open bundle using locale %s", name);

  UErrorCode status = U_ZERO_ERROR;
  auto bundle = std::make_unique<icu::ResourceBundle>(path, icu::Locale(name), status);
  Bundle& current = TheBundle();
  fw::MutexLock lock(current.mutex);
  if (U_FAILURE(status)) {
    Q7_TRACE(kUnit, fw::kTraceError, "Could not open resource bundle %s", path);
    current.bundle.reset();
    return;
  }
  current.bundle = std::move(bundle);
}

void AgentMessage::sendMessage(const char* key, int severity, icu::Formattable* args, int argCount,
                               const char* file, const char* function, int line) {
  const char* base = file == nullptr ? "" : std::strrchr(file, '/');
  base = base == nullptr ? file : base + 1;
  char location[kLocationSize];
  std::snprintf(location, sizeof(location), "%s, %s, line %d", base,
                function == nullptr ? "" : function, line);
  sendMessage(key, severity, kWebAgentOrigin, location, args, argCount);
}

void AgentMessage::sendMessage(const char* key, int severity, const char* origin,
                               const char* location, icu::Formattable* args, int argCount) {
  if (key == nullptr) {
    key = "";
  }
  icu::UnicodeString pattern;
  if (!LookUpPattern(key, &pattern)) {
    return;
  }
  icu::UnicodeString formatted;
  UErrorCode status = U_ZERO_ERROR;
  icu::MessageFormat format(pattern, icu::Locale::getDefault(), status);
  if (U_SUCCESS(status)) {
    icu::FieldPosition position;
    format.format(args, args == nullptr ? 0 : argCount, formatted, position, status);
  }
  if (U_FAILURE(status)) {
    Q7_TRACE(kUnit, fw::kTraceError, "Failed to format message for key %s", key);
  }

  auto message = std::make_unique<AgentMessage>();
  message->severity = severity;
  message->time = fw::Now();
  CopyTerminated(message->origin, origin == nullptr ? "" : origin);
  CopyTerminated(message->location, location == nullptr ? "" : location);
  CopyTerminated(message->messageId, ToUtf8(formatted.tempSubString(0, kIdLength)));
  CopyTerminated(message->text, ToUtf8(formatted.tempSubString(kTextStart)));
  sendMessage(std::move(message));
}

void AgentMessage::sendMessage(std::unique_ptr<AgentMessage> message) {
  if (message == nullptr) {
    return;
  }
  const kq7_q7agntmsgs_data_t row = makeAgentMessageRow(*message, fw::Now());
  {
    MessageList& list = TheList();
    fw::MutexLock lock(list.mutex);
    if (list.messages.size() >= kMaxMessages) {
      list.messages.pop_front();
    }
    list.messages.push_back(std::move(message));
  }
  fw::PushEventRows(kEventTable, &row, sizeof(row), 1);
}

void AgentMessage::sendMessage(const char* key, int severity, const std::vector<std::string>& args,
                               const char* file, const char* function, int line) {
  std::vector<icu::Formattable> formattables;
  formattables.reserve(args.size());
  for (const std::string& arg : args) {
    formattables.emplace_back(icu::UnicodeString::fromUTF8(arg));
  }
  sendMessage(key, severity, formattables.data(), static_cast<int>(formattables.size()), file,
              function, line);
}

std::vector<AgentMessage> AgentMessage::recentMessages() {
  MessageList& list = TheList();
  fw::MutexLock lock(list.mutex);
  std::vector<AgentMessage> copies;
  copies.reserve(list.messages.size());
  for (const auto& message : list.messages) {
    copies.push_back(*message);
  }
  return copies;
}

void AgentMessage::resetForTesting() {
  {
    Bundle& bundle = TheBundle();
    fw::MutexLock lock(bundle.mutex);
    bundle.bundle.reset();
  }
  MessageList& list = TheList();
  fw::MutexLock lock(list.mutex);
  list.messages.clear();
}

// msgdattime is the row's timestamp and sdate_time the message's own time, in column order.
kq7_q7agntmsgs_data_t makeAgentMessageRow(const AgentMessage& message, time_t now) {
  kq7_q7agntmsgs_data_t row;
  CopyPad(row.originnode, fw::OriginNodeName());
  TimeSince70ToMordel(now, row.msgdattime);
  TimeSince70ToMordel(message.time, row.sdate_time);
  row.severity = message.severity;
  CopyPad(row.component, message.origin);
  CopyPad(row.msgid, message.messageId);
  CopyPad(row.msgtext, message.text);
  CopyPad(row.msgsource, message.location);
  return row;
}

kq7_q7agntmsgs_data_t* getAgentMessageRows(int sampleType, int* count) {
  *count = 0;
  if (sampleType != kSampleRequestType) {
    return nullptr;
  }
  const std::vector<fw::EventRow> events = fw::ListEventRows(kEventTable);
  if (events.empty()) {
    return nullptr;
  }
  auto* rows = new kq7_q7agntmsgs_data_t[events.size()];
  int filled = 0;
  for (const fw::EventRow& event : events) {
    if (event.bytes.size() == sizeof(kq7_q7agntmsgs_data_t)) {
      std::memcpy(&rows[filled++], event.bytes.data(), sizeof(kq7_q7agntmsgs_data_t));
    }
  }
  *count = filled;
  return rows;
}
