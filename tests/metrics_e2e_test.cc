// Percentiles, apdex and /metrics end to end: the real agent fed generated records whose
// response times the test reads back, so that every percentile the agent gives can be checked
// against the exact one, across a kill, an interval rollover and a clean restart.

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <ctime>
#include <map>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "tests/agent_fixture.h"
#include "tests/support/catch_all_pattern.h"
#include "tests/support/prometheus_server.h"
#include "tests/support/scratch_dir.h"
#include "tests/support/sm3_records.h"

namespace q7test {
namespace {

constexpr long kThresholdMs = 800;

class MetricsE2ETest : public AgentE2ETest {
 protected:
  void SetUp() override {
    data_ = home_.path() + "data";
    std::filesystem::create_directories(data_);
    // One-minute intervals, so that a rollover comes within the test.
    home_.writeFile("config/" + shortHostName() + "_q7.cfg",
                    "[AGENT]\nKQ7DPXLOGPATH=" + data_ + "\nKQ7OVERTIMEINTERVAL=1\n");
    extraEnv_["Q7_TRACE"] = "*=ERROR";
    registerPattern();
  }

  // A catch-all pattern keeping every name, with a threshold that splits the generated times.
  void registerPattern() {
    const std::string address = start();
    const std::string body = CatchAllPatternBody(kThresholdMs, 0);
    std::string reply;
    const int status = send(address, "PUT", "/api/v1/situations/everything", body, token(), &reply);
    ASSERT_TRUE(status == 200 || status == 201) << status << " " << reply;
    stopWith(SIGTERM);
  }

  // Appends records stamped from now to the data file, and adds their page times by
  // application to the truth.
  void feed(int records, int seed) {
    const std::string batch = home_.path() + "batch.sm3";
    const std::string command = std::string(SM3GEN_PATH) + " --out " + batch + " --records " +
                                std::to_string(records) + " --sites 3 --seed " +
                                std::to_string(seed) + " --rate 100000 --start " +
                                std::to_string(time(nullptr));
    ASSERT_EQ(0, system(command.c_str()));
    std::string error;
    for (const Record& record : ReadRecords(batch, &error)) {
      if (record.tag == "hpage") {
        const std::string& app = ApplicationOf(record);
        times_[app].push_back(record.number(kTotalMs));
        current_[app].push_back(record.number(kTotalMs));
      }
    }
    ASSERT_EQ("", error);
    std::ofstream(file(), std::ios::app) << readFile(batch);
  }
  std::string file() const { return data_ + "/feed.sm3"; }

  long pages(const std::map<std::string, std::vector<long>>& truth) const {
    long n = 0;
    for (const auto& [app, times] : truth) {
      n += static_cast<long>(times.size());
    }
    return n;
  }

  // The value at rank floor(q (n-1)) of the sorted times: the rank the agent's sketch answers.
  static double exact(std::vector<long> times, double q) {
    std::sort(times.begin(), times.end());
    return static_cast<double>(
        times[static_cast<size_t>(q * static_cast<double>(times.size() - 1))]);
  }

  // Every application's row of the latency API for window against the truth: the count, the
  // four percentiles within 1 %, the maximum and the apdex exact.
  void expectLatency(const std::string& address, const std::string& window,
                     const std::map<std::string, std::vector<long>>& truth) {
    int status = 0;
    const nlohmann::json body =
        get(address, "/api/v1/latency?by=application&window=" + window, &status);
    ASSERT_EQ(200, status) << body.dump();
    ASSERT_EQ(truth.size(), body["rows"].size()) << body.dump();
    for (const auto& row : body["rows"]) {
      const std::string app = row["application"];
      SCOPED_TRACE(window + " " + app);
      ASSERT_TRUE(truth.contains(app));
      const std::vector<long>& times = truth.at(app);
      EXPECT_EQ(times.size(), row["requests"].get<size_t>());
      for (const auto& [column, q] : std::map<std::string, double>{
               {"p50_ms", 0.5}, {"p90_ms", 0.9}, {"p95_ms", 0.95}, {"p99_ms", 0.99}}) {
        const double want = exact(times, q);
        EXPECT_NEAR(want, row[column].get<double>(), want * 0.01 + 0.001) << column;
      }
      EXPECT_EQ(static_cast<double>(*std::max_element(times.begin(), times.end())),
                row["max_ms"].get<double>());
      double satisfied = 0;
      double tolerating = 0;
      for (const long t : times) {
        satisfied += t <= kThresholdMs ? 1 : 0;
        tolerating += t > kThresholdMs && t <= 4 * kThresholdMs ? 1 : 0;
      }
      EXPECT_NEAR((satisfied + tolerating / 2) / static_cast<double>(times.size()),
                  row["apdex"].get<double>(), 0.0001);
      EXPECT_EQ(kThresholdMs, row["threshold_ms"].get<long>());
    }
  }

