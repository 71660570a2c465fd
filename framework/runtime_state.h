#pragma once

// Process-wide state of the framework runtime, shared by agent_runtime.cc and main_loop.cc.
// Internal to framework/.

#include <sys/utsname.h>

#include <condition_variable>
#include <functional>
#include <mutex>
#include <nlohmann/json.hpp>
#include <string>
#include <utility>
#include <vector>

#include "framework/agent_runtime.h"

namespace fw {

struct RuntimeState {
  // mutex guards the registrations and identity below.
  std::mutex mutex;
  AgentLoader loader = nullptr;
  std::vector<std::pair<std::string, CommandCallback>> commands;
  std::string node_type;
  std::string host_name;
  std::vector<std::string> affinities;
  std::function<int(struct utsname*)> uname;
  std::function<void(nlohmann::json&)> health_provider;
  std::function<void(nlohmann::json&)> info_provider;

  // shutdown_mutex guards shutdown_requested; shutdown_cv wakes the main loop.
  std::mutex shutdown_mutex;
  std::condition_variable shutdown_cv;
  bool shutdown_requested = false;
};

RuntimeState& State();

}  // namespace fw
