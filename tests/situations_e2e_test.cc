// Pattern situations through q7ctl and the HTTP API with the real q7agent: starting, the
// defaults, the overlap warning, surviving a restart, stopping; refused requests that change
// nothing and leave ingestion alone.

#include <gtest/gtest.h>
#include <httplib.h>
#include <signal.h>
#include <sys/wait.h>

#include <chrono>
#include <filesystem>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "tests/agent_fixture.h"
#include "tests/agent_process.h"

namespace q7test {
namespace {

using namespace std::chrono_literals;

class SituationsE2ETest : public AgentE2ETest {
 protected:
  // Runs q7ctl against the agent of this home; its exit status, output in *out.
  int ctl(const std::vector<std::string>& args, std::string* out) {
    out->clear();
    const int status = runProgram(Q7CTL_PATH, args, env(), out);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  nlohmann::json ctlJson(const std::vector<std::string>& args) {
    std::string out;
    std::vector<std::string> all = args;
    all.insert(all.end(), {"-o", "json"});
    EXPECT_EQ(0, ctl(all, &out)) << out;
    return nlohmann::json::parse(out, nullptr, false);
  }
  std::string patternFile() const { return readFile(base() + "odi/dpx/tpatterns.dat"); }
};

TEST_F(SituationsE2ETest, PatternSituationsThroughQ7ctl) {
  start();
  std::string out;
  EXPECT_EQ(0, ctl({"events", "-o", "json"}, &out));
  EXPECT_NE(std::string::npos, out.find("KQ7RT0001I")) << out;

  // Four texts only: the defaults fill the rest.
  ASSERT_EQ(0, ctl({"situation", "start", "Shop", "--table", "Q7TXPTNS", "APPLICATIN=Shop",
                    "APPPATTERN=*", "TRANSACTN=Checkout", "TRANSPATTN=*/checkout*"},
                   &out))
      << out;
  nlohmann::json rows = ctlJson({"sample", "Q7TXPTNS"});
  ASSERT_EQ(1u, rows.size()) << rows;
  EXPECT_EQ("Shop", rows[0]["applicatin"]);
  EXPECT_EQ("*/checkout*", rows[0]["transpattn"]);
  EXPECT_EQ(0, rows[0]["aggapsuniq"]);
  EXPECT_EQ(1, rows[0]["aggtxsuniq"]);
  EXPECT_EQ(0, rows[0]["collinstcs"]);
  EXPECT_EQ(100, rows[0]["sampercent"]);
  EXPECT_EQ(10000000, rows[0]["mrtthres"]);
  EXPECT_EQ(99, rows[0]["importance"]);

  // An overlapping pattern is reported; the longer one keeps what both match.
  ASSERT_EQ(0, ctl({"situation", "start", "Site", "--table", "Q7TXPTNS", "APPLICATIN=Site",
                    "APPPATTERN=*", "TRANSACTN=All", "TRANSPATTN=*"},
                   &out));
  EXPECT_EQ(0, ctl({"events", "-o", "json"}, &out));
  EXPECT_NE(std::string::npos,
            out.find("situation[Site] overlaps with situation[Shop] and transactions that match "
                     "both will goto situation[Shop]"))
      << out;

  // A restart keeps both, in matching order.
  stopWith(SIGTERM);
  start();
  rows = ctlJson({"sample", "Q7TXPTNS"});
  ASSERT_EQ(2u, rows.size()) << rows;
  EXPECT_EQ("*/checkout*", rows[0]["transpattn"]);
  EXPECT_EQ("*", rows[1]["transpattn"]);
  EXPECT_EQ(2u, ctlJson({"situation", "list"}).size());

  // Stopping removes the pattern from the table and from the pattern file.
  EXPECT_NE(std::string::npos, patternFile().find("*/checkout*"));
  ASSERT_EQ(0, ctl({"situation", "stop", "Shop"}, &out)) << out;
  rows = ctlJson({"sample", "Q7TXPTNS"});
  ASSERT_EQ(1u, rows.size());
  EXPECT_EQ("Site", rows[0]["applicatin"]);
  EXPECT_EQ(std::string::npos, patternFile().find("*/checkout*"));
  EXPECT_EQ(1, ctl({"situation", "stop", "Shop"}, &out));
  EXPECT_NE(std::string::npos, out.find("HTTP 404")) << out;
  stopWith(SIGTERM);
}

TEST_F(SituationsE2ETest, RefusedRequestsChangeNothingAndDisturbNoIngestion) {
  const std::string data = useDataDirectory();
  registerCatchAllPattern();
  const std::string address = start();
  const std::string good = R"({"table": "Q7TXPTNS", "conditions": [
      {"column": "APPLICATIN", "value": "Shop"}, {"column": "APPPATTERN", "value": "*"},
      {"column": "TRANSACTN", "value": "Checkout"}, {"column": "TRANSPATTN", "value": "*/c*"}]})";
  const std::string path = "/api/v1/situations/Shop";
  EXPECT_EQ(401, send(address, "PUT", path, good, ""));
  EXPECT_EQ(401, send(address, "PUT", path, good, token() + "x"));
  EXPECT_EQ(401, send(address, "DELETE", "/api/v1/situations/everything", "", ""));
  std::string reply;
  EXPECT_EQ(413, send(address, "PUT", path, std::string(1 << 20, ' '), token(), &reply));
  EXPECT_NE(std::string::npos, reply.find("\"error\"")) << reply;
  EXPECT_EQ(400, send(address, "PUT", path, "{\"table\": ", token(), &reply));
  EXPECT_NE(std::string::npos, reply.find("not valid JSON")) << reply;
  EXPECT_EQ(400, send(address, "PUT", path,
                      R"({"table": "Q7TXPTNS", "conditions": [{"column": "NOPE", "value": "x"}]})",
                      token(), &reply));
  EXPECT_NE(std::string::npos, reply.find("has no column")) << reply;
  EXPECT_EQ(400, send(address, "PUT", path,
                      R"({"table": "Q7TXPTNS", "conditions": [{"column": "MRTTHRES",
                          "value": "fast"}]})",
                      token(), &reply));
  EXPECT_NE(std::string::npos, reply.find("not a whole number")) << reply;
  EXPECT_EQ(400, send(address, "PUT", path,
                      R"({"table": "Q7TXPTNS", "conditions": [{"column": "APPLICATIN",
                          "value": ")" +
                          std::string(200, 'a') + R"("}]})",
                      token(), &reply));
  EXPECT_NE(std::string::npos, reply.find("the column holds 128")) << reply;
  EXPECT_EQ(400, send(address, "PUT", path, R"({"table": "Q7NOPE"})", token(), &reply));

  int status = 0;
  // Only the fixture's catch-all situation is started.
  const nlohmann::json started = get(address, "/api/v1/situations", &status)["situations"];
  ASSERT_EQ(1u, started.size()) << started.dump();
  EXPECT_EQ("everything", started[0]["name"]);
  EXPECT_EQ(1u, get(address, "/api/v1/tables/Q7TXPTNS", &status)["rows"].size());

  // Records written now still reach the tables.
  const std::string truthPath = home_.path() + "truth.json";
  const std::string command = std::string(SM3GEN_PATH) + " --out " + data + "/day1.sm3" +
                              " --truth " + truthPath + " --records 300 --sites 2 --seed 9" +
                              " --rate 1000 --start " + std::to_string(time(nullptr));
  ASSERT_EQ(0, system(command.c_str()));
  long pages = 0;
  for (const auto& [app, figures] :
       nlohmann::json::parse(readFile(truthPath))["applications"].items()) {
    pages += figures["pages"]["count"].get<long>();
  }
  nlohmann::json summary;
  EXPECT_TRUE(waitFor(
      [&] {
        summary = get(address, "/api/v1/tables/Q7TXSM", &status);
        return totalRequests(summary) == pages;
      },
      15s))
      << totalRequests(summary) << " of " << pages;

  // With the token the same request works.
  EXPECT_EQ(201, send(address, "PUT", path, good, token()));
  EXPECT_EQ(2u, get(address, "/api/v1/tables/Q7TXPTNS", &status)["rows"].size());
  stopWith(SIGTERM);
}

// Listening beyond loopback, reading needs the token too; q7ctl sends it from the home.
TEST_F(SituationsE2ETest, EveryRequestNeedsTheTokenOffLoopback) {
  extraEnv_["Q7_HTTP_ADDRESS"] = "0.0.0.0:0";
  std::string address = start();
  address.replace(0, address.find(':'), "127.0.0.1");
  int status = 0;
  get(address, "/api/v1/tables", &status);
  EXPECT_EQ(401, status);
  httplib::Client client("http://" + address);
  const auto res = client.Get("/api/v1/tables", {{"Authorization", "Bearer " + token()}});
  ASSERT_TRUE(res);
  EXPECT_EQ(200, res->status);
  std::string out;
  EXPECT_EQ(0, ctl({"tables"}, &out)) << out;
  EXPECT_NE(std::string::npos, out.find("Q7TXPTNS"));
  stopWith(SIGTERM);
}

}  // namespace
}  // namespace q7test
