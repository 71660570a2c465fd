#include "tools/q7ctl/alerts.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>

namespace q7ctl {
namespace {

// An open alert and its clear as the agent sends them.
const Json kOpen = Json::parse(R"([{"sequence": 4, "situation": "AppFailing", "table": "Q7APPSM",
  "severity": "critical", "key": {"applicatin": "Shop", "transactn": "Pay"},
  "values": {"applicatin": "Shop", "pcfail": 12000}, "raised_at": "2026-11-27T07:00:00Z",
  "raised_at_epoch": 1795762800, "seen_at": "2026-11-27T07:05:00Z",
  "seen_at_epoch": 1795763100}])");
const Json kClear = Json::parse(R"({"sequence": 9, "kind": "cleared", "situation": "AppFailing",
  "table": "Q7APPSM", "severity": "critical", "key": {"applicatin": "Shop"},
  "values": {}, "raised_at": "2026-11-27T07:00:00Z", "raised_at_epoch": 1795762800,
  "at": "2026-11-27T07:10:00Z", "at_epoch": 1795763400})");

class AlertRowsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("TZ", "UTC", 1);
    tzset();
  }
};

TEST_F(AlertRowsTest, OpenAlertsShowTheKeyAsWordsAndLocalTimes) {
  const Json rows = OpenAlertRows(kOpen, false);
  ASSERT_EQ(1u, rows.size());
  EXPECT_EQ(Json::parse(R"({"situation": "AppFailing", "severity": "critical",
    "key": "applicatin=Shop transactn=Pay", "since": "2026-11-27 07:00:00",
    "seen": "2026-11-27 07:05:00"})"),
            rows[0]);
  EXPECT_EQ(1795762800, OpenAlertRows(kOpen, true)[0]["since"]);
}

TEST_F(AlertRowsTest, ChangesAreToldApartFromTableRows) {
  const Json rows = AlertChangeRows(Json::array({kClear}), false);
  ASSERT_EQ(1u, rows.size());
  EXPECT_EQ("cleared", rows[0]["kind"]);
  EXPECT_EQ("2026-11-27 07:10:00", rows[0]["at"]);
  EXPECT_TRUE(IsAlertChange(kClear));
  EXPECT_FALSE(IsAlertChange(Json::parse(R"({"msgid": "KQ7RT0001I", "kind": "x"})")));
  EXPECT_FALSE(IsAlertChange(Json::parse(R"({"situation": "S", "kind": "started"})")));
}

}  // namespace
}  // namespace q7ctl
