// Alerts end to end: the real agent fed pages whose statuses say which applications fail, an
// alerting situation on Q7APPSM, and a webhook receiver started by the test.

#include <httplib.h>

#include <cstdio>
#include <ctime>
#include <fstream>
#include <set>
#include <string>
#include <thread>

#include "framework/mutex.h"
#include "tests/agent_fixture.h"
#include "tests/support/sm3_lines.h"

namespace q7test {
namespace {

// Receives the webhook's POSTs; answers 204, or 500, or hangs, as the test says.
class Receiver {
 public:
  enum class Mode { kOk, kFail, kHang };

  Receiver() {
    server_.new_task_queue = [] { return new httplib::ThreadPool(4); };
    server_.Post("/hook", [this](const httplib::Request& req, httplib::Response& res) {
      Mode mode;
      {
        fw::MutexLock lock(mutex_);
        ++attempts_;
        mode = mode_;
        if (mode == Mode::kOk) {
          bodies_.push_back(nlohmann::json::parse(req.body, nullptr, false));
        }
      }
      if (mode == Mode::kHang) {
        // Longer than the agent's 5 s timeout; the test's end releases it.
        fw::MutexLock lock(mutex_);
        released_cv_.WaitFor(mutex_, 8s, [this]() REQUIRES(mutex_) { return released_; });
      }
      res.status = mode == Mode::kOk ? 204 : 500;
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    waitFor([this] { return server_.is_running(); }, 5s);
  }
  ~Receiver() {
    {
      fw::MutexLock lock(mutex_);
      released_ = true;
    }
    released_cv_.NotifyAll();
    server_.stop();
    thread_.join();
  }
  std::string url() const { return "http://127.0.0.1:" + std::to_string(port_) + "/hook"; }
  void set(Mode mode) {
    fw::MutexLock lock(mutex_);
    mode_ = mode;
  }
  std::vector<nlohmann::json> bodies() {
    fw::MutexLock lock(mutex_);
    return bodies_;
  }
  int attempts() {
    fw::MutexLock lock(mutex_);
    return attempts_;
  }

 private:
  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  fw::Mutex mutex_;
  fw::CondVar released_cv_;  // signalled when the test ends and hanging POSTs may answer
  bool released_ GUARDED_BY(mutex_) = false;
  Mode mode_ GUARDED_BY(mutex_) = Mode::kOk;
  std::vector<nlohmann::json> bodies_ GUARDED_BY(mutex_);
  int attempts_ GUARDED_BY(mutex_) = 0;
};

class AlertsE2ETest : public AgentE2ETest {
 protected:
  // count pages of host with this status, stamped now, appended to the live file.
  void pages(const std::string& host, int count, int status) {
    std::ofstream out(data_ + "/day.sm3", std::ios::app);
    const std::time_t now = std::time(nullptr);
    std::tm utc{};
    gmtime_r(&now, &utc);
    char date[16], clock[16], uuid[40];
    std::strftime(date, sizeof(date), "%Y-%m-%d", &utc);
    std::strftime(clock, sizeof(clock), "%H:%M:%S", &utc);
    for (int i = 0; i < count; ++i) {
      std::snprintf(uuid, sizeof(uuid), "%032X", ++pages_);
      out << Record(1, PageLine({{5, uuid},
                                 {6, std::to_string(now)},
                                 {7, date},
                                 {8, clock},
                                 {28, std::to_string(status)},
                                 {40, host}}));
    }
    written_ += count;
  }

  // The keys (applications) of the open alerts.
  std::set<std::string> openKeys(const std::string& address) {
    int status = 0;
    const nlohmann::json alerts = get(address, "/api/v1/alerts", &status);
    std::set<std::string> keys;
    for (const auto& alert : alerts.value("open", nlohmann::json::array())) {
      keys.insert(alert["key"]["applicatin"].get<std::string>());
    }
    return keys;
  }

  long metric(const std::string& address, const std::string& name) {
    const std::string text = getText(address, "/metrics");
    const auto at = text.find("\n" + name + " ");
    return at == std::string::npos ? -1 : std::stol(text.substr(at + name.size() + 2));
  }

  std::string situation(const std::string& webhook) const {
    // More than 20 % of an application's pages failed, in two samples a second apart.
    return R"({"table": "Q7APPSM", "conditions": [{"column": "pcfail", "op": "GT",
        "value": "20000"}], "every": 1, "for": 2, "severity": "critical", "webhook": ")" +
           webhook + R"("})";
  }

  std::string data_;
  unsigned pages_ = 0;
  long written_ = 0;
};

