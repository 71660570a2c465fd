// A fleet: three agents on loopback, each fed different generated traffic whose page times and
// outcomes the test reads back, scraped every second by Debian's prometheus with the example
// rules. What PromQL says of the fleet must be what the three truths add up to.

#include <gtest/gtest.h>
#include <httplib.h>

#include <algorithm>
#include <cmath>
#include <csignal>
#include <ctime>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <regex>
#include <set>
#include <string>
#include <vector>

#include "tests/agent_process.h"
#include "tests/support/catch_all_pattern.h"
#include "tests/support/prometheus_server.h"
#include "tests/support/scratch_dir.h"
#include "tests/support/sm3_records.h"

namespace q7test {
namespace {

using namespace std::chrono_literals;

constexpr long kThresholdMs = 800;

// What the agents were fed, page by page.
struct Truth {
  std::map<std::string, double> outcomes;  // good, slow, failed
  std::vector<long> times;                 // every page's response time, ms
};

// One agent of the fleet in a home of its own, with a catch-all pattern at kThresholdMs.
class FleetAgent {
 public:
  FleetAgent() {
    const std::string data = home_.path() + "data";
    std::filesystem::create_directories(data);
    home_.writeFile("config/" + shortHostName() + "_q7.cfg",
                    "[AGENT]\nKQ7DPXLOGPATH=" + data + "\n");
    process_ = std::make_unique<AgentProcess>(
        std::vector<std::string>{},
        std::map<std::string, std::string>{{"Q7_HOME", home_.path()},
                                           {"Q7_HTTP_ADDRESS", "127.0.0.1:0"},
                                           {"Q7_TRACE", "*=ERROR"},
                                           {"DPX_NOSTART", ""},
                                           {"TZ", "UTC"}});
    waitFor(
        [&] {
          address_ = readFile(home_.path() + "logs/q7agent.addr");
          return !address_.empty() && address_.back() == '\n';
        },
        10s);
    if (!address_.empty()) {
      address_.pop_back();
    }
  }
  ~FleetAgent() {
    process_->signal(SIGTERM);
    process_->wait(5s);
  }

  const std::string& address() const { return address_; }

  bool registerPattern() {
    std::string token = readFile(home_.path() + "config/q7_api_token");
    token.erase(token.find_last_not_of(" \n") + 1);
    httplib::Client client("http://" + address_);
    const std::string body = CatchAllPatternBody(kThresholdMs, 0);
    const auto res = client.Put("/api/v1/situations/everything",
                                {{"Authorization", "Bearer " + token}}, body, "application/json");
    return res && (res->status == 200 || res->status == 201);
  }

  // Writes generated records to the agent's data directory and adds their pages to truth.
  long feed(int records, int seed, Truth* truth) {
    const std::string file = home_.path() + "data/feed.sm3";
    const std::string command = std::string(SM3GEN_PATH) + " --out " + file + " --records " +
                                std::to_string(records) + " --sites 4 --seed " +
                                std::to_string(seed) + " --rate 100000 --start " +
                                std::to_string(time(nullptr));
    EXPECT_EQ(0, system(command.c_str()));
    std::string error;
    long pages = 0;
    for (const Record& record : ReadRecords(file, &error)) {
      if (record.tag != "hpage") {
        continue;
      }
      ++pages;
      const long ms = record.number(kTotalMs);
      truth->times.push_back(ms);
      truth->outcomes[record.number(kStatus) >= 401 ? "failed"
                      : ms <= kThresholdMs          ? "good"
                                                    : "slow"] += 1;
    }
    EXPECT_EQ("", error);
    return pages;
  }

  std::string metrics() const {
    httplib::Client client("http://" + address_);
    const auto res = client.Get("/metrics");
    return res && res->status == 200 ? res->body : std::string();
  }

  // The sum of q7_requests_total in the agent's own /metrics.
  long requestsCounted() const {
    long sum = 0;
    std::istringstream lines(metrics());
    for (std::string line; std::getline(lines, line);) {
      if (line.rfind("q7_requests_total{", 0) == 0) {
        sum += std::stol(line.substr(line.rfind(' ') + 1));
      }
    }
    return sum;
  }