  std::string data_;
  std::map<std::string, std::vector<long>> times_;    // every page fed, by application
  std::map<std::string, std::vector<long>> current_;  // those of the current interval
};

TEST_F(MetricsE2ETest, PercentilesHoldAcrossAKillARolloverAndARestart) {
  // Room for the first batch and the kill before the minute ends.
  ASSERT_TRUE(waitFor([] { return time(nullptr) % 60 <= 40; }, 25s));
  const long interval = time(nullptr) / 60;
  std::string address = start();
  feed(3000, 11);
  ASSERT_TRUE(waitForIntakeIdle(address, file(), 20s));
  expectLatency(address, "summary", times_);
  expectLatency(address, "interval", current_);

  // Killed: the restart resumes from the checkpoint the clean stop would have written anyway.
  agent_->signal(SIGKILL);
  agent_->wait(5s);
  address = start();
  ASSERT_TRUE(waitForIntakeIdle(address, file(), 20s));
  expectLatency(address, "summary", times_);

  // The next interval, once the agent has rolled over to it: the first one's sketches are now
  // history.
  ASSERT_TRUE(waitFor(
      [&] {
        int status = 0;
        return time(nullptr) / 60 > interval &&
               get(address, "/api/v1/latency?window=interval", &status)["rows"].empty();
      },
      75s));
  current_.clear();
  feed(3000, 12);
  ASSERT_TRUE(waitForIntakeIdle(address, file(), 20s));
  ASSERT_TRUE(waitFor(
      [&] {
        int status = 0;
        const nlohmann::json body = get(address, "/api/v1/latency?window=interval", &status);
        long n = 0;
        for (const auto& row : body["rows"]) {
          n += row["requests"].get<long>();
        }
        return n == pages(current_);
      },
      10s));
  expectLatency(address, "summary", times_);
  expectLatency(address, "interval", current_);

  stopWith(SIGTERM);
  address = start();
  ASSERT_TRUE(waitForIntakeIdle(address, file(), 20s));
  expectLatency(address, "summary", times_);

  // By transaction: the same requests, split further.
  int status = 0;
  const nlohmann::json byTransaction =
      get(address, "/api/v1/latency?by=transaction&where=requests%20GE%201", &status);
  ASSERT_EQ(200, status);
  long n = 0;
  for (const auto& row : byTransaction["rows"]) {
    EXPECT_TRUE(row.contains("transaction"));
    n += row["requests"].get<long>();
  }
  EXPECT_EQ(pages(times_), n);
  // A filter on a column the answer lacks is refused.
  get(address, "/api/v1/latency?where=p42%20GT%201", &status);
  EXPECT_EQ(400, status);
  stopWith(SIGTERM);
}

// The live agent's /metrics passes promtool's lint, and its request counters add up to the pages
// fed, by outcome as the threshold splits them.
TEST_F(MetricsE2ETest, MetricsAreLintCleanAndCountEveryPage) {
  const std::string address = start();
  feed(2000, 21);
  ASSERT_TRUE(waitForIntakeIdle(address, file(), 20s));
  const std::string text = getText(address, "/metrics");
  ASSERT_FALSE(text.empty());
  const std::string path = home_.path() + "metrics.txt";
  std::ofstream(path) << text;
  std::string output;
  const int lint = runProgram("/bin/sh", {"-c", "promtool check metrics < " + path}, {}, &output);
  EXPECT_EQ(0, lint) << output;

  // Sum q7_requests_total and the histogram's counts from the text.
  double requests = 0;
  double counted = 0;
  std::istringstream lines(text);
  for (std::string line; std::getline(lines, line);) {
    const double value = std::strtod(line.substr(line.rfind(' ') + 1).c_str(), nullptr);
    if (line.rfind("q7_requests_total{", 0) == 0) {
      requests += value;
    } else if (line.rfind("q7_response_time_seconds_count{", 0) == 0) {
      counted += value;
    }
  }
  EXPECT_EQ(pages(times_), static_cast<long>(requests));
  EXPECT_EQ(pages(times_), static_cast<long>(counted));
  EXPECT_NE(std::string::npos, text.find("le=\"0.8\"")) << "the threshold is a bucket bound";
  EXPECT_NE(std::string::npos, text.find("le=\"3.2\"")) << "and so is four times it";
  EXPECT_NE(std::string::npos, text.find("q7_records_read_total "));
  stopWith(SIGTERM);
}

}  // namespace
}  // namespace q7test

