#pragma once

// The start-up steps the Agent (tama/agent.h) takes around the framework main loop, and the two
// callbacks the framework calls back (agent loader and command callback).
//
// Thread safety: prepareMsgFileName, nameAgent and applyAgentProperties run on the main thread
// during start-up; LoadAgents runs on the main loop's thread; HandleTakeAction on any framework
// thread.

struct CtunaAutomationCapsule;

// Names the agent message log file: "./" + KQ7_MSG_FILE_NAME (default "kq1msg.log").
void prepareMsgFileName();

// Applies the agent properties to CConfig: "AgentBaseDir", "KQ7DPXLOGPATH" (warning when the
// path holds a '.' or '-'), "KQ7OVERTIMEINTERVAL" and "KQ7SUMMARYINTERVAL" (decimal; empty or
// non-numeric gives 0). The setters validate.
void applyAgentProperties();

// The agent loader: declares the affinities and initialises the 23 tables. Returns 0.
int LoadAgents();

// The "KQ7" command callback: acknowledges every command at once. Returns 1.
int HandleTakeAction(CtunaAutomationCapsule* capsule);

namespace tama {

// Sets kq1_agent_name ("$UNKNOWN$" or the first 24 characters of the node name),
// kq1_short_agent_name (cut at the first '.') and the framework host name.
void nameAgent();

}  // namespace tama
