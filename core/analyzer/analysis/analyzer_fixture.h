#pragma once

// Test fixture for the analyzer: an analyzer on a scratch directory, an injected clock, and
// helpers that build transactions, register patterns and read rows out of the trees.

#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>

#include <atomic>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/rows/rows.h"
#include "core/analyzer/testing/transaction_builder.h"
#include "core/config/cconfig.h"
#include "framework/clock.h"
#include "tests/support/scratch_dir.h"

namespace q7test {

inline constexpr long kStart = 1795000200;  // an interval start (a multiple of 300)

class AnalyzerFixture : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("TZ", "UTC", 1);
    tzset();
    CConfig::setOverTimeInterval(5);
    CConfig::setSummaryInterval(24);
    now_ = kStart + 10;
    fw::SetClockForTesting([this] { return static_cast<time_t>(now_.load()); });
    analyzer_ = NewAnalyzer();
  }
  void TearDown() override {
    analyzer_.reset();
    fw::SetClockForTesting({});
  }

  // An analyzer on the test's directories; begun as its thread would begin unless it is to
  // run as a thread. No data directory: the tests hand transactions over themselves, and no
  // file manager runs.
  // With checkpoints set, it takes and reads a checkpoint in the test's directory.
  std::unique_ptr<CDPXAnalyzer> NewAnalyzer(bool begin = true, bool checkpoints = false) {
    auto analyzer = std::make_unique<CDPXAnalyzer>(
        CDPXAnalyzer::Paths{dir_.file("dpx"), dir_.file("q7state.properties"), "",
                            checkpoints ? dir_.file("q7checkpoint.dat") : "", ""});
    if (begin) {
      analyzer->startRun();
    }
    return analyzer;
  }

  // A page (or, with a parent, an object) of app/url from client at time t.
  CDPXTransaction Page(const char* app, const char* url, int rt = 100, int status = 200,
                       const char* client = "10.1.2.3", long t = 0) {
    return TransactionBuilder()
        .host(app)
        .url(url)
        .responseTime(rt)
        .status(status)
        .client(client)
        .time(t != 0 ? t : now_.load())
        .build();
  }
  CDPXTransaction Object(const char* app, const char* url, int status = 200) {
    return TransactionBuilder()
        .host(app)
        .url(url)
        .responseTime(50)
        .status(status)
        .time(now_.load())
        .objectOf(std::string(32, 'A'), std::string(32, 'A'), std::string(32, 'B'))
        .build();
  }
  void Process(CDPXTransaction tx) { analyzer_->processTransaction(tx, &level_); }

  void AddPattern(const char* situation, const char* appName, const char* appPattern,
                  const char* txName, const char* txPattern, int percent = 100,
                  int16_t instances = 0, int16_t aggApp = 0, int16_t aggTx = 1,
                  int32_t thresholdMillis = 10000) {
    ASSERT_TRUE(analyzer_->newTransactionPattern(situation, appName, appPattern, txName, txPattern,
                                                 aggApp, aggTx, instances, percent, thresholdMillis,
                                                 99));
  }

  // Each row of an over-time table as "<toString>" -> requests.
  std::map<std::string, int> Rows(OverTimeTable table = OverTimeTable::kApplication) {
    std::map<std::string, int> out;
    analyzer_->visitTrees([&](COverTimeTrees& trees) {
      std::vector<TreeNode*> nodes;
      getTreeNodes(trees.tree(table), nodes);
      for (TreeNode* node : nodes) {
        out[node->toString(0)] = static_cast<CBaseTable*>(node)->getCommon().totreq;
      }
    });
    return out;
  }
  static std::string App(const std::string& name) { return "ApplicationName=" + name + "\n"; }

  q7test::ScratchDir dir_;
  std::atomic<long> now_{0};
  std::unique_ptr<CDPXAnalyzer> analyzer_;
  short level_ = 0;
};

}  // namespace q7test
