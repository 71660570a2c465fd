#pragma once

// Test fixture for the intake threads: a configuration rooted in a scratch directory, a data
// directory to write collector files into, and an analyzer whose queue the test reads instead
// of an analyzer thread.

#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "core/analyzer/analyzer.h"
#include "core/analyzer/intake/dpx_transaction.h"
#include "core/config/cconfig.h"
#include "tests/support/scratch_dir.h"
#include "tests/support/sm3_lines.h"

namespace q7test {

// An analyzer without a thread: what intake queues stays in the queue for the test to take.
class QueueOnlyAnalyzer : public CAnalyzer {
 public:
  explicit QueueOnlyAnalyzer(const std::string& dir) : CAnalyzer(dir.c_str()) {}
  ~QueueOnlyAnalyzer() override { take(); }

  // Every transaction queued so far, in order; the test owns it. Position marks go to marks,
  // each with the number of transactions taken before it.
  std::vector<std::unique_ptr<CDPXTransaction>> take() {
    std::vector<std::unique_ptr<CDPXTransaction>> out;
    _TYPED_TRANSACTION item;
    while (!newQueue->IsEmpty() && newQueue->Get(item, 0) == 0) {
      if (item.transaction != nullptr && item.type == TRANSACTION_KIND_POSITION) {
        std::unique_ptr<CPositionMark> mark(static_cast<CPositionMark*>(item.transaction));
        marks.emplace_back(taken + out.size(), mark->position());
      } else if (item.transaction != nullptr) {
        EXPECT_EQ(TRANSACTION_KIND_DPX, item.type);
        out.emplace_back(static_cast<CDPXTransaction*>(item.transaction));
      }
    }
    taken += out.size();
    return out;
  }

  std::vector<std::pair<size_t, ReadPosition>> marks;
  size_t taken = 0;
};

class IntakeFixture : public ::testing::Test {
 protected:
  void SetUp() override {
    CConfig::resetForTesting();
    CConfig::setBaseDirectory(dir_.file("base").c_str());
    CConfig::setDpxDataDirectory(data().c_str());
    analyzer_ = std::make_unique<QueueOnlyAnalyzer>(dir_.file("patterns"));
  }
  void TearDown() override { CConfig::resetForTesting(); }

  std::string data() const { return dir_.file("data"); }
  std::string dataFile(const std::string& name) const { return data() + "/" + name; }

  // A page record for url.
  static std::string page(const std::string& url, int responseTime = 120) {
    return Record(1, PageLine({{23, url}, {15, std::to_string(responseTime)}}));
  }
  static void append(const std::string& path, const std::string& bytes) {
    std::ofstream(path, std::ios::binary | std::ios::app) << bytes;
  }
  static long long sizeOf(const std::string& path) {
    std::ifstream in(path, std::ios::binary | std::ios::ate);
    return in ? static_cast<long long>(in.tellg()) : -1;
  }

  // Takes what was queued until count transactions arrived or the timeout passed; their URLs.
  std::vector<std::string> urls(size_t count,
                                std::chrono::milliseconds timeout = std::chrono::seconds(2)) {
    std::vector<std::string> out;
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
      for (const auto& t : analyzer_->take()) {
        out.emplace_back(t->getURL());
      }
      if (out.size() >= count || std::chrono::steady_clock::now() > deadline) {
        return out;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
  }

  ScratchDir dir_;
  std::unique_ptr<QueueOnlyAnalyzer> analyzer_;
};

}  // namespace q7test
