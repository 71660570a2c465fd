#pragma once

// The agent's start-up and shutdown steps around the framework main loop, and the two callbacks
// the framework calls back (agent loader and command callback).
//
// Thread safety: prepareMsgFileName, prepare_startup and prepare_shutdown run on the main
// thread in that order; LoadAgents runs on the main loop's thread; HandleTakeAction on any
// framework thread.

struct CtunaAutomationCapsule;

// Names the agent message log file: "./" + KQ7_MSG_FILE_NAME (default "kq1msg.log").
void prepareMsgFileName();

// Registers with the framework, names the agent, reads the configuration and creates the
// analyzer.
void prepare_startup(int argc, char** argv);

// Shuts the analyzer down and waits for its thread.
void prepare_shutdown();

// The agent loader: declares the affinities and initialises the 23 tables. Returns 0.
int LoadAgents();

// The "KQ7" command callback: acknowledges every command at once. Returns 1.
int HandleTakeAction(CtunaAutomationCapsule* capsule);

namespace tama {

// Sets kq1_agent_name ("$UNKNOWN$" or the first 24 characters of the node name),
// kq1_short_agent_name (cut at the first '.') and the framework host name.
void nameAgent();

// What /healthz reports about collector supervision ("supervised", "not supervised
// (DPX_NOSTART)", ...). Set by CtMain.
void setCollectorState(const char* state);

}  // namespace tama
