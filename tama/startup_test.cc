// Start-up and shutdown of the agent: naming, the message file name, the loader and command
// callbacks, and the Agent's ordering of collector supervision around the main loop.

#include "tama/startup.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/utsname.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "framework/agent_runtime.h"
#include "framework/tables.h"
#include "framework/trace_capture.h"
#include "tama/agent.h"
#include "tama/agent_globals.h"
#include "tama/signal_manager.h"
#include "tests/support/scratch_dir.h"

namespace {

void fakeNodeName(const std::string& name) {
  fw::SetUnameForTesting([name](struct utsname* u) {
    std::memset(u, 0, sizeof(*u));
    std::strncpy(u->nodename, name.c_str(), sizeof(u->nodename) - 1);
    return 0;
  });
}

class StartupTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fw::ResetRuntimeForTesting();
    home_ = scratch_.path() + "/";
    setenv("Q7_HOME", home_.c_str(), 1);
    setenv("Q7_HTTP_ADDRESS", "127.0.0.1:0", 1);
  }
  void TearDown() override {
    fw::ResetRuntimeForTesting();
    unsetenv("Q7_HOME");
    unsetenv("Q7_HTTP_ADDRESS");
    unsetenv("DPX_NOSTART");
  }
  q7test::ScratchDir scratch_;
  std::string home_;
};

// The agent name keeps 24 characters of the node name; the short name stops at the first dot.
TEST_F(StartupTest, AgentNamesFromNodeName) {
  fakeNodeName("abcdefghijklmnopqrstuvwxyz1234");
  tama::nameAgent();
  EXPECT_STREQ("abcdefghijklmnopqrstuvwx", kq1_agent_name);
  EXPECT_STREQ("abcdefghijklmnopqrstuvwx", kq1_short_agent_name);

  fakeNodeName("hostA.part2");
  tama::nameAgent();
  EXPECT_STREQ("hostA.part2", kq1_agent_name);
  EXPECT_STREQ("hostA", kq1_short_agent_name);
  EXPECT_EQ("hostA", fw::HostName());

  fw::SetUnameForTesting([](struct utsname*) { return -1; });
  tama::nameAgent();
  EXPECT_STREQ("$UNKNOWN$", kq1_agent_name);
}

TEST_F(StartupTest, MessageFileNameFromEnvironment) {
  fw::TraceCapture capture;
  unsetenv("KQ7_MSG_FILE_NAME");
  prepareMsgFileName();
  EXPECT_STREQ("./kq1msg.log", KQ1_MsgFileName);
  setenv("KQ7_MSG_FILE_NAME", "agent.msgs", 1);
  prepareMsgFileName();
  EXPECT_STREQ("./agent.msgs", KQ1_MsgFileName);
  EXPECT_TRUE(capture.contains("KQ1_MsgFileName<./agent.msgs>"));
  unsetenv("KQ7_MSG_FILE_NAME");
}

// The loader declares the five affinities in order and registers the tables in load order;
// every KQ7 command is acknowledged.
TEST_F(StartupTest, LoaderAndCommandCallback) {
  fw::ResetTablesForTesting();
  EXPECT_EQ(0, LoadAgents());
  const auto tables = fw::ListTables();
  ASSERT_EQ(23u, tables.size());
  EXPECT_EQ("Q7AGNTDTS", tables.front()->name);
  EXPECT_EQ("Q7SUBTXINS", tables.back()->name);
  fw::ResetTablesForTesting();
  const std::vector<std::string> expected{"AFF_FEAT_DM_PARITY", "AFF_FEAT_AGENT_MGMT",
                                          "AFF_FEAT_INTERNATIONALIZATION", "AFF_V1",
                                          "0000000000000000000100000000000000000000000"};
  EXPECT_EQ(expected, fw::Affinities());
  CtunaAutomationCapsule capsule{"KQ7 anything", false};
  EXPECT_EQ(1, HandleTakeAction(&capsule));
  EXPECT_TRUE(capsule.finished);
}

// Records what the collector monitors were asked to do, in order.
std::vector<std::string> g_events;

class FakeMonitor : public tama::CollectorMonitor {
 public:
  explicit FakeMonitor(std::string which) : which_(std::move(which)) {}
  int start() override {
    g_events.push_back("start " + which_);
    return 0;
  }
  int stop() override {
    g_events.push_back("stop " + which_);
    return 0;
  }
  long starts() const override { return 1; }