 private:
  TempHome home_;
  std::unique_ptr<AgentProcess> process_;
  std::string address_;
};

double ValueOf(const nlohmann::json& sample) {
  return std::stod(sample["value"][1].get<std::string>());
}

TEST(FleetE2ETest, PrometheusSeesTheFleetAsTheTruthsAddUp) {
  std::vector<std::unique_ptr<FleetAgent>> fleet;
  Truth truth;
  for (int i = 0; i < 3; ++i) {
    fleet.push_back(std::make_unique<FleetAgent>());
    ASSERT_FALSE(fleet.back()->address().empty()) << "agent " << i << " did not start";
    ASSERT_TRUE(fleet.back()->registerPattern());
  }
  std::vector<long> pages;
  for (int i = 0; i < 3; ++i) {
    pages.push_back(fleet[i]->feed(1500 + 700 * i, 31 + i, &truth));
  }
  for (int i = 0; i < 3; ++i) {
    ASSERT_TRUE(waitFor([&] { return fleet[i]->requestsCounted() == pages[i]; }, 30s))
        << "agent " << i << " counted " << fleet[i]->requestsCounted() << " of " << pages[i];
  }

  ScratchDir dir;
  PrometheusServer prometheus(dir.path());
  // The example rules, evaluated every second instead of every 30.
  std::string rules = readFile(std::string(Q7_SOURCE_DIR) + "/resources/prometheus/q7-rules.yml");
  rules = std::regex_replace(rules, std::regex("interval: 30s"), "interval: 1s");
  prometheus.writeFile("q7-rules.yml", rules);
  std::string targets;
  for (const auto& agent : fleet) {
    targets += "\"" + agent->address() + "\", ";
  }
  std::string error;
  ASSERT_TRUE(prometheus.Start(
      "global:\n  scrape_interval: 1s\n  evaluation_interval: 1s\nrule_files:\n  - q7-rules.yml\n"
      "scrape_configs:\n  - job_name: q7\n    static_configs:\n      - targets: [" +
          targets + "]\n",
      &error))
      << error;

  // Fleet totals by outcome.
  nlohmann::json byOutcome;
  const bool totals = waitFor(
      [&] {
        byOutcome = prometheus.query("sum by (outcome) (q7_requests_total)");
        std::map<std::string, double> seen;
        for (const auto& sample : byOutcome) {
          seen[sample["metric"].value("outcome", "")] = ValueOf(sample);
        }
        return prometheus.query("count(up == 1)").size() == 1 &&
               ValueOf(prometheus.query("count(up == 1)")[0]) == 3 && seen == truth.outcomes;
      },
      30s);
  EXPECT_TRUE(totals) << byOutcome.dump() << "\n"
                      << prometheus.targets().dump() << "\n"
                      << prometheus.log();

  // The fleet's p95 from the summed histograms lies in the bucket that holds the true p95.
  const nlohmann::json p95 =
      prometheus.query("histogram_quantile(0.95, sum by (le) (q7_response_time_seconds_bucket))");
  ASSERT_EQ(1u, p95.size()) << p95.dump();
  std::vector<long> times = truth.times;
  std::sort(times.begin(), times.end());
  // Prometheus's rank: the first bucket whose count reaches 0.95 of all.
  const auto rank = static_cast<size_t>(std::ceil(0.95 * static_cast<double>(times.size())));
  const double trueP95 = static_cast<double>(times[rank - 1]) / 1000.0;
  std::set<double> bounds;
  for (const auto& sample : prometheus.query("q7_response_time_seconds_bucket")) {
    const std::string le = sample["metric"].value("le", "");
    if (le != "+Inf") {
      bounds.insert(std::stod(le));
    }
  }
  const auto upper = bounds.lower_bound(trueP95);
  ASSERT_NE(upper, bounds.end());
  const double lower = upper == bounds.begin() ? 0 : *std::prev(upper);
  EXPECT_GE(ValueOf(p95[0]), lower) << "true p95 " << trueP95;
  EXPECT_LE(ValueOf(p95[0]), *upper) << "true p95 " << trueP95;
  EXPECT_TRUE(bounds.contains(kThresholdMs / 1000.0));
  EXPECT_TRUE(bounds.contains(4 * kThresholdMs / 1000.0));

  // The recording rules evaluate over the scraped series.
  for (const char* recorded :
       {"outcome:q7_requests:rate5m", "application_outcome:q7_requests:rate5m",
        "application:q7_apdex:ratio_rate5m", "application:q7_requests_failed:ratio_rate5m",
        "q7_response_time_seconds:p95_5m"}) {
    EXPECT_TRUE(waitFor([&] { return !prometheus.query(recorded).empty(); }, 15s)) << recorded;
  }
}

}  // namespace
}  // namespace q7test
