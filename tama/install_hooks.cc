#include "tama/install_hooks.h"

#include "core/analyzer/dpx_analyzer.h"
#include "tama/agent_hooks.h"
#include "tama/agent_message.h"

namespace tama {

void installAgentHooks() {
  AgentHooks& hooks = agentHooks();
  hooks.start_analyzer = [] { CDPXAnalyzer::GetInstance(); };
  hooks.shutdown_analyzer = [] { CDPXAnalyzer::GetInstanceNoStart()->Shutdown(); };
  hooks.join_analyzer = [] { CDPXAnalyzer::GetInstanceNoStart()->Join(); };
  hooks.send_agent_message = [](const char* key, int severity,
                                const std::vector<std::string>& args) {
    AgentMessage::sendMessage(key, severity, args);
  };
}

}  // namespace tama
