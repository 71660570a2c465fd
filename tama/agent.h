#pragma once

// Agent: builds, starts and stops, in order, what the agent process is made of: the signal
// manager, start-up (naming, configuration, the analyzer), collector supervision around the
// framework's main loop, and what /api/v1/agent and /healthz report. CtMain runs one with the
// process's parts (ProcessParts); tests run one with fakes. The agent reaches its parts only
// through what it was built with: no process-wide hooks.
//
// Thread safety: run (with prepare_startup and prepare_shutdown inside it) on the main thread,
// once per Agent. The status providers it registers with the framework run on HTTP threads
// while run is running; they read the parts (immutable) and the collector state (under
// mutex_). The providers are withdrawn before run returns.

#include <functional>
#include <memory>
#include <nlohmann/json_fwd.hpp>
#include <string>
#include <vector>

#include "framework/metrics_api.h"
#include "framework/mutex.h"
#include "tama/collector_monitor.h"

namespace tama {

// What an Agent is made of. Every member must be set.
struct AgentParts {
  // Creates the analyzer singleton and starts its thread.
  std::function<void()> start_analyzer;
  // Asks the analyzer to shut down.
  std::function<void()> shutdown_analyzer;
  // Waits, without limit, for the analyzer thread to end.
  std::function<void()> join_analyzer;
  // Adds the analyzer's state and counters to a JSON object: "state" (not started, running,
  // stopping, stopped) and "counters" (records read, unparsed and dropped as outliers,
  // transactions processed, ignored and taken from the queue, queue depth, the file and offset
  // being read).
  std::function<void(nlohmann::json& out)> describe_analyzer;
  // Percentiles and apdex per application or transaction over a window, for /api/v1/latency;
  // none before the analyzer starts.
  fw::LatencyProvider describe_latency;
  // The analyzer's own /metrics families: the page requests per application and transaction
  // and the history writes; none before the analyzer starts.
  fw::MetricsProvider write_analyzer_metrics;
  // Creates a collector process monitor (not yet started).
  std::function<std::unique_ptr<CollectorMonitor>(const CollectorMonitorSpec&)>
      make_collector_monitor;
  // Sends an agent message by key with a severity and substitution arguments.
  std::function<void(const char* key, int severity, const std::vector<std::string>& args)>
      send_agent_message;
};

// The parts of the q7agent process: the analyzer singleton, ServiceMonitor and the agent
// messages. Also binds the tables to the analyzer's queries and pattern entry points.
AgentParts ProcessParts();

class Agent {
 public:
  explicit Agent(AgentParts parts);
  ~Agent();
  Agent(const Agent&) = delete;
  Agent& operator=(const Agent&) = delete;

  // The agent's life from the environment switches to the end of shutdown: the signal
  // manager, the message file name, prepare_startup, collector supervision, "RT_AGENT_STARTED",
  // the framework main loop, supervision stopped, prepare_shutdown. Returns the main loop's
  // result.
  int run(int argc, char** argv);

  // Registers with the framework, names the agent, reads the configuration and creates the
  // analyzer.
  void prepare_startup(int argc, char** argv);
  // Shuts the analyzer down and waits for its thread.
  void prepare_shutdown();

 private:
  void describeAgent(nlohmann::json& info) const;
  void describeHealth(nlohmann::json& health) const;
  // /metrics: the agent's health (intake, queue, collectors) and the analyzer's families.
  void writeMetrics(fw::PrometheusText& out) const;
  void setCollectorState(const char* state);

  const AgentParts parts_;
  mutable fw::Mutex mutex_;
  // What /healthz says of collector supervision.
  std::string collectorState_ GUARDED_BY(mutex_) = "not supervised";
  // The supervised processes, by the name /metrics gives them, while supervised.
  std::vector<std::pair<std::string, const CollectorMonitor*>> monitors_ GUARDED_BY(mutex_);
};

}  // namespace tama
