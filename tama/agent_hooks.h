#pragma once

// Hooks through which start-up and shutdown reach subsystems that are built separately: the
// analyzer singleton, the collector process monitors and the agent messages. The code that
// owns each subsystem fills its hooks before CtMain runs; an empty hook means the subsystem
// is not part of this build, and start-up traces that once and goes on.
//
// Thread safety: filled on the main thread before CtMain; read-only afterwards.

#include <functional>
#include <memory>
#include <nlohmann/json_fwd.hpp>
#include <string>
#include <vector>

namespace tama {

// One supervised collector process, as start-up and shutdown see it.
class CollectorMonitor {
 public:
  virtual ~CollectorMonitor() = default;
  // Starts supervising; returns 0 or a negative status.
  virtual int start() = 0;
  // Stops supervising and waits for the supervision thread; that thread runs the stop command
  // when the process is still alive.
  virtual int stop() = 0;
};

// What a collector monitor is created with.
struct CollectorMonitorSpec {
  std::string pid_file;                 // the process's pid file
  std::vector<std::string> start_argv;  // {"/bin/sh", script, "start", which}
  std::vector<std::string> stop_argv;   // {"/bin/sh", script, "stop", which}
  std::vector<std::string> env;         // {"PATH=/bin:/sbin:/usr/bin:/usr/sbin"}
  int poll_seconds = 60;
};

struct AgentHooks {
  // Creates the analyzer singleton and starts its thread.
  std::function<void()> start_analyzer;
  // Asks the analyzer to shut down.
  std::function<void()> shutdown_analyzer;
  // Waits, without limit, for the analyzer thread to end.
  std::function<void()> join_analyzer;
  // Creates a collector process monitor (not yet started).
  std::function<std::unique_ptr<CollectorMonitor>(const CollectorMonitorSpec&)>
      make_collector_monitor;
  // Adds the analyzer's state and counters to a JSON object: "state" (not started, running,
  // stopping, stopped) and "counters" (records read, unparsed and dropped as outliers,
  // transactions processed, ignored and taken from the queue, queue depth, the file and
  // offset being read).
  std::function<void(nlohmann::json& out)> describe_analyzer;
  // Sends an agent message by key with a severity and substitution arguments.
  std::function<void(const char* key, int severity, const std::vector<std::string>& args)>
      send_agent_message;
};

// The process's hooks.
AgentHooks& agentHooks();

}  // namespace tama
