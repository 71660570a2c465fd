#pragma once

// AgentMessage: operator messages ("RT_AGENT_STARTED", "OLD_TRANSACTIONS_WARNING", ...). A
// message is looked up by key in the "RTAgentMsgs" resource bundle, formatted with its
// arguments (ICU message format, numbered arguments), kept in a process-wide list of the last
// kMaxMessages, and published at once as a data event row of the agent-messages table
// (Q7AGNTMSGS), where GET /api/v1/events and samples of that table show it.
//
// A formatted text starts with a 10-character message identifier and one separator; the rest
// is the message text.
//
// Until setResourceBundle has opened a bundle, messages are dropped.
//
// Thread safety: every static function may be called from any thread; the bundle and the list
// each have their own lock.

#include <unicode/fmtable.h>

#include <cstddef>
#include <ctime>
#include <memory>
#include <string>
#include <vector>

#include "core/layouts/table_layouts.h"

class AgentMessage {
 public:
  // Messages kept in the list; the oldest goes when one more arrives.
  static constexpr std::size_t kMaxMessages = 1000;
  // Field sizes in bytes, terminator included.
  static constexpr std::size_t kIdSize = 12;
  static constexpr std::size_t kOriginSize = 33;
  static constexpr std::size_t kLocationSize = 513;
  static constexpr std::size_t kTextSize = 1024;
  // Identifier length, and where the text starts in a formatted message.
  static constexpr int kIdLength = 10;
  static constexpr int kTextStart = 11;

  char messageId[kIdSize] = {};   // the formatted text's first 10 characters
  int severity = 0;               // 4 for start-up; higher is more severe
  time_t time = 0;                // seconds since 1970 when sent
  char origin[kOriginSize] = {};  // "WebAgent" or the sender's origin text, UTF-8
  // "file, function, line N" or the sender's location text, UTF-8
  char location[kLocationSize] = {};
  char text[kTextSize] = {};  // the formatted text from character 11 on, UTF-8

  // Opens the bundle at path (a folder of <locale>.res files) for the default locale
  // ("language_country"), replacing any bundle opened before. A failure is traced, and the
  // previous bundle, if any, is closed.
  static void setResourceBundle(const char* path);

  // Sends the message named key with args[0..argCount) (args may be null when argCount is 0),
  // from a place in the agent's source: origin "WebAgent", location from the file's base name,
  // the function and the line. The arguments are only read during the call.
  static void sendMessage(const char* key, int severity, icu::Formattable* args, int argCount,
                          const char* file, const char* function, int line);

  // Sends the message named key with args, origin and location as given (each cut to its
  // field).
  static void sendMessage(const char* key, int severity, const char* origin, const char* location,
                          icu::Formattable* args, int argCount);

  // Adds message to the list, evicting the oldest beyond kMaxMessages, and publishes it as an
  // agent-messages event row.
  static void sendMessage(std::unique_ptr<AgentMessage> message);

  // Sends the message named key with text arguments (UTF-8), located at the caller.
  static void sendMessage(const char* key, int severity, const std::vector<std::string>& args,
                          const char* file = __builtin_FILE(),
                          const char* function = __builtin_FUNCTION(), int line = __builtin_LINE());

  // Copies of the listed messages, oldest first.
  static std::vector<AgentMessage> recentMessages();

  // Closes the bundle and empties the list (tests only).
  static void resetForTesting();
};

// Fills an agent-messages row from message, with now as its timestamp: every text column
// blank-padded to its width, without a terminator.
kq7_q7agntmsgs_data_t makeAgentMessageRow(const AgentMessage& message, time_t now);

// The row query of the agent-messages table: for a sample (type 3), the event rows kept for
// the table, oldest first, as an array from new[] that the caller deletes; otherwise null.
// *count is the number of rows.
kq7_q7agntmsgs_data_t* getAgentMessageRows(int sampleType, int* count);