namespace q7test {
namespace {

// Runs a shell command in dir; its exit code, with its output in *output.
int Shell(const std::string& dir, const std::string& command, std::string* output) {
  return runProgram("/bin/sh", {"-c", "cd " + dir + " && " + command}, {}, output);
}

// With a certificate and key the API speaks HTTPS only: q7ctl reads it given the CA (and not
// without), Prometheus scrapes it with tls_config, and plain HTTP gets no answer.
TEST_F(AgentE2ETest, ServesHttpsOnlyWithACertificate) {
  const std::string tls = home_.path() + "tls";
  std::filesystem::create_directories(tls);
  std::string output;
  // A throw-away CA, and the agent's certificate for 127.0.0.1 signed by it.
  ASSERT_EQ(0, Shell(tls,
                     "openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes "
                     "-keyout ca.key -out ca.pem -days 2 -subj /CN=q7-test-ca 2>&1 && "
                     "openssl req -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes "
                     "-keyout agent.key -out agent.csr -subj /CN=127.0.0.1 2>&1 && "
                     "printf 'subjectAltName=IP:127.0.0.1\\n' > san.ext && "
                     "openssl x509 -req -in agent.csr -CA ca.pem -CAkey ca.key -CAcreateserial "
                     "-out agent.pem -days 2 -extfile san.ext 2>&1",
                     &output))
      << output;
  extraEnv_["Q7_TLS_CERT"] = tls + "/agent.pem";
  extraEnv_["Q7_TLS_KEY"] = tls + "/agent.key";
  const std::string address = start();
  ASSERT_EQ(0u, address.rfind("https://127.0.0.1:", 0)) << address;
  const std::string hostPort = address.substr(std::string("https://").size());

  const std::map<std::string, std::string> ctlEnv = {{"Q7_HOME", home_.path()}};
  EXPECT_EQ(0, runProgram(Q7CTL_PATH, {"latency", "--cacert", tls + "/ca.pem"}, ctlEnv, &output))
      << output;
  EXPECT_EQ(0, runProgram(Q7CTL_PATH, {"tables", "--cacert", tls + "/ca.pem"}, ctlEnv, &output))
      << output;
  EXPECT_NE(std::string::npos, output.find("Q7APPSM")) << output;
  // Without the CA the agent's certificate is not trusted, and q7ctl says what to do.
  const int untrusted = runProgram(Q7CTL_PATH, {"tables"}, ctlEnv, &output);
  EXPECT_TRUE(WIFEXITED(untrusted) && WEXITSTATUS(untrusted) == 1) << untrusted;
  EXPECT_NE(std::string::npos, output.find("--cacert")) << output;

  // Plain HTTP to the HTTPS port gets no HTTP answer.
  httplib::Client plain("http://" + hostPort);
  plain.set_connection_timeout(2);
  plain.set_read_timeout(2);
  const auto res = plain.Get("/healthz");
  EXPECT_TRUE(!res || res->status != 200);

  ScratchDir dir;
  PrometheusServer prometheus(dir.path());
  std::string error;
  ASSERT_TRUE(
      prometheus.Start("global:\n  scrape_interval: 1s\nscrape_configs:\n"
                       "  - job_name: q7\n    scheme: https\n    tls_config:\n"
                       "      ca_file: " +
                           tls +
                           "/ca.pem\n"
                           "    static_configs:\n      - targets: [\"" +
                           hostPort + "\"]\n",
                       &error))
      << error;
  EXPECT_TRUE(waitFor([&] { return !prometheus.query("q7_records_read_total").empty(); }, 20s))
      << prometheus.targets().dump();
  stopWith(SIGTERM);
}

// Off loopback without TLS the agent serves but warns; a certificate without its key starts no
// API at all rather than a plain one.
TEST_F(AgentE2ETest, WarnsOfPlainHttpOffLoopbackAndNeverFallsBackToIt) {
  extraEnv_["Q7_HTTP_ADDRESS"] = "0.0.0.0:0";
  start();
  EXPECT_TRUE(waitFor(
      [&] {
        return trace().find("reachable from other hosts over plain HTTP") != std::string::npos;
      },
      5s))
      << trace();
  stopWith(SIGTERM);

  extraEnv_["Q7_HTTP_ADDRESS"] = "127.0.0.1:0";
  extraEnv_["Q7_TLS_CERT"] = home_.path() + "agent.pem";
  agent_ = std::make_unique<AgentProcess>(std::vector<std::string>{}, env());
  EXPECT_TRUE(waitFor(
      [&] {
        return trace().find(
                   "HTTP API not started: Q7_TLS_CERT and Q7_TLS_KEY must be set "
                   "together") != std::string::npos;
      },
      10s))
      << trace();
  EXPECT_EQ("", readFile(home_.path() + "logs/q7agent.addr"));
  stopWith(SIGTERM);
}

}  // namespace
}  // namespace q7test
