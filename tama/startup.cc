#include "tama/startup.h"

#include <sys/utsname.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <nlohmann/json.hpp>
#include <string>

#include "framework/agent_runtime.h"
#include "framework/environment.h"
#include "framework/mutex.h"
#include "framework/trace.h"
#include "q7tema/exported_tables.h"
#include "q7tema/table_registry.h"
#include "tama/agent_config.h"
#include "tama/agent_globals.h"
#include "tama/agent_hooks.h"
#include "tama/agent_properties.h"
#include "core/config/cconfig.h"

namespace {

constexpr char kUnit[] = "tama";
constexpr std::size_t kAgentNameChars = 24;

constinit fw::Mutex g_collector_state_mutex;
std::string g_collector_state GUARDED_BY(g_collector_state_mutex) = "not supervised";

// Publishes identity and merged properties on /api/v1/agent. Runs on HTTP threads; the
// globals and properties it reads are read-only once start-up is over.
void describeAgent(nlohmann::json& info) {
  info["agent_name"] = kq1_agent_name;
  info["short_agent_name"] = kq1_short_agent_name;
  info["system_name"] = kq1_system_name;
  info["product_version"] = kq1_product_ver;
  nlohmann::json properties = nlohmann::json::object();
  for (const std::string& name : AgentProperties::getPropertyNames()) {
    properties[name] = AgentProperties::getAgentProperty(name);
  }
  info["properties"] = std::move(properties);
  if (tama::agentHooks().describe_analyzer) {
    nlohmann::json analyzer;
    tama::agentHooks().describe_analyzer(analyzer);
    info["analyzer"] = analyzer["state"];
    info["counters"] = analyzer["counters"];
  }
}

void describeHealth(nlohmann::json& health) {
  if (tama::agentHooks().describe_analyzer) {
    nlohmann::json analyzer;
    tama::agentHooks().describe_analyzer(analyzer);
    health["analyzer"] = analyzer["state"];
  } else {
    health["analyzer"] = "not built";
  }
  fw::MutexLock lock(g_collector_state_mutex);
  health["collector"] = g_collector_state;
}

}  // namespace

namespace tama {

void nameAgent() {
  std::memset(kq1_agent_name, 0, sizeof(kq1_agent_name));
  std::strcpy(kq1_agent_name, "$UNKNOWN$");
  struct utsname u {};
  if (fw::Uname(&u) == 0) {
    // The buffer is zero-filled, so a 24-character copy stays terminated.
    std::memset(kq1_agent_name, 0, sizeof(kq1_agent_name));
    std::memcpy(kq1_agent_name, u.nodename, strnlen(u.nodename, kAgentNameChars));
  }
  std::memset(kq1_short_agent_name, 0, sizeof(kq1_short_agent_name));
  const std::size_t short_len = std::strcspn(kq1_agent_name, ".");
  std::memcpy(kq1_short_agent_name, kq1_agent_name, short_len);
  fw::SetHostName(kq1_short_agent_name);
}

void setCollectorState(const char* state) {
  fw::MutexLock lock(g_collector_state_mutex);
  g_collector_state = state;
}

}  // namespace tama

void prepareMsgFileName() {
  Q7_FLOW(kUnit);
  std::string name;
  if (!fw::GetEnv("KQ7_MSG_FILE_NAME", &name)) {
    name = "kq1msg.log";
  }
  std::memset(KQ1_MsgFileName, 0, sizeof(KQ1_MsgFileName));
  std::snprintf(KQ1_MsgFileName, sizeof(KQ1_MsgFileName), ".%c%s", '/', name.c_str());
  Q7_TRACE(kUnit, fw::kTraceDetail, "KQ1_MsgFileName<%s>", KQ1_MsgFileName);
}

void prepare_startup(int /*argc*/, char** /*argv*/) {
  Q7_FLOW(kUnit);
  std::memcpy(kq1_product_code, "Q7", 3);

  fw::RegisterAgentLoader(LoadAgents);
  fw::RegisterCommandCallback("KQ7", HandleTakeAction);

  std::memset(kq1_product_ver, 0, sizeof(kq1_product_ver));
  fw::SetVersionFromProductCode(kq1_product_code, kq1_product_ver, sizeof(kq1_product_ver));
  fw::SetNodeTypeFromProductCode(kq1_product_code);

  tama::nameAgent();
  std::memset(kq1_system_name, ' ', sizeof(kq1_system_name));
  DetermineLocalHost(kq1_system_name, sizeof(kq1_system_name));
  Q7_TRACE(kUnit, fw::kTraceDetail, "kq1_agent_name<%s> kq1_system_name<%s> justhostname<%s> ",
           kq1_agent_name, kq1_system_name, kq1_short_agent_name);

  readAgentConfig();

  CConfig::setBaseDirectory(AgentProperties::getAgentProperty("AgentBaseDir").c_str());
  const std::string dpx_path = AgentProperties::getAgentProperty("KQ7DPXLOGPATH");
  CConfig::setDpxDataDirectory(dpx_path.c_str());
  if (dpx_path.find_first_of(".-") != std::string::npos) {
    // File order and renamed-file lookup cut names at the first '.' of the whole path and take
    // any '-' in it for the mark of a renamed file.
    Q7_TRACE(kUnit, fw::kTraceError,
             "Warning: KQ7DPXLOGPATH \"%s\" contains a '.' or '-'; collector files in it will be "
             "ordered wrongly and renamed files missed. Move the data directory to a path "
             "without them.",
             dpx_path.c_str());
  }
  CConfig::setOverTimeInterval(static_cast<int>(
      std::strtol(AgentProperties::getAgentProperty("KQ7OVERTIMEINTERVAL").c_str(), nullptr, 10)));
  CConfig::setSummaryInterval(static_cast<int>(
      std::strtol(AgentProperties::getAgentProperty("KQ7SUMMARYINTERVAL").c_str(), nullptr, 10)));

  doExcludeOutliers();

  fw::SetAgentInfoProvider(describeAgent);
  fw::SetHealthProvider(describeHealth);

  if (tama::agentHooks().start_analyzer) {
    tama::agentHooks().start_analyzer();
  } else {
    Q7_TRACE(kUnit, fw::kTraceSummary, "the analyzer is not part of this build");
  }
}

void prepare_shutdown() {
  Q7_FLOW(kUnit);
  const tama::AgentHooks& hooks = tama::agentHooks();
  if (hooks.shutdown_analyzer) {
    hooks.shutdown_analyzer();
  }
  Q7_TRACE(kUnit, fw::kTraceDetail, "Waiting for Analyzer to shutdown.");
  if (hooks.join_analyzer) {
    hooks.join_analyzer();
  }
  Q7_TRACE(kUnit, fw::kTraceDetail, "Analyzer Completed Shutdown.");
}

int LoadAgents() {
  Q7_FLOW(kUnit);
  fw::DeclareAffinity("AFF_FEAT_DM_PARITY");
  fw::DeclareAffinity("AFF_FEAT_AGENT_MGMT");
  fw::DeclareAffinity("AFF_FEAT_INTERNATIONALIZATION");
  fw::DeclareAffinity("AFF_V1");
  fw::DeclareAffinity("0000000000000000000100000000000000000000000");
  q7tema::RegisterExportedTableInits();
  const int tables = q7tema::InitAllTables();
  Q7_TRACE(kUnit, fw::kTraceDetail, "%d of %zu tables initialised", tables,
           q7tema::kTableLoadOrder.size());
  return 0;
}

int HandleTakeAction(CtunaAutomationCapsule* capsule) {
  ctuna::FinishedAutomationCommand(capsule);
  return 1;
}
