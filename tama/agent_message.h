#pragma once

// AgentMessage: operator messages by key ("RT_AGENT_STARTED", "OLD_TRANSACTIONS_WARNING", ...),
// with a severity and text arguments substituted into the message's text.
//
// Until the message bundle is built, a message is written to the trace log with its key,
// severity and arguments, at the error class so that it is never filtered away.
//
// Thread safety: sendMessage may be called from any thread.

#include <string>
#include <vector>

class AgentMessage {
 public:
  AgentMessage() = delete;

  // Sends the message named key. args are substituted in order.
  static void sendMessage(const char* key, int severity, const std::vector<std::string>& args);
};
