#include "framework/agent_runtime.h"

#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <utility>

#include "framework/environment.h"
#include "framework/mutex.h"
#include "framework/runtime_state.h"
#include "framework/status.h"
#include "framework/trace.h"

namespace fw {
namespace {

constexpr char kUnit[] = "framework";
constexpr std::size_t kMaxOriginNode = 32;

}  // namespace

RuntimeState& State() {
  // Never destroyed: threads that outlive main (the signal thread) may still request shutdown.
  static auto* state = new RuntimeState;
  return *state;
}

void RegisterAgentLoader(AgentLoader loader) {
  MutexLock lock(State().mutex);
  State().loader = loader;
}

void RegisterCommandCallback(const char* prefix, CommandCallback callback) {
  if (prefix == nullptr || callback == nullptr) {
    return;
  }
  MutexLock lock(State().mutex);
  State().commands.emplace_back(prefix, callback);
}

int DispatchCommand(CtunaAutomationCapsule* capsule) {
  if (capsule == nullptr) {
    return kInvalidArgument;
  }
  CommandCallback callback = nullptr;
  {
    MutexLock lock(State().mutex);
    for (const auto& [prefix, cb] : State().commands) {
      if (capsule->command.compare(0, prefix.size(), prefix) == 0) {
        callback = cb;
        break;
      }
    }
  }
  if (callback == nullptr) {
    Q7_TRACE(kUnit, kTraceError, "no agent handles the command \"%s\"", capsule->command.c_str());
    return kNotFound;
  }
  return callback(capsule);
}

int SetVersionFromProductCode(const char* product_code, char* buf, std::size_t len) {
  if (product_code == nullptr || buf == nullptr || len == 0 ||
      std::strcmp(product_code, "Q7") != 0) {
    return kInvalidArgument;
  }
  const std::size_t n = std::min(len - 1, std::strlen(Q7_VERSION_TEXT));
  std::memcpy(buf, Q7_VERSION_TEXT, n);
  buf[n] = '\0';
  return kOk;
}

int SetNodeTypeFromProductCode(const char* product_code) {
  if (product_code == nullptr || std::strcmp(product_code, "Q7") != 0) {
    return kInvalidArgument;
  }
  MutexLock lock(State().mutex);
  State().node_type = product_code;
  return kOk;
}

std::string NodeType() {
  MutexLock lock(State().mutex);
  return State().node_type;
}

const char* ProductVersion() {
  return Q7_VERSION_TEXT;
}

int SetHostName(const char* name) {
  if (name == nullptr) {
    return kInvalidArgument;
  }
  MutexLock lock(State().mutex);
  State().host_name = name;
  return kOk;
}

std::string HostName() {
  MutexLock lock(State().mutex);
  return State().host_name;
}

int DeclareAffinity(const char* affinity) {
  if (affinity == nullptr || *affinity == '\0') {
    return kInvalidArgument;
  }
  MutexLock lock(State().mutex);
  State().affinities.emplace_back(affinity);
  return kOk;
}

std::vector<std::string> Affinities() {
  MutexLock lock(State().mutex);
  return State().affinities;
}

std::string OriginNodeName() {
  std::string name;
  if (!GetEnv("Q7_NODE_NAME", &name) || name.empty()) {
    std::string host = HostName();
    if (host.empty()) {
      struct utsname u {};
      host = Uname(&u) == 0 ? u.nodename : "localhost";
      host = host.substr(0, host.find('.'));
    }
    name = host + ":Q7";
  }
  if (name.size() > kMaxOriginNode) {
    name.resize(kMaxOriginNode);
  }
  return name;
}

int Uname(struct utsname* out) {
  std::function<int(struct utsname*)> fn;
  {
    MutexLock lock(State().mutex);
    fn = State().uname;
  }
  return fn ? fn(out) : ::uname(out);
}

void SetUnameForTesting(std::function<int(struct utsname*)> fn) {
  MutexLock lock(State().mutex);
  State().uname = std::move(fn);
}

void RequestShutdown(int reason) {
  Q7_TRACE(kUnit, kTraceSummary, "shutdown requested (reason %d)", reason);
  {
    MutexLock lock(State().shutdown_mutex);
    State().shutdown_requested = true;
  }
  State().shutdown_cv.NotifyAll();
}

bool ShutdownRequested() {
  MutexLock lock(State().shutdown_mutex);
  return State().shutdown_requested;
}

void SetHealthProvider(std::function<void(nlohmann::json&)> provider) {
  MutexLock lock(State().mutex);
  State().health_provider = std::move(provider);
}

void SetAgentInfoProvider(std::function<void(nlohmann::json&)> provider) {
  MutexLock lock(State().mutex);
  State().info_provider = std::move(provider);
}

void ResetRuntimeForTesting() {
  {
    MutexLock lock(State().mutex);
    State().loader = nullptr;
    State().commands.clear();
    State().node_type.clear();
    State().host_name.clear();
    State().affinities.clear();
    State().uname = nullptr;
    State().health_provider = nullptr;
    State().info_provider = nullptr;
    State().latency_provider = nullptr;
    State().metrics_provider = nullptr;
  }
  MutexLock lock(State().shutdown_mutex);
  State().shutdown_requested = false;
}

}  // namespace fw

namespace ctuna {

int FinishedAutomationCommand(CtunaAutomationCapsule* capsule) {
  if (capsule == nullptr) {
    return fw::kInvalidArgument;
  }
  capsule->finished = true;
  return fw::kOk;
}

}  // namespace ctuna

int DetermineLocalHost(char* buf, int len) {
  if (buf == nullptr || len <= 0) {
    return fw::kInvalidArgument;
  }
  struct utsname u {};
  if (fw::Uname(&u) != 0) {
    return fw::kNotFound;
  }
  const std::size_t n =
      std::min<std::size_t>(static_cast<std::size_t>(len) - 1, std::strlen(u.nodename));
  std::memcpy(buf, u.nodename, n);
  buf[n] = '\0';
  return fw::kOk;
}
