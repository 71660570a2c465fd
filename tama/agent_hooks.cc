#include "tama/agent_hooks.h"

namespace tama {

AgentHooks& agentHooks() {
  static AgentHooks hooks;
  return hooks;
}

}  // namespace tama
