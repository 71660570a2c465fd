#include "tama/startup.h"

#include <sys/utsname.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "core/config/cconfig.h"
#include "framework/agent_runtime.h"
#include "framework/environment.h"
#include "framework/trace.h"
#include "q7tema/table_registry.h"
#include "tama/agent_config.h"
#include "tama/agent_globals.h"
#include "tama/agent_properties.h"

namespace {

constexpr char kUnit[] = "tama";
constexpr std::size_t kAgentNameChars = 24;

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

void applyAgentProperties() {
  CConfig::setBaseDirectory(AgentProperties::getAgentProperty("AgentBaseDir").c_str());
  const std::string dpx_path = AgentProperties::getAgentProperty("KQ7DPXLOGPATH");
  CConfig::setDpxDataDirectory(dpx_path.c_str());
  if (dpx_path.find_first_of(".-") != std::string::npos) {
    // File order and renamed-file lookup cut names at the first '.' of the whole path and take
    // any '-' in it for the mark of a renamed file.
    Q7_TRACE(kUnit, fw::kTraceWarning,
             "Warning: KQ7DPXLOGPATH \"%s\" contains a '.' or '-'; collector files in it will be "
             "ordered wrongly and renamed files missed. Move the data directory to a path "
             "without them.",
             dpx_path.c_str());
  }
  CConfig::setOverTimeInterval(static_cast<int>(
      std::strtol(AgentProperties::getAgentProperty("KQ7OVERTIMEINTERVAL").c_str(), nullptr, 10)));
  CConfig::setSummaryInterval(static_cast<int>(
      std::strtol(AgentProperties::getAgentProperty("KQ7SUMMARYINTERVAL").c_str(), nullptr, 10)));
  // Unset keeps the default; set, it must be a number of seconds (0 turns checkpoints off).
  if (const std::string checkpoint = AgentProperties::getAgentProperty("KQ7CHECKPOINTSECONDS");
      !checkpoint.empty()) {
    char* end = nullptr;
    const long seconds = std::strtol(checkpoint.c_str(), &end, 10);
    CConfig::setCheckpointSeconds(*end == '\0' && seconds <= 86400 ? static_cast<int>(seconds)
                                                                   : -1);
  }
  if (const std::string series = AgentProperties::getAgentProperty("KQ7METRICSMAXSERIES");
      !series.empty()) {
    char* end = nullptr;
    const long n = std::strtol(series.c_str(), &end, 10);
    CConfig::setMetricsMaxSeries(*end == '\0' && n <= 1000000 ? static_cast<int>(n) : -1);
  }
}

int LoadAgents() {
  Q7_FLOW(kUnit);
  fw::DeclareAffinity("AFF_FEAT_DM_PARITY");
  fw::DeclareAffinity("AFF_FEAT_AGENT_MGMT");
  fw::DeclareAffinity("AFF_FEAT_INTERNATIONALIZATION");
  fw::DeclareAffinity("AFF_V1");
  fw::DeclareAffinity("0000000000000000000100000000000000000000000");
  const int tables = q7tema::InitAllTables();
  Q7_TRACE(kUnit, fw::kTraceDetail, "%d of %zu tables initialised", tables,
           q7tema::kTableLoadOrder.size());
  return 0;
}

int HandleTakeAction(CtunaAutomationCapsule* capsule) {
  ctuna::FinishedAutomationCommand(capsule);
  return 1;
}
