#pragma once

// Connects start-up and shutdown to the subsystems of this build: the analyzer singleton and
// the agent messages. Called by main before CtMain, on the main thread.

namespace tama {

void installAgentHooks();

}  // namespace tama
