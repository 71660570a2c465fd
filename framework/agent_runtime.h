#pragma once

// The framework's agent-facing operations: registration of the agent loader and command
// callbacks, identity (version, node type, host name, affinities, origin node), and the main
// loop with its shutdown request.
//
// Thread safety: registration and identity setters run on the main thread during start-up,
// before kunmain; getters and RequestShutdown may be called from any thread.

#include <sys/utsname.h>

#include <functional>
#include <nlohmann/json_fwd.hpp>
#include <string>
#include <vector>

// A take-action command routed to an agent. The framework owns it; the agent acknowledges it
// with ctuna::FinishedAutomationCommand.
struct CtunaAutomationCapsule {
  std::string command;    // full command text, starting with the agent's prefix
  bool finished = false;  // set by FinishedAutomationCommand
};

namespace ctuna {
// Marks the command as finished. Returns kOk, or kInvalidArgument for a null capsule.
int FinishedAutomationCommand(CtunaAutomationCapsule* capsule);
}  // namespace ctuna

// Fills buf (len bytes) with the local host's name, terminated. Returns kOk or a status.
int DetermineLocalHost(char* buf, int len);

// The framework main loop: calls the registered agent loader, starts the HTTP server, waits for
// a shutdown request, stops the server and returns 0 (or a negative status when the server
// could not start).
int kunmain(int argc, char** argv);

namespace fw {

using AgentLoader = int (*)();
using CommandCallback = int (*)(CtunaAutomationCapsule*);

void RegisterAgentLoader(AgentLoader loader);
void RegisterCommandCallback(const char* prefix, CommandCallback callback);
// Routes a command to the callback whose prefix starts it. Returns the callback's result, or
// kNotFound when no prefix matches.
int DispatchCommand(CtunaAutomationCapsule* capsule);

// Writes the version of the product code ("01.00.00") into buf, cut to len - 1 characters and
// terminated. Returns kInvalidArgument for an unknown product code.
int SetVersionFromProductCode(const char* product_code, char* buf, std::size_t len);
int SetNodeTypeFromProductCode(const char* product_code);
// The node type set above ("Q7"), empty before.
std::string NodeType();
// The product version text of this build.
const char* ProductVersion();

// The agent's host name as the agent declared it.
int SetHostName(const char* name);
std::string HostName();

// Affinities in declaration order.
int DeclareAffinity(const char* affinity);
std::vector<std::string> Affinities();

// The origin node name: Q7_NODE_NAME, or "<short host>:Q7", at most 32 characters.
std::string OriginNodeName();

// uname(2) as the framework sees it; tests inject a node name through SetUnameForTesting (an
// empty function restores the real call).
int Uname(struct utsname* out);
void SetUnameForTesting(std::function<int(struct utsname*)> fn);

// Asks the main loop to return. Safe from any thread, any number of times.
void RequestShutdown(int reason);
bool ShutdownRequested();

// Extra JSON for /healthz and /api/v1/agent, supplied by the agent. Set before kunmain.
void SetHealthProvider(std::function<void(nlohmann::json&)> provider);
void SetAgentInfoProvider(std::function<void(nlohmann::json&)> provider);

// Resets registrations, identity and the shutdown flag (tests only).
void ResetRuntimeForTesting();

}  // namespace fw
