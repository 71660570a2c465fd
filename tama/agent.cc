#include "tama/agent.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstdlib>
#include <nlohmann/json.hpp>
#include <string>
#include <utility>

#include "core/config/cconfig.h"
#include "framework/agent_runtime.h"
#include "framework/trace.h"
#include "tama/agent_config.h"
#include "tama/agent_globals.h"
#include "tama/agent_properties.h"
#include "tama/signal_manager.h"
#include "tama/startup.h"

namespace tama {

namespace {

constexpr char kUnit[] = "tama";

// Deliberately never destroyed: by the time the process ends its thread has finished. One per
// process: only tests run an agent twice.
SignalManager* g_signalManager = nullptr;

// Stops one collector monitor: waits for its thread, which stops the process when alive.
void stopMonitor(std::unique_ptr<CollectorMonitor>& monitor, const char* done) {
  if (monitor) {
    monitor->stop();
    Q7_TRACE(kUnit, fw::kTraceDetail, "%s", done);
    monitor.reset();
  }
}

}  // namespace

Agent::Agent(AgentParts parts) : parts_(std::move(parts)) {}

Agent::~Agent() {
  // The providers capture this agent; none may outlive it.
  fw::SetAgentInfoProvider({});
  fw::SetHealthProvider({});
  fw::SetLatencyProvider({});
  fw::SetMetricsProvider({});
}

int Agent::run(int argc, char** argv) {
  Q7_FLOW(kUnit);
  const bool noStart = std::getenv("DPX_NOSTART") != nullptr;
  if (noStart) {
    Q7_TRACE(kUnit, fw::kTraceInfo,
             "DPX_NOSTART environment variable found. Will not start DPX processes.");
  }
  if (std::getenv("DPX_ZERORECORDS") != nullptr) {
    CConfig::setReportZeroRecords(true);
    Q7_TRACE(kUnit, fw::kTraceWarning,
             "DPX_ZERORECORDS environment variable found. Will report 0 records for some tables.");
  }

  // Before any other thread, so that all of them inherit the blocked SIGINT and SIGTERM.
  if (g_signalManager == nullptr) {
    g_signalManager = new SignalManager();
  }

  prepareMsgFileName();
  prepare_startup(argc, argv);

  const std::string collectorDir = std::string(KQ1_BaseDir) + "/" + "dpx" + "/";
  const std::string script = collectorDir + "sm3ctl";
  const std::string platformDir = collectorDir + "linux" + "/";
  CollectorMonitorSpec analyzerSpec;
  analyzerSpec.pid_file = platformDir + "zolt414_" + kq1_agent_name + ".pid";
  analyzerSpec.start_argv = {"/bin/sh", script, "start", "analyzer"};
  analyzerSpec.stop_argv = {"/bin/sh", script, "stop", "analyzer"};
  analyzerSpec.env = {"PATH=/bin:/sbin:/usr/bin:/usr/sbin"};
  analyzerSpec.poll_seconds = 60;
  CollectorMonitorSpec collectorSpec = analyzerSpec;
  collectorSpec.pid_file = platformDir + "zelt_" + kq1_agent_name + ".pid";
  collectorSpec.start_argv = {"/bin/sh", script, "start", "collector"};
  collectorSpec.stop_argv = {"/bin/sh", script, "stop", "collector"};

  std::unique_ptr<CollectorMonitor> analyzerMonitor;
  std::unique_ptr<CollectorMonitor> collectorMonitor;
  if (noStart) {
    setCollectorState("not supervised (DPX_NOSTART)");
  } else {
    // The writer ("analyzer") process must run before the capture ("collector") process.
    analyzerMonitor = parts_.make_collector_monitor(analyzerSpec);
    collectorMonitor = parts_.make_collector_monitor(collectorSpec);
    analyzerMonitor->start();
    Q7_TRACE(kUnit, fw::kTraceDetail, "Started unix DPX Analyzer monitor");
    collectorMonitor->start();
    Q7_TRACE(kUnit, fw::kTraceDetail, "Started unix DPX Collector monitor");
    setCollectorState("supervised");
    fw::MutexLock lock(mutex_);
    monitors_ = {{"writer", analyzerMonitor.get()}, {"capture", collectorMonitor.get()}};
  }

  parts_.send_agent_message("RT_AGENT_STARTED", 4, {});

  const int result = kunmain(argc, argv);

  {
    fw::MutexLock lock(mutex_);
    monitors_.clear();
  }
  stopMonitor(analyzerMonitor, "Stopped DPX Analyzer monitor");
  stopMonitor(collectorMonitor, "Stopped DPX Collector monitor");

  prepare_shutdown();
  return result;
}

void Agent::prepare_startup(int /*argc*/, char** /*argv*/) {
  Q7_FLOW(kUnit);
  std::memcpy(kq1_product_code, "Q7", 3);

  fw::RegisterAgentLoader(LoadAgents);
  fw::RegisterCommandCallback("KQ7", HandleTakeAction);

  std::memset(kq1_product_ver, 0, sizeof(kq1_product_ver));
  fw::SetVersionFromProductCode(kq1_product_code, kq1_product_ver, sizeof(kq1_product_ver));
  fw::SetNodeTypeFromProductCode(kq1_product_code);

  nameAgent();
  std::memset(kq1_system_name, ' ', sizeof(kq1_system_name));
  DetermineLocalHost(kq1_system_name, sizeof(kq1_system_name));
  Q7_TRACE(kUnit, fw::kTraceDetail, "kq1_agent_name<%s> kq1_system_name<%s> justhostname<%s> ",
           kq1_agent_name, kq1_system_name, kq1_short_agent_name);

  readAgentConfig();
  applyAgentProperties();
  doExcludeOutliers();

  fw::SetAgentInfoProvider([this](nlohmann::json& info) { describeAgent(info); });
  fw::SetHealthProvider([this](nlohmann::json& health) { describeHealth(health); });
  fw::SetLatencyProvider(parts_.describe_latency);
  fw::SetMetricsProvider([this](fw::PrometheusText& out) { writeMetrics(out); });

  parts_.start_analyzer();
}

void Agent::prepare_shutdown() {
  Q7_FLOW(kUnit);
  parts_.shutdown_analyzer();
  Q7_TRACE(kUnit, fw::kTraceDetail, "Waiting for Analyzer to shutdown.");
  parts_.join_analyzer();
  Q7_TRACE(kUnit, fw::kTraceDetail, "Analyzer Completed Shutdown.");
}

// Publishes identity, merged properties and the analyzer's counters on /api/v1/agent. The
// globals and properties it reads are read-only once start-up is over.
void Agent::describeAgent(nlohmann::json& info) const {
  info["agent_name"] = kq1_agent_name;
  info["short_agent_name"] = kq1_short_agent_name;
  info["system_name"] = kq1_system_name;
  info["product_version"] = kq1_product_ver;
  nlohmann::json properties = nlohmann::json::object();
  for (const std::string& name : AgentProperties::getPropertyNames()) {
    properties[name] = AgentProperties::getAgentProperty(name);
  }
  info["properties"] = std::move(properties);
  nlohmann::json analyzer;
  parts_.describe_analyzer(analyzer);
  info["analyzer"] = analyzer["state"];
  info["counters"] = analyzer["counters"];
}

void Agent::describeHealth(nlohmann::json& health) const {
  nlohmann::json analyzer;
  parts_.describe_analyzer(analyzer);
  health["analyzer"] = analyzer["state"];
  fw::MutexLock lock(mutex_);
  health["collector"] = collectorState_;
}

void Agent::writeMetrics(fw::PrometheusText& out) const {
  nlohmann::json analyzer;
  parts_.describe_analyzer(analyzer);
  const nlohmann::json& counters = analyzer["counters"];
  const auto number = [&counters](const char* name) {
    const auto found = counters.find(name);
    return found != counters.end() && found->is_number() ? found->get<double>() : 0.0;
  };
  struct Family {
    const char* name;
    const char* type;
    const char* help;
    const char* counter;
  };
  for (const Family& f : {
           Family{"q7_records_read_total", "counter", "Records read from the collector's files.",
                  "records_read"},
           Family{"q7_records_unparsed_total", "counter",
                  "Records read that are not a transaction.", "records_unparsed"},
           Family{"q7_outliers_dropped_total", "counter",
                  "Transactions dropped as over the outlier limit.", "outliers_dropped"},
           Family{"q7_transactions_processed_total", "counter",
                  "Transactions counted into the tables.", "transactions_processed"},
           Family{"q7_transactions_ignored_total", "counter",
                  "Transactions no pattern matched, or the collector did not sample.",
                  "transactions_ignored"},
           Family{"q7_queue_depth", "gauge", "Transactions waiting for the analyzer.",
                  "queue_depth"},
           Family{"q7_checkpoints_written_total", "counter", "Checkpoints written.",
                  "checkpoints_written"},
       }) {
    out.family(f.name, f.type, f.help);
    out.sample(f.name, {}, number(f.counter));
  }
  // How far reading trails the end of the file being read.
  double behind = 0;
  if (const auto file = counters.find("file"); file != counters.end() && file->is_string()) {
    struct stat st {};
    if (!file->get<std::string>().empty() && ::stat(file->get<std::string>().c_str(), &st) == 0) {
      behind = std::max(0.0, static_cast<double>(st.st_size) - number("offset"));
    }
  }
  out.family("q7_intake_lag_bytes", "gauge",
             "Bytes of the collector's file being read that are not read yet.");
  out.sample("q7_intake_lag_bytes", {}, behind);
  out.family("q7_collector_restarts_total", "counter",
             "Times a supervised collector process was started again after its first start.");
  {
    fw::MutexLock lock(mutex_);
    for (const auto& [process, monitor] : monitors_) {
      out.sample("q7_collector_restarts_total", {{"process", process}},
                 static_cast<double>(std::max(0L, monitor->starts() - 1)));
    }
  }
  out.family("q7_agent_info", "gauge", "The agent's identity; always 1.");
  out.sample("q7_agent_info", {{"agent", kq1_agent_name}, {"version", kq1_product_ver}}, 1);
  if (parts_.write_analyzer_metrics) {
    parts_.write_analyzer_metrics(out);
  }
}

void Agent::setCollectorState(const char* state) {
  fw::MutexLock lock(mutex_);
  collectorState_ = state;
}

}  // namespace tama