 private:
  std::string which_;
};

// An agent whose parts record what they are asked to do and whose start message ends the main
// loop at once.
tama::AgentParts FakeParts() {
  g_events.clear();
  tama::AgentParts parts;
  parts.make_collector_monitor = [](const tama::CollectorMonitorSpec& monitor) {
    const std::string which = monitor.start_argv.back();
    g_events.push_back("create " + which + " " +
                       std::filesystem::path(monitor.pid_file).filename().string());
    return std::unique_ptr<tama::CollectorMonitor>(new FakeMonitor(which));
  };
  parts.start_analyzer = [] { g_events.push_back("analyzer start"); };
  parts.shutdown_analyzer = [] { g_events.push_back("analyzer shutdown"); };
  parts.join_analyzer = [] { g_events.push_back("analyzer join"); };
  parts.describe_analyzer = [](nlohmann::json& out) { out["state"] = "running"; };
  parts.describe_latency = [](const fw::LatencyQuery&) { return std::vector<fw::LatencyRow>{}; };
  parts.write_analyzer_metrics = [](fw::PrometheusText&) {};
  parts.send_agent_message = [](const char* key, int severity, const std::vector<std::string>&) {
    g_events.push_back(std::string("message ") + key + " " + std::to_string(severity));
    fw::RequestShutdown(1);  // leave the main loop at once
  };
  return parts;
}

// The writer process is started before the capture process and stopped before it too; the
// analyzer shuts down after both.
TEST_F(StartupTest, CtMainOrdersSupervisionAroundMainLoop) {
  fakeNodeName("hostA.part2");
  unsetenv("DPX_NOSTART");
  char arg0[] = "q7agent";
  char* argv[] = {arg0, nullptr};
  tama::Agent agent(FakeParts());
  EXPECT_EQ(0, agent.run(1, argv));
  const std::vector<std::string> expected{"analyzer start",
                                          "create analyzer zolt414_hostA.part2.pid",
                                          "create collector zelt_hostA.part2.pid",
                                          "start analyzer",
                                          "start collector",
                                          "message RT_AGENT_STARTED 4",
                                          "stop analyzer",
                                          "stop collector",
                                          "analyzer shutdown",
                                          "analyzer join"};
  EXPECT_EQ(expected, g_events);
}

// DPX_NOSTART, even empty, means no monitor is created, started or stopped.
TEST_F(StartupTest, NoStartSuppressesSupervision) {
  setenv("DPX_NOSTART", "", 1);
  char arg0[] = "q7agent";
  char* argv[] = {arg0, nullptr};
  tama::Agent agent(FakeParts());
  EXPECT_EQ(0, agent.run(1, argv));
  const std::vector<std::string> expected{"analyzer start", "message RT_AGENT_STARTED 4",
                                          "analyzer shutdown", "analyzer join"};
  EXPECT_EQ(expected, g_events);
}

// SIGTERM reaches the manager thread, which asks the main loop to return and ends.
TEST_F(StartupTest, SignalManagerTurnsSigtermIntoShutdown) {
  fw::TraceCapture capture;
  SignalManager manager;
  // Aimed at this manager: an earlier agent run in the same process left its own one waiting.
  ASSERT_EQ(0, pthread_kill(manager.managerThreadForTesting(), SIGTERM));
  manager.joinManagerThreadForTesting();
  EXPECT_TRUE(fw::ShutdownRequested());
  EXPECT_TRUE(capture.contains("Stop signal received."));
  EXPECT_TRUE(capture.contains("Termination signal received.  Exiting."));
}

// Destroying the manager while it waits cancels and joins its thread.
TEST_F(StartupTest, SignalManagerDestructorCancelsWaitingThread) {
  fw::TraceCapture capture;
  {
    SignalManager manager;
    for (int i = 0; i < 500 && !capture.contains("Manager thread waiting for a signal."); ++i) {
      usleep(10000);
    }
  }
  EXPECT_TRUE(capture.contains("Shutdown commencing."));
  EXPECT_TRUE(capture.contains("Termination pending cancellation of manager thread."));
  EXPECT_TRUE(capture.contains("Manager thread terminated."));
  EXPECT_FALSE(fw::ShutdownRequested());
}

}  // namespace
