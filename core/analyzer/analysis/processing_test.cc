// Transaction processing and the analyzer's interval work, driven with an injected clock.

#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "core/analyzer/analysis/analyzer_fixture.h"
#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/rows/rows.h"
#include "core/analyzer/situation_controller.h"
#include "core/config/cconfig.h"
#include "core/history/history_store.h"
#include "core/messages/agent_message.h"
#include "framework/clock.h"
#include "framework/trace_capture.h"
#include "tests/support/scratch_dir.h"
#include "tests/support/test_util.h"

namespace {

using q7test::kStart;
using ProcessingTest = q7test::AnalyzerFixture;

// 50 % takes the 2nd, 4th and 6th match, 100 % every one; a sub-transaction is never sampled.
TEST_F(ProcessingTest, SamplingTakesEverySecondMatch) {
  AddPattern("half", "Half", "half.example", "Tx", "*", 50);
  AddPattern("all", "All", "all.example", "Tx", "*", 100);
  for (int i = 0; i < 6; ++i) {
    Process(Page("half.example", "/a"));
    Process(Page("all.example", "/a"));
  }
  auto rows = Rows();
  EXPECT_EQ(3, rows[App("Half")]);
  EXPECT_EQ(6, rows[App("All")]);
  EXPECT_EQ(3, analyzer_->getTransactionsIgnored());
  for (int i = 0; i < 3; ++i) {
    Process(Object("half.example", "/a.css"));
  }
  EXPECT_EQ(3, Rows(OverTimeTable::kSubTransaction).begin()->second);
}

// The longer pattern wins an overlap, the earlier one a tie, and the overlap is reported.
TEST_F(ProcessingTest, LongerPatternWinsAnOverlap) {
  AgentMessage::resetForTesting();
  AgentMessage::setResourceBundle(Q7_MESSAGE_BUNDLE_DIR);
  auto lastMessage = [] {
    const std::vector<AgentMessage> messages = AgentMessage::recentMessages();
    return messages.empty() ? std::string() : std::string(messages.back().text);
  };
  AddPattern("site", "Site", "*", "Any", "*");
  AddPattern("checkout", "Shop", "*", "Checkout", "*/checkout*");
  EXPECT_NE(std::string::npos,
            lastMessage().find("situation[checkout] overlaps with situation[site] and "
                               "transactions that match both will goto situation[checkout]"))
      << lastMessage();
  AddPattern("checkout2", "Other", "*", "Checkout2", "*/c*eckout*");  // same length: later
  EXPECT_NE(std::string::npos,
            lastMessage().find("situation[checkout2] overlaps with situation[checkout] and "
                               "transactions that match both will goto situation[checkout]"))
      << lastMessage();
  AgentMessage::resetForTesting();
  Process(Page("shop.example", "/shop/checkout?step=1"));
  Process(Page("shop.example", "/shop/index"));
  auto rows = Rows();
  EXPECT_EQ(1, rows[App("Shop")]);
  EXPECT_EQ(1, rows[App("Site")]);
  EXPECT_EQ(0u, rows.count(App("Other")));
}

// Level 2 writes instance rows for bad statuses only, and the page's objects inherit it.
TEST_F(ProcessingTest, InstanceLevelTwo) {
  AddPattern("bad", "Shop", "*", "Tx", "*", 100, 2);
  Process(Page("shop.example", "/ok", 100, 200));
  Process(Page("shop.example", "/bad", 100, 500));
  Process(Object("shop.example", "/bad.css", 404));
  Process(Object("shop.example", "/good.css", 200));
  analyzer_->flushInstanceFiles();
  auto& store = analyzer_->historyStore();
  const long interval = analyzer_->getCurrentOverTimeInterval();
  EXPECT_EQ(1u, store.countRows("q7txins", interval, 1, 300, sizeof(kq7_q7txins_data_t)));
  EXPECT_EQ(1u, store.countRows("q7subtxins", interval, 1, 300, sizeof(kq7_q7subtxins_data_t)));
}

// Without a client pattern a transaction keeps its client identity; a subnet pattern cuts
// the address after its third dot; a name pattern reports every client under one name.
TEST_F(ProcessingTest, ClientIdentity) {
  AddPattern("all", "Shop", "*", "Tx", "*");
  Process(Page("shop.example", "/a", 100, 200, "10.9.9.9"));
  ASSERT_TRUE(analyzer_->newClientPattern("subnet", "Office", "10.1.*", "10.1.*", 2));
  ASSERT_TRUE(analyzer_->newClientPattern("named", "Lab", "*", "192.168.*", 0));
  Process(Page("shop.example", "/a", 100, 200, "10.1.2.3"));
  Process(Page("shop.example", "/a", 100, 200, "10.1.2.4"));
  Process(Page("shop.example", "/a", 100, 200, "192.168.7.1"));
  auto clients = Rows(OverTimeTable::kClientServer);
  EXPECT_EQ(1, clients["ClientName=10.9.9.9\nServerName=192.0.2.10\n"]);
  EXPECT_EQ(2, clients["ClientName=10.1.2.*\nServerName=192.0.2.10\n"]);
  EXPECT_EQ(1, clients["ClientName=Lab\nServerName=192.0.2.10\n"]);
  // The cut reaches the address and host name too: the client rows key on all three.
  auto clientRows = Rows(OverTimeTable::kClient);
  EXPECT_EQ(2, clientRows["ClientName=10.1.2.*\nIPAddress=10.1.2.*\nHostname=10.1.2.*\n"]);
}

// A transaction older than the reference interval is counted into it; one that is then still
// older than the summary period (the clock moved on a day with no rollover yet) is counted as
// processed but changes no table.
TEST_F(ProcessingTest, OldTransactions) {
  AddPattern("all", "Shop", "*", "Tx", "*");
  Process(Page("shop.example", "/a", 100, 200, "10.1.2.3", kStart - 3600));
  EXPECT_EQ(1, Rows()[App("Shop")]);
  now_ = kStart + 25 * 3600;
  Process(Page("shop.example", "/a", 100, 200, "10.1.2.3", kStart));
  EXPECT_EQ(2, analyzer_->getTransactionsProcessed());
  EXPECT_EQ(1, Rows()[App("Shop")]);
}

// Rows saved at a rollover come back from history with their key and figures; the current
// interval's rows survive a restart within it.
TEST_F(ProcessingTest, RolloverSavesAndRestartReloads) {
  AddPattern("all", "Shop", "*", "Tx", "*");
  Process(Page("shop.example", "/a", 120));
  Process(Page("shop.example", "/a", 80, 503));
  now_ = kStart + 300 + 1;
  ASSERT_TRUE(analyzer_->rolloverDue());
  analyzer_->rollover();
  EXPECT_TRUE(Rows().empty());
  const auto bytes =
      analyzer_->historyStore().loadInterval(kStart, "q7appot", sizeof(kq7_q7appot_data_t));
  ASSERT_EQ(sizeof(kq7_q7appot_data_t), bytes.size());
  kq7_q7appot_data_t row;
  memcpy(&row, bytes.data(), sizeof(row));
  EXPECT_EQ("Shop", rows::FieldText(row.applicatin, 128));
  EXPECT_EQ(2, row.totreq);
  EXPECT_EQ(1, row.failreq);
  EXPECT_EQ(100, row.oatime);

  Process(Page("shop.example", "/a", 60));
  analyzer_->finishRun();
  analyzer_ = NewAnalyzer();
  EXPECT_EQ(1, Rows()[App("Shop")]);
}

// With zero records asked for, a key that went quiet stays in the new interval with no requests.
TEST_F(ProcessingTest, QuietKeysKeepZeroRows) {
  CConfig::setReportZeroRecords(true);
  AddPattern("all", "Shop", "*", "Tx", "*");
  Process(Page("shop.example", "/a"));
  now_ = kStart + 300 + 1;
  analyzer_->rollover();
  CConfig::setReportZeroRecords(false);
  const auto rows = Rows();
  ASSERT_EQ(1u, rows.count(App("Shop")));
  EXPECT_EQ(0, rows.at(App("Shop")));
  EXPECT_EQ(1u, Rows(OverTimeTable::kTransaction).size());
}

// The 12th rollover removes history older than the summary period; the first eleven do not.
TEST_F(ProcessingTest, CleanupEveryTwelfthRollover) {
  const std::string old = dir_.file("dpx/" + std::to_string(kStart - 30 * 3600) + "_1_q7appot.dat");
  for (int i = 1; i <= 12; ++i) {
    std::filesystem::create_directories(dir_.file("dpx"));
    if (i == 1) {
      dir_.write("dpx/" + std::to_string(kStart - 30 * 3600) + "_1_q7appot.dat", "x");
    }
    now_ = kStart + 300 * i + 1;
    analyzer_->rollover();
    EXPECT_EQ(i < 12, std::filesystem::exists(old)) << "rollover " << i;
  }
}

// Patterns come back after a restart, in their order.
TEST_F(ProcessingTest, PatternsSurviveARestart) {
  AddPattern("short", "A", "*", "T", "*");
  AddPattern("long", "B", "*.example", "T", "/shop/*");
  analyzer_ = NewAnalyzer();
  const auto patterns = analyzer_->situations().getTransactionPatterns();
  ASSERT_EQ(2u, patterns.size());
  EXPECT_STREQ("long", patterns[0].situationId);
  EXPECT_STREQ("short", patterns[1].situationId);
}

// With nothing arriving, the running thread still rolls over within its 5 s queue wait.
TEST_F(ProcessingTest, RolloverWithoutTraffic) {
  analyzer_.reset();
  auto analyzer = NewAnalyzer(false);
  analyzer->Start();
  now_ = kStart + 300 + 1;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(8);
  while (analyzer->getCurrentOverTimeInterval() != kStart + 300 &&
         std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  EXPECT_EQ(kStart + 300, analyzer->getCurrentOverTimeInterval());
  // A record of another kind reaches no tree and is not counted as ignored.
  analyzer->add({7, new CDPXTransaction()});
  analyzer->Shutdown();
  analyzer->Join();
  EXPECT_EQ(0, analyzer->getTransactionsIgnored());
  EXPECT_EQ(0, analyzer->getTransactionsProcessed());
}

// The latency books follow the rows: the interval's book is the current interval's pages, the
// summary's every page since, across a rollover and a restart; /metrics counts every page once.
TEST_F(ProcessingTest, LatencyBooksFollowTheIntervals) {
  AddPattern("all", "Shop", "*", "Tx", "*", 100, 0, 0, 1, 250);
  for (int rt = 10; rt <= 1000; rt += 10) {
    Process(Page("shop.example", "/a", rt));
  }
  now_ = kStart + 300 + 1;
  analyzer_->rollover();
  Process(Page("shop.example", "/a", 5000));
  EXPECT_EQ(1u, analyzer_->getLatency(false).applications().at("Shop").sketch.count());
  analyzer_->finishRun();
  analyzer_ = NewAnalyzer();

  const LatencyBook summary = analyzer_->getLatency(true);
  const LatencyEntry shop = summary.applications().at("Shop");
  EXPECT_EQ(101u, shop.sketch.count());
  EXPECT_EQ(5000, shop.sketch.max());
  EXPECT_NEAR(510, shop.sketch.quantile(0.5), 5.1);  // rank 50 of 101, within 1 %
  EXPECT_EQ(25u, shop.satisfied);                    // 10 .. 250
  EXPECT_EQ(75u, shop.tolerating);                   // 260 .. 1000
  EXPECT_EQ(250, shop.thresholdMillis);
  EXPECT_EQ(101u, summary.transactions().begin()->second.sketch.count());
  // Cached between queries, and refreshed when the history changes.
  EXPECT_EQ(summary, analyzer_->getLatency(true));
  Process(Page("shop.example", "/a", 7));
  EXPECT_EQ(102u, analyzer_->getLatency(true).applications().at("Shop").sketch.count());
  // Metrics count since the process started: the new analyzer saw one page.
  EXPECT_EQ(1u, analyzer_->getRequestMetrics().all().at(0).requests());
}

// Latency and metrics are read while the analyzer thread processes (run under TSan).
TEST_F(ProcessingTest, LatencyAndMetricsReadWhileProcessing) {
  AddPattern("all", "Shop", "*", "Tx", "*");
  analyzer_.reset();
  auto analyzer = NewAnalyzer(false);
  analyzer->Start();
  std::atomic<bool> done{false};
  std::thread reader([&] {
    while (!done.load()) {
      analyzer->getLatency(true);
      analyzer->getRequestMetrics();
    }
  });
  for (int i = 0; i < 2000; ++i) {
    analyzer->add({TRANSACTION_KIND_DPX, new CDPXTransaction(Page("shop.example", "/a", i % 300))});
  }
  EXPECT_TRUE(q7test::PollUntil([&] { return analyzer->getTransactionsProcessed() >= 2000; },
                                std::chrono::seconds(20)));
  done = true;
  reader.join();
  EXPECT_EQ(2000u, analyzer->getLatency(false).applications().at("Shop").sketch.count());
  analyzer->Shutdown();
  analyzer->Join();
}

}  // namespace