TEST_F(AlertsE2ETest, RaisesExactlyTheFailingApplicationsOnceClearsThemAndSurvivesARestart) {
  data_ = useDataDirectory();
  registerCatchAllPattern();
  Receiver receiver;
  std::string address = start();
  std::string reply;
  ASSERT_EQ(201, send(address, "PUT", "/api/v1/situations/Failing", situation(receiver.url()),
                      token(), &reply))
      << reply;

  // The truth: bad fails half its pages, worse all; good none.
  pages("good.example", 30, 200);
  pages("bad.example", 5, 500);
  pages("bad.example", 5, 200);
  pages("worse.example", 4, 503);
  ASSERT_TRUE(waitFor(
      [&] {
        return openKeys(address) == std::set<std::string>{"bad.example", "worse.example"};
      },
      20s))
      << getText(address, "/api/v1/alerts") << getText(address, "/api/v1/tables/Q7APPSM");
  ASSERT_TRUE(waitFor([&] { return receiver.bodies().size() == 2; }, 10s));
  std::set<std::string> raised;
  for (const auto& body : receiver.bodies()) {
    EXPECT_EQ("raised", body["kind"]);
    EXPECT_EQ("critical", body["severity"]);
    EXPECT_EQ("Q7APPSM", body["table"]);
    raised.insert(body["key"]["applicatin"].get<std::string>());
  }
  EXPECT_EQ((std::set<std::string>{"bad.example", "worse.example"}), raised);

  // bad recovers (5 failed of 50: 10 %): one clear; worse stays open.
  pages("bad.example", 40, 200);
  ASSERT_TRUE(waitFor([&] { return receiver.bodies().size() == 3; }, 20s));
  EXPECT_EQ("cleared", receiver.bodies()[2]["kind"]);
  EXPECT_EQ("bad.example", receiver.bodies()[2]["key"]["applicatin"]);
  EXPECT_EQ(std::set<std::string>{"worse.example"}, openKeys(address));

  // A restart keeps worse open and POSTs nothing new while it keeps failing.
  stopWith(SIGTERM);
  address = start();
  ASSERT_TRUE(waitFor([&] { return metric(address, "q7_alert_samples_total") >= 4; }, 20s));
  EXPECT_EQ(std::set<std::string>{"worse.example"}, openKeys(address));
  EXPECT_EQ(3u, receiver.bodies().size()) << nlohmann::json(receiver.bodies()).dump(1);

  // A receiver that answers 500, then one that hangs: retried and counted, while the agent
  // keeps reading its traffic at once.
  receiver.set(Receiver::Mode::kFail);
  pages("good.example", 30, 500);  // 30 of 60 fail: raises
  ASSERT_TRUE(
      waitFor([&] { return metric(address, "q7_webhook_attempts_failed_total") >= 2; }, 20s))
      << getText(address, "/metrics");
  receiver.set(Receiver::Mode::kHang);
  const auto before = std::chrono::steady_clock::now();
  pages("later.example", 25, 200);
  ASSERT_TRUE(waitForIntakeIdle(address, data_ + "/day.sm3", 10s));
  EXPECT_LT(std::chrono::steady_clock::now() - before, 8s);
  int status = 0;
  const nlohmann::json apps = get(address, "/api/v1/tables/Q7APPSM", &status);
  EXPECT_EQ(written_, totalRequests(apps));
  EXPECT_GE(receiver.attempts(), 3);
  stopWith(SIGTERM);
}

TEST_F(AlertsE2ETest, BadDefinitionsAreRefusedAndStartNothing) {
  const std::string address = start();
  const auto refused = [&](const std::string& body, const std::string& words) {
    std::string reply;
    EXPECT_EQ(400, send(address, "PUT", "/api/v1/situations/Bad", body, token(), &reply)) << body;
    EXPECT_NE(std::string::npos, reply.find(words)) << reply;
  };
  refused(R"({"table": "Q7APPSM", "conditions": [{"column": "nosuch", "value": "1"}]})",
          "no column \\\"nosuch\\\"");
  refused(R"({"table": "Q7APPSM", "conditions": [{"column": "pcfail", "op": "ABOUT",
      "value": "1"}]})",
          "unknown operator");
  refused(R"({"table": "Q7APPSM", "every": 0})", "\\\"every\\\" must be");
  refused(R"({"table": "Q7APPSM", "every": 0.5})", "\\\"every\\\" must be");
  refused(R"({"table": "Q7APPSM", "webhook": "ftp://receiver.example/hook"})",
          "http:// or https://");
  refused(R"({"table": "Q7TXPTNS", "every": 10})", "defines patterns");
  int status = 0;
  EXPECT_TRUE(get(address, "/api/v1/situations", &status)["situations"].empty());
  EXPECT_EQ(0, metric(address, "q7_alert_samples_total"));
  stopWith(SIGTERM);
}

}  // namespace
}  // namespace q7test
