// The alert sampler against a table whose rows the test sets: a type-3 request with the
// situation's name, raises after "for" samples, clears, a stop, webhooks and the events ring.

#include "framework/alert_sampler.h"

#include <gtest/gtest.h>
#include <httplib.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "framework/events.h"
#include "framework/mutex.h"
#include "framework/status.h"
#include "framework/tables.h"
#include "tests/support/test_util.h"

namespace fw {
namespace {

using namespace std::chrono_literals;

struct AppRow {
  char applicatin[12];
  std::int32_t pcfail;
};

// What the table holds now and what its sampling requests carried; shared with the sampler's
// thread.
struct Table {
  Mutex mutex;
  std::vector<AppRow> rows GUARDED_BY(mutex);
  std::vector<std::string> situations GUARDED_BY(mutex);  // of each type-3 request
};
Table table;

class AppAgent : public TableAgent {
 public:
  explicit AppAgent(Request* request) : request_(request) {}
  void TakeSampleConstructor() override {}
  void TakeSample() override {
    MutexLock lock(table.mutex);
    if (request_->type == 3) {
      table.situations.push_back(request_->situation.value_or("(none)"));
    }
    AddRows(request_, table.rows.data(), sizeof(AppRow), static_cast<int>(table.rows.size()));
  }
  void TakeSampleDestructor() override {}

 private:
  Request* request_;
};

class AppManager : public TableManager {
 public:
  std::unique_ptr<TableAgent> CreateAgent(Request* request) override {
    return std::make_unique<AppAgent>(request);
  }
  void EventArrived(Request&) override {}
  void AddDataToEvent(Request&, const void*, int) override {}
};

AppRow App(const char* name, std::int32_t pcfail) {
  AppRow row{};
  std::strncpy(row.applicatin, name, sizeof(row.applicatin));
  row.pcfail = pcfail;
  return row;
}

void SetRows(std::vector<AppRow> rows) {
  MutexLock lock(table.mutex);
  table.rows = std::move(rows);
}

// A webhook receiver on loopback keeping the bodies it was sent.
class Receiver {
 public:
  Receiver() {
    server_.Post("/hook", [this](const httplib::Request& req, httplib::Response& res) {
      MutexLock lock(mutex_);
      bodies_.push_back(nlohmann::json::parse(req.body));
      res.status = 204;
    });
    port_ = server_.bind_to_any_port("127.0.0.1");
    thread_ = std::thread([this] { server_.listen_after_bind(); });
    q7test::PollUntil([this] { return server_.is_running(); }, 5s);
  }
  ~Receiver() {
    server_.stop();
    thread_.join();
  }
  std::string url() const { return "http://127.0.0.1:" + std::to_string(port_) + "/hook"; }
  std::vector<nlohmann::json> bodies() {
    MutexLock lock(mutex_);
    return bodies_;
  }

 private:
  httplib::Server server_;
  int port_ = 0;
  std::thread thread_;
  Mutex mutex_;
  std::vector<nlohmann::json> bodies_ GUARDED_BY(mutex_);
};

class AlertSamplerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ResetTablesForTesting();
    TableDefinition definition{
        "APPS",
        {{"applicatin", kColumnTypeString, 12, 0}, {"pcfail", kColumnTypeInt32, 4, 12}},
        sizeof(AppRow),
        std::make_unique<AppManager>(),
        {"applicatin"},
        false};
    ASSERT_EQ(kOk, RegisterTable(std::move(definition)));
    SetRows({});
    MutexLock lock(table.mutex);
    table.situations.clear();
  }
  void TearDown() override {
    ResetTablesForTesting();
    std::filesystem::remove_all(dir_);
  }

  SituationInfo Failing(const std::string& webhook) {
    SituationInfo info;
    info.name = "AppFailing";
    info.table = "APPS";
    info.conditions.push_back({"pcfail", ConditionOp::kGT, "5000", -1});
    info.alert = AlertSettings{1, 2, "critical", webhook};
    return info;
  }

  const std::string dir_ =
      std::filesystem::temp_directory_path() / ("q7_alert_sampler_" + std::to_string(getpid()));
};

TEST_F(AlertSamplerTest, RaisesAfterForSamplesClearsAndForgetsAStoppedSituation) {
  Receiver receiver;
  std::filesystem::create_directories(dir_);
  AlertBook book(dir_ + "/alerts.json");
  WebhookSender webhooks;
  AlertSampler sampler(&book, &webhooks);
  sampler.Start();
  SetRows({App("Shop", 12000), App("Bank", 100)});
  sampler.SituationStarted(Failing(receiver.url()));

  // Shop matches; Bank's row is filtered out by the condition.
  ASSERT_TRUE(q7test::PollUntil([&] { return book.Open().size() == 1; }, 10s));
  EXPECT_EQ("Shop", book.Open()[0]["key"]["applicatin"]);
  EXPECT_GE(sampler.counters().samples, 2u);  // "for": 2
  {
    MutexLock lock(table.mutex);
    ASSERT_FALSE(table.situations.empty());
    EXPECT_EQ("AppFailing", table.situations.front());
  }
  ASSERT_TRUE(q7test::PollUntil([&] { return receiver.bodies().size() == 1; }, 10s));
  EXPECT_EQ("raised", receiver.bodies()[0]["kind"]);
  EXPECT_EQ("critical", receiver.bodies()[0]["severity"]);

  // Shop recovers: one clear; the change also reached the events ring.
  SetRows({App("Shop", 0)});
  ASSERT_TRUE(q7test::PollUntil([&] { return receiver.bodies().size() == 2; }, 10s));
  EXPECT_EQ("cleared", receiver.bodies()[1]["kind"]);
  EXPECT_TRUE(book.Open().empty());
  const std::vector<EventRow> events = ListEventRows(kAlertEventStream);
  ASSERT_GE(events.size(), 2u);
  EXPECT_EQ("cleared", events.back().json["kind"]);

  // Failing again, then stopped: the open alert clears without another sample.
  SetRows({App("Shop", 9000)});
  ASSERT_TRUE(q7test::PollUntil([&] { return book.Open().size() == 1; }, 10s));
  sampler.SituationStopped("AppFailing");
  ASSERT_TRUE(q7test::PollUntil([&] { return receiver.bodies().size() == 4; }, 10s));
  EXPECT_EQ("cleared", receiver.bodies()[3]["kind"]);
  EXPECT_TRUE(book.Open().empty());
  EXPECT_TRUE(book.Situations().empty());
  sampler.Stop();
}

TEST_F(AlertSamplerTest, KeysAreTheTablesKeyColumnsOrEveryTextColumn) {
  Sample sample;
  sample.table = FindTable("APPS");
  const AppRow row = App("Shop", 7);
  sample.rows.resize(sizeof(AppRow));
  std::memcpy(sample.rows.data(), &row, sizeof(row));
  std::vector<MatchedRow> rows = MatchedRows(sample);
  ASSERT_EQ(1u, rows.size());
  EXPECT_EQ(nlohmann::ordered_json({{"applicatin", "Shop"}}), rows[0].key);
  EXPECT_EQ(7, rows[0].values["pcfail"]);
}

}  // namespace
}  // namespace fw
