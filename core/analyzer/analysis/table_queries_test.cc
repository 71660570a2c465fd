// The table queries: over-time rows of the current trees plus history, summaries folded at
// query time, instance and current-status rows.

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "core/analyzer/analysis/analyzer_fixture.h"
#include "core/history/history_store.h"
#include "framework/trace_capture.h"

namespace {

using q7test::kStart;
using QueryTest = q7test::AnalyzerFixture;

template <class Row>
std::unique_ptr<Row[]> Own(Row* rows) {
  return std::unique_ptr<Row[]>(rows);
}

TEST_F(QueryTest, OnlySampleType3GivesRows) {
  AddPattern("all", "Shop", "*", "Tx", "*");
  Process(Page("shop.example", "/a"));
  for (int type : {1, 4}) {
    int count = -1;
    EXPECT_EQ(nullptr, Own(analyzer_->get_tblappot(type, &count)).get());
    EXPECT_EQ(0, count);
    EXPECT_EQ(nullptr, Own(analyzer_->get_tblappsm(type, &count)).get());
    EXPECT_EQ(nullptr, Own(analyzer_->get_tbltxins(type, &count)).get());
    EXPECT_EQ(nullptr, Own(analyzer_->get_tblappcs(type, &count)).get());
  }
  int count = 0;
  EXPECT_NE(nullptr, Own(analyzer_->get_tblappot(3, &count)).get());
  EXPECT_EQ(1, count);
}

TEST_F(QueryTest, SummaryPeriodIn288Intervals) {
  EXPECT_EQ(288, CDPXAnalyzer::summaryIntervals());
}

TEST_F(QueryTest, EmptyTreesAndNoHistoryGiveNoRows) {
  fw::TraceCapture capture("*=ALL");
  int count = -1;
  EXPECT_EQ(nullptr, Own(analyzer_->get_tbltxsm(3, &count)).get());
  EXPECT_EQ(0, count);
  EXPECT_TRUE(capture.contains("i_get_tbltxsm, no current data."));
}

// History beyond MAX_ROWS is cut, with its trace.
TEST_F(QueryTest, HistoryIsCappedAtMaxRows) {
  std::vector<kq7_q7appot_data_t> rows(MAX_ROWS + 1);
  for (size_t i = 0; i < rows.size(); ++i) {
    memset(&rows[i], 0, sizeof(rows[i]));
    snprintf(rows[i].applicatin, sizeof(rows[i].applicatin), "app-%zu", i);
    rows[i].totreq = 1;
  }
  ASSERT_TRUE(analyzer_->historyStore().saveInterval(kStart - 300, "q7appot", rows.data(),
                                                     sizeof(rows[0]), rows.size()));
  fw::TraceCapture capture("*=ERROR");
  int count = 0;
  auto got = Own(analyzer_->get_tblappot(3, &count));
  EXPECT_EQ(MAX_ROWS, count);
  EXPECT_TRUE(capture.contains("Too many rows 25001 > MAX_ROWS(25000), will return MAX_ROWS"));
  // Every returned row is stamped with the sample time.
  EXPECT_EQ(std::string(got[0].sampletime, 16), std::string(got[count - 1].sampletime, 16));
  EXPECT_NE('\0', got[count - 1].sampletime[0]);
}

// One key in two intervals: one summary row with the counts summed and the average of all
// the requests within 1 ms; the over-time query gives both rows.
TEST_F(QueryTest, SummaryFoldsIntervals) {
  AddPattern("all", "Shop", "*", "Tx", "*");
  Process(Page("shop.example", "/a", 101));
  Process(Page("shop.example", "/a", 102, 500));
  now_ = kStart + 300 + 1;
  analyzer_->rollover();
  Process(Page("shop.example", "/a", 250));
  int count = 0;
  auto overTime = Own(analyzer_->get_tblappot(3, &count));
  EXPECT_EQ(2, count);
  auto summary = Own(analyzer_->get_tblappsm(3, &count));
  ASSERT_EQ(1, count);
  EXPECT_EQ(3, summary[0].totreq);
  EXPECT_EQ(1, summary[0].failreq);
  EXPECT_NEAR((101 + 102 + 250) / 3, summary[0].oatime, 1);
  EXPECT_EQ(101, summary[0].minrtt);
  EXPECT_EQ(250, summary[0].maxrtt);
  // Current status: the current interval only, without aggby.
  auto current = Own(analyzer_->get_tblappcs(3, &count));
  ASSERT_EQ(1, count);
  EXPECT_EQ(1, current[0].totreq);
  EXPECT_EQ("Shop", rows::FieldText(current[0].applicatin, 128));
}

// A limit gives the first rows of the whole answer (current rows, then history) and copies no
// more; current-status rows likewise.
TEST_F(QueryTest, ALimitGivesTheFirstRows) {
  AddPattern("all", "", "*", "Tx", "*", 100, 0, 1, 1);
  for (const char* app : {"a.example", "b.example", "c.example"}) {
    Process(Page(app, "/x"));
  }
  now_ = kStart + 300 + 1;
  analyzer_->rollover();
  for (const char* app : {"d.example", "e.example"}) {
    Process(Page(app, "/x"));
  }
  int all = 0;
  auto whole = Own(analyzer_->get_tblappot(3, &all));
  ASSERT_EQ(5, all);
  int current = 0;
  auto wholeCurrent = Own(analyzer_->get_tblappcs(3, &current));
  ASSERT_EQ(2, current);
  for (size_t limit : {0, 1, 2, 3, 5, 9}) {
    int count = -1;
    auto got = Own(analyzer_->get_tblappot(3, &count, limit));
    ASSERT_EQ(std::min<int>(all, static_cast<int>(limit)), count) << limit;
    for (int i = 0; i < count; ++i) {
      EXPECT_EQ(0, memcmp(&whole[i], &got[i], sizeof(got[i]))) << limit << " row " << i;
    }
    auto gotCurrent = Own(analyzer_->get_tblappcs(3, &count, limit));
    ASSERT_EQ(std::min<int>(current, static_cast<int>(limit)), count) << limit;
    for (int i = 0; i < count; ++i) {
      EXPECT_EQ(rows::FieldText(wholeCurrent[i].applicatin, 128),
                rows::FieldText(gotCurrent[i].applicatin, 128));
    }
  }
}

TEST_F(QueryTest, InstanceRowsFromTheInstanceFiles) {
  AddPattern("all", "Shop", "*", "Checkout", "*/checkout*", 100, 1, 0, 0);
  Process(Page("shop.example", "/shop/checkout", 300, 200));
  Process(Page("shop.example", "/shop/checkout", 700, 503));
  int count = 0;
  auto rows = Own(analyzer_->get_tbltxins(3, &count));
  ASSERT_EQ(2, count);
  EXPECT_EQ("Checkout", rows::FieldText(rows[0].transactn, 255));
  EXPECT_EQ("*/checkout*", rows::FieldText(rows[0].transpattn, 255));
  EXPECT_EQ(503, rows[1].statuscode);
  EXPECT_EQ(16u, rows::FieldText(rows[1].instroot, 16).size());
}

}  // namespace
