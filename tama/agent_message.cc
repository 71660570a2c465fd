#include "tama/agent_message.h"

#include "framework/trace.h"

void AgentMessage::sendMessage(const char* key, int severity,
                               const std::vector<std::string>& args) {
  std::string text;
  for (const std::string& arg : args) {
    text += text.empty() ? "" : " ";
    text += "[" + arg + "]";
  }
  fw::TracePrintfAlways("tama", fw::kTraceError, "AgentMessage::sendMessage",
                        "agent message %s severity[%d] %s", key != nullptr ? key : "(null)",
                        severity, text.c_str());
}
