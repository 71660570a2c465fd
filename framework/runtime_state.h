#pragma once

// Process-wide state of the framework runtime, shared by agent_runtime.cc and main_loop.cc.
// Internal to framework/.

#include <sys/utsname.h>

#include <functional>
#include <nlohmann/json.hpp>
#include <string>
#include <utility>
#include <vector>

#include "framework/agent_runtime.h"
#include "framework/metrics_api.h"
#include "framework/mutex.h"

namespace fw {

struct RuntimeState {
  // The registrations and identity.
  Mutex mutex;
  AgentLoader loader GUARDED_BY(mutex) = nullptr;
  std::vector<std::pair<std::string, CommandCallback>> commands GUARDED_BY(mutex);
  std::string node_type GUARDED_BY(mutex);
  std::string host_name GUARDED_BY(mutex);
  std::vector<std::string> affinities GUARDED_BY(mutex);
  std::function<int(struct utsname*)> uname GUARDED_BY(mutex);
  std::function<void(nlohmann::json&)> health_provider GUARDED_BY(mutex);
  std::function<void(nlohmann::json&)> info_provider GUARDED_BY(mutex);
  LatencyProvider latency_provider GUARDED_BY(mutex);
  MetricsProvider metrics_provider GUARDED_BY(mutex);
  MetricsProvider framework_metrics GUARDED_BY(mutex);  // the framework's own, after the agent's

  // The shutdown request; shutdown_cv wakes the main loop.
  Mutex shutdown_mutex;
  CondVar shutdown_cv;
  bool shutdown_requested GUARDED_BY(shutdown_mutex) = false;
};

RuntimeState& State();

}  // namespace fw
