// The real q7agent binary: command line, start-up in a fresh home, the HTTP API, and orderly
// shutdown on SIGTERM and SIGINT.

#include <gtest/gtest.h>
#include <httplib.h>
#include <signal.h>
#include <sys/wait.h>

#include <chrono>
#include <filesystem>
#include <future>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>
#include <vector>

#include "core/analyzer/situation_controller.h"
#include "tests/agent_fixture.h"
#include "tests/agent_process.h"

namespace q7test {
namespace {

using namespace std::chrono_literals;

// --help and --version print, exit 0 and create nothing in the home.
TEST_F(AgentE2ETest, HelpAndVersionStartNothing) {
  std::string out;
  int status = runToCompletion({"--help"}, env(), &out);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(0, WEXITSTATUS(status));
  EXPECT_NE(std::string::npos, out.find("Q7_HTTP_ADDRESS"));
  out.clear();
  status = runToCompletion({"--version"}, env(), &out);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(0, WEXITSTATUS(status));
  EXPECT_EQ("q7agent 01.00.00\n", out);
  EXPECT_TRUE(std::filesystem::is_empty(home_.path()));
  out.clear();
  status = runToCompletion({"--no-such-option"}, env(), &out);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_NE(0, WEXITSTATUS(status));
}

// A first start lays out the base directory tree, serves the API, and SIGTERM ends the agent
// in the documented order with exit status 0.
TEST_F(AgentE2ETest, StartsServesAndStopsOnSigterm) {
  home_.writeFile("config/q7details.properties", "Colour=red\nShape=round\n");
  home_.writeFile("config/" + shortHostName() + "_q7.cfg", "[AGENT]\nColour=blue\n");
  const std::string address = start();

  for (const char* dir :
       {"logs", "odi/dpx", "odi/lyn", "odi/arm", "arm/log/lyn/delete", "lyn/Mgmt/Log"}) {
    EXPECT_TRUE(isDirectory(base() + dir)) << dir;
  }

  int status = 0;
  nlohmann::json health;
  // "starting" until the analyzer has restored what it saved; here that is at once.
  EXPECT_TRUE(waitFor(
      [&] {
        health = get(address, "/healthz", &status);
        return health.value("analyzer", "") == "running";
      },
      10s))
      << health.dump();
  EXPECT_EQ(200, status);
  EXPECT_EQ("ok", health.value("status", ""));
  EXPECT_EQ("not supervised (DPX_NOSTART)", health.value("collector", ""));

  nlohmann::json agent = get(address, "/api/v1/agent", &status);
  EXPECT_EQ(200, status);
  EXPECT_EQ("01.00.00", agent.value("version", ""));
  EXPECT_EQ(shortHostName(), agent.value("short_agent_name", ""));
  EXPECT_FALSE(agent.value("system_name", "").empty());
  EXPECT_EQ("blue", agent["properties"].value("Colour", ""));  // the cfg file wins
  EXPECT_EQ("round", agent["properties"].value("Shape", ""));
  EXPECT_EQ(base().substr(0, base().size() - 1), agent["properties"].value("AgentBaseDir", ""));
  EXPECT_EQ(5u, agent["affinities"].size());

  get(address, "/no/such/path", &status);
  EXPECT_EQ(404, status);

  stopWith(SIGTERM);
  const std::string t = trace();
  for (const char* text : {"KQ1_MsgFileName<./kq1msg.log>", "kq1_agent_name<",
                           "KQ1_BaseDir = ", "KQ1_ConfigPath = ", "Got config value Colour = blue",
                           "Base dir=", "LYN data dir=[", "Overtime Interval set to 5",
                           "Summary Interval set to 24"}) {
    EXPECT_NE(std::string::npos, t.find(text)) << text;
  }
  // Shutdown in order: signal, main loop returns, analyzer shut down.
  const auto received = t.find("Termination signal received.  Exiting.");
  const auto waiting = t.find("Waiting for Analyzer to shutdown.");
  const auto completed = t.find("Analyzer Completed Shutdown.");
  ASSERT_NE(std::string::npos, received);
  ASSERT_NE(std::string::npos, waiting);
  ASSERT_NE(std::string::npos, completed);
  EXPECT_LT(received, waiting);
  EXPECT_LT(waiting, completed);
  EXPECT_FALSE(std::filesystem::exists(home_.path() + "logs/q7agent.addr"));
}

// The loader registers the 23 exported tables in load order; the API lists them with their
// columns.
TEST_F(AgentE2ETest, ListsTheTablesInLoadOrder) {
  const std::string address = start();
  int status = 0;
  const nlohmann::json body = get(address, "/api/v1/tables", &status);
  EXPECT_EQ(200, status);
  const std::vector<std::string> expected{
      "Q7AGNTDTS",  "Q7AGNTMSGS", "Q7APPOT",   "Q7APPSM",    "Q7CLNTAPP", "Q7CLNTOT",
      "Q7CLNTPTNS", "Q7CLNTSM",   "Q7CLNTSRV", "Q7SRVAPPSM", "Q7SRVOT",   "Q7SRVSM",
      "Q7TXINS",    "Q7TXOT",     "Q7TXPTNS",  "Q7TXSM",     "Q7TXCS",    "Q7APPCS",
      "Q7CLNTCS",   "Q7SRVCS",    "Q7SUBTXSM", "Q7SUBTXOT",  "Q7SUBTXINS"};
  std::vector<std::string> names;
  for (const auto& table : body["tables"]) {
    names.push_back(table.value("name", ""));
    EXPECT_FALSE(table["columns"].empty()) << names.back();
  }
  EXPECT_EQ(expected, names);
  ASSERT_EQ(expected.size(), body["tables"].size());

  const nlohmann::json& agntdts = body["tables"][0]["columns"];
  EXPECT_EQ(nlohmann::json::parse(R"({"name": "originnode", "type": 9, "width": 32, "offset": 0})"),
            agntdts[0]);
  EXPECT_EQ(5u, agntdts.size());
  const nlohmann::json& appot = body["tables"][2]["columns"];
  EXPECT_EQ(
      nlohmann::json::parse(R"({"name": "importance", "type": 5, "width": 2, "offset": 128})"),
      appot[1]);
  EXPECT_EQ(nlohmann::json::parse(R"({"name": "dintval", "type": 3, "width": 4, "offset": 180})"),
            appot[4]);
  const nlohmann::json& agntmsgs = body["tables"][1]["columns"];
  EXPECT_EQ(
      nlohmann::json::parse(R"({"name": "msgtext", "type": 12, "width": 1024, "offset": 132})"),
      agntmsgs[6]);
  stopWith(SIGTERM);
  EXPECT_EQ(std::string::npos, trace().find("refused")) << trace();
}

// A table sample over HTTP: empty while nothing feeds the tables, filters accepted, unknown
// tables refused.
TEST_F(AgentE2ETest, SamplesATable) {
  const std::string address = start();
  int status = 0;
  const nlohmann::json body = get(address, "/api/v1/tables/Q7TXSM", &status);
  EXPECT_EQ(200, status);
  EXPECT_EQ(nlohmann::json::parse(R"({"table": "Q7TXSM", "rows": []})"), body);
  const nlohmann::json missing = get(address, "/api/v1/tables/NOPE", &status);
  EXPECT_EQ(404, status);
  EXPECT_EQ("no table named NOPE", missing.value("error", ""));
  get(address, "/api/v1/tables/Q7TXSM?where=TOTREQ%20GT%205", &status);
  EXPECT_EQ(200, status);
  stopWith(SIGTERM);
}

// Start-up announces itself as an agent message: it shows among the events and in samples of
// the agent-messages table. An open event stream does not hold up a SIGTERM.
TEST_F(AgentE2ETest, StartMessageIsAnEventAndStreamsEndOnSigterm) {
  const std::string address = start();
  const auto isStartMessage = [](const nlohmann::json& row) {
    return row.value("msgid", "") == "KQ7RT0001I" && row.value("severity", 0) == 4 &&
           row.value("component", "") == "WebAgent" &&
           row.value("msgtext", "") == "The Response Time agent has started.";
  };
  int status = 0;
  const nlohmann::json events = get(address, "/api/v1/events", &status);
  EXPECT_EQ(200, status);
  ASSERT_EQ(1u, events["events"].size()) << events.dump();
  EXPECT_TRUE(isStartMessage(events["events"][0])) << events.dump();
  const nlohmann::json sample = get(address, "/api/v1/tables/Q7AGNTMSGS", &status);
  EXPECT_EQ(200, status);
  ASSERT_EQ(1u, sample["rows"].size()) << sample.dump();
  EXPECT_TRUE(isStartMessage(sample["rows"][0])) << sample.dump();

  std::promise<int> opened;
  auto stream = std::async(std::launch::async, [&] {
    httplib::Client client("http://" + address);
    client.set_read_timeout(10, 0);
    bool answered = false;
    client.Get(
        "/api/v1/events/stream",
        [&](const httplib::Response& res) {
          answered = true;
          opened.set_value(res.status);
          return true;
        },
        [](const char*, std::size_t) { return true; });
    if (!answered) {
      opened.set_value(-1);
    }
  });
  ASSERT_EQ(200, opened.get_future().get());
  stopWith(SIGTERM);
  EXPECT_EQ(std::future_status::ready, stream.wait_for(2s));
}

// SIGINT stops the agent just as SIGTERM does.
TEST_F(AgentE2ETest, StopsOnSigint) {
  start();
  stopWith(SIGINT);
  EXPECT_NE(std::string::npos, trace().find("Stop signal received."));
}

// Only SIGINT and SIGTERM are taken over: SIGUSR1 keeps its default action.
TEST_F(AgentE2ETest, OtherSignalsKeepTheirDefaultAction) {
  start();
  agent_->signal(SIGUSR1);
  const auto status = agent_->wait(5s);
  ASSERT_TRUE(status.has_value());
  ASSERT_TRUE(WIFSIGNALED(*status));
  EXPECT_EQ(SIGUSR1, WTERMSIG(*status));
}

// A malformed configuration file and a junk properties file leave clear traces and defaults;
// the agent still runs and stops cleanly.
TEST_F(AgentE2ETest, BadConfigurationIsTracedNotFatal) {
  home_.writeFile("config/q7details.properties",
                  std::string("Good=yes\n\x01\x02\x00\xff junk\n", 18) + std::string(10000, 'x') +
                      "\nKQ7OVERTIMEINTERVAL=abc\n");
  home_.writeFile("config/" + shortHostName() + "_q7.cfg", "[AGENT\nbroken line\n");
  const std::string address = start();
  int status = 0;
  nlohmann::json agent = get(address, "/api/v1/agent", &status);
  EXPECT_EQ(200, status);
  EXPECT_EQ("yes", agent["properties"].value("Good", ""));
  stopWith(SIGTERM);
  const std::string t = trace();
  EXPECT_NE(std::string::npos, t.find("Error: unable to parse config file"));
  EXPECT_NE(std::string::npos, t.find("Invalid Overtime Interval 0"));
}

// Transactions read from the collector's data directory reach the summary, current-status and
// instance tables with the counts of sm3gen's truth; a filter and CSV work on them.
TEST_F(AgentE2ETest, FedTransactionsReachTheTables) {
  const std::string data = useDataDirectory() + "/feed.sm3";
  registerCatchAllPattern();
  // Keep the whole test inside one 5-minute interval, so current-status rows hold everything.
  while (time(nullptr) % 300 > 280) {
    std::this_thread::sleep_for(1s);
  }
  const std::string truthPath = home_.path() + "truth.json";
  const std::string command = std::string(SM3GEN_PATH) + " --out " + data + " --truth " +
                              truthPath + " --records 400 --sites 2 --seed 3 --rate 1000 --start " +
                              std::to_string(time(nullptr) - 1);
  ASSERT_EQ(0, system(command.c_str()));
  const nlohmann::json truth = nlohmann::json::parse(readFile(truthPath));
  long pages = 0;
  for (const auto& [app, figures] : truth["applications"].items()) {
    pages += figures["pages"]["count"].get<long>();
  }
  ASSERT_GT(pages, 10);
  const std::string address = start();

  const auto total = &AgentE2ETest::totalRequests;
  int status = 0;
  nlohmann::json summary;
  EXPECT_TRUE(waitFor(
      [&] {
        summary = get(address, "/api/v1/tables/Q7TXSM", &status);
        return status == 200 && total(summary) == pages;
      },
      15s))
      << "counted " << total(summary) << " of " << pages;

  const nlohmann::json current = get(address, "/api/v1/tables/Q7APPCS", &status);
  ASSERT_EQ(200, status);
  for (const auto& row : current["rows"]) {
    const std::string app = row["applicatin"];
    EXPECT_EQ(truth["applications"][app]["pages"]["count"].get<long>(), row["totreq"].get<long>())
        << app;
    EXPECT_FALSE(row.contains("aggby"));
  }
  EXPECT_EQ(pages, total(current));

  const nlohmann::json instances = get(address, "/api/v1/tables/Q7TXINS", &status);
  EXPECT_EQ(pages, static_cast<long>(instances["rows"].size()));

  const nlohmann::json busy = get(address, "/api/v1/tables/Q7TXSM?where=TOTREQ%20GT%205", &status);
  long expected = 0;
  for (const auto& row : summary["rows"]) {
    expected += row["totreq"].get<long>() > 5 ? 1 : 0;
  }
  EXPECT_EQ(expected, static_cast<long>(busy["rows"].size()));
  for (const auto& row : busy["rows"]) {
    EXPECT_GT(row["totreq"].get<long>(), 5);
  }

  const std::string csv = getText(address, "/api/v1/tables/Q7TXSM?format=csv&limit=1");
  EXPECT_EQ(0u, csv.find("applicatin,transactn,client,server,rootuuid,importance,originnode,"))
      << csv.substr(0, 200);

  // The agent's own account: every record read, from the feed to its end, none waiting.
  nlohmann::json agent;
  EXPECT_TRUE(waitFor(
      [&] {
        agent = get(address, "/api/v1/agent", &status);
        return agent["counters"].value("records_read", -1) == 400 &&
               agent["counters"].value("queue_depth", -1) == 0;
      },
      10s))
      << agent.dump();
  const nlohmann::json& counters = agent["counters"];
  EXPECT_EQ("running", agent.value("analyzer", ""));
  EXPECT_EQ(0, counters.value("records_unparsed", -1));
  EXPECT_EQ(0, counters.value("outliers_dropped", -1));
  EXPECT_EQ(0, counters.value("queue_depth", -1));
  EXPECT_EQ(data, counters.value("file", ""));
  EXPECT_EQ(static_cast<long>(std::filesystem::file_size(data)), counters.value("offset", -1L));
  stopWith(SIGTERM);
}

}  // namespace
}  // namespace q7test
