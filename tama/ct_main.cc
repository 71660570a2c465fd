#include "tama/ct_main.h"

#include <cstdlib>
#include <memory>
#include <string>

#include "core/config/cconfig.h"
#include "framework/agent_runtime.h"
#include "framework/trace.h"
#include "tama/agent_globals.h"
#include "tama/agent_hooks.h"
#include "tama/signal_manager.h"
#include "tama/startup.h"

namespace {

constexpr char kUnit[] = "tama";

// Deliberately never destroyed: by the time the process ends its thread has finished.
SignalManager* g_signalManager = nullptr;

// Stops one collector monitor: waits for its thread, which stops the process when alive.
void stopMonitor(std::unique_ptr<tama::CollectorMonitor>& monitor, const char* done) {
  if (monitor) {
    monitor->stop();
    Q7_TRACE(kUnit, fw::kTraceDetail, "%s", done);
    monitor.reset();
  }
}

}  // namespace

int CtMain(int argc, char** argv) {
  Q7_FLOW(kUnit);
  const bool noStart = std::getenv("DPX_NOSTART") != nullptr;
  if (noStart) {
    Q7_TRACE(kUnit, fw::kTraceError,
             "DPX_NOSTART environment variable found. Will not start DPX processes.");
  }
  if (std::getenv("DPX_ZERORECORDS") != nullptr) {
    CConfig::setReportZeroRecords(true);
    Q7_TRACE(kUnit, fw::kTraceError,
             "DPX_ZERORECORDS environment variable found. Will report 0 records for some tables.");
  }

  // Before any other thread, so that all of them inherit the blocked SIGINT and SIGTERM. One
  // per process: only tests run CtMain twice.
  if (g_signalManager == nullptr) {
    g_signalManager = new SignalManager();
  }

  prepareMsgFileName();
  prepare_startup(argc, argv);

  const std::string collectorDir = std::string(KQ1_BaseDir) + "/" + "dpx" + "/";
  const std::string script = collectorDir + "sm3ctl";
  const std::string platformDir = collectorDir + "linux" + "/";
  tama::CollectorMonitorSpec analyzerSpec;
  analyzerSpec.pid_file = platformDir + "zolt414_" + kq1_agent_name + ".pid";
  analyzerSpec.start_argv = {"/bin/sh", script, "start", "analyzer"};
  analyzerSpec.stop_argv = {"/bin/sh", script, "stop", "analyzer"};
  analyzerSpec.env = {"PATH=/bin:/sbin:/usr/bin:/usr/sbin"};
  analyzerSpec.poll_seconds = 60;
  tama::CollectorMonitorSpec collectorSpec = analyzerSpec;
  collectorSpec.pid_file = platformDir + "zelt_" + kq1_agent_name + ".pid";
  collectorSpec.start_argv = {"/bin/sh", script, "start", "collector"};
  collectorSpec.stop_argv = {"/bin/sh", script, "stop", "collector"};

  const tama::AgentHooks& hooks = tama::agentHooks();
  std::unique_ptr<tama::CollectorMonitor> analyzerMonitor;
  std::unique_ptr<tama::CollectorMonitor> collectorMonitor;
  if (noStart) {
    tama::setCollectorState("not supervised (DPX_NOSTART)");
  } else if (!hooks.make_collector_monitor) {
    Q7_TRACE(kUnit, fw::kTraceSummary, "collector supervision is not part of this build");
    tama::setCollectorState("not supervised (not part of this build)");
  } else {
    // The writer ("analyzer") process must run before the capture ("collector") process.
    analyzerMonitor = hooks.make_collector_monitor(analyzerSpec);
    collectorMonitor = hooks.make_collector_monitor(collectorSpec);
    analyzerMonitor->start();
    Q7_TRACE(kUnit, fw::kTraceDetail, "Started unix DPX Analyzer monitor");
    collectorMonitor->start();
    Q7_TRACE(kUnit, fw::kTraceDetail, "Started unix DPX Collector monitor");
    tama::setCollectorState("supervised");
  }

  if (hooks.send_agent_message) {
    hooks.send_agent_message("RT_AGENT_STARTED", 4, {});
  }

  const int result = kunmain(argc, argv);

  stopMonitor(analyzerMonitor, "Stopped DPX Analyzer monitor");
  stopMonitor(collectorMonitor, "Stopped DPX Collector monitor");

  prepare_shutdown();
  return result;
}
