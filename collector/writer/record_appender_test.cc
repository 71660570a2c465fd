// The writer's path from FIFO bytes to files and truth, checked against sm3gen's own truth.

#include "collector/writer/record_appender.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <nlohmann/json.hpp>
#include <random>
#include <set>

#include "collector/sm3gen/test_support.h"
#include "tests/support/scratch_dir.h"

namespace collector {
namespace {

using Clock = RecordAppender::Clock;

class RecordAppenderTest : public ::testing::Test {
 protected:
  std::string AllFiles() const {
    std::set<std::string> names;  // renamed files sort before the live one, in order
    for (const auto& entry : std::filesystem::directory_iterator(dir_.file("data"))) {
      names.insert(entry.path().filename().string());
    }
    std::string all;
    for (const std::string& name : names) {
      all += dir_.read("data/" + name);
    }
    return all;
  }
  nlohmann::json Truth() const { return nlohmann::json::parse(dir_.read("truth.json")); }

  q7test::ScratchDir dir_;
  std::string error_;
};

// A batch fed in random pieces reaches the files byte for byte, spread over several rolled
// files, and the writer's truth is the generator's (the seed aside, which it cannot know).
TEST_F(RecordAppenderTest, TruthEqualsTheGeneratorsForABatch) {
  sm3gen::ModelOptions model;
  model.seed = 3;
  model.start = 1795450020;
  model.av_share = 30;  // enough audio and video to exercise their layout
  const auto batch = sm3gen::testing::Generate(model, {sm3gen::LineEnd::kMixed, 0}, 3000);

  RecordAppender appender({dir_.file("data"), "traffic", 200000, 0}, dir_.file("truth.json"));
  ASSERT_TRUE(appender.Open(Clock::now(), &error_)) << error_;
  EXPECT_EQ(0, Truth()["records"]);  // there from the start
  std::mt19937 rng(9);
  std::string_view rest = batch.bytes;
  while (!rest.empty()) {
    const size_t size = std::min<size_t>(rest.size(), rng() % 70000 + 1);
    ASSERT_TRUE(appender.Feed(rest.substr(0, size), Clock::now(), &error_)) << error_;
    rest.remove_prefix(size);
  }
  ASSERT_TRUE(appender.Finish(Clock::now(), &error_)) << error_;

  EXPECT_GE(appender.file().rolled(), 5);
  EXPECT_EQ(batch.bytes, AllFiles());
  EXPECT_EQ(0, appender.unreadable());
  nlohmann::json expected = batch.truth;
  nlohmann::json truth = Truth();
  expected.erase("seed");
  truth.erase("seed");
  EXPECT_GT(truth["by_kind"]["video"], 0);
  EXPECT_EQ(expected, truth);
}

// The truth file is rewritten while running, not only at the end.
TEST_F(RecordAppenderTest, TruthIsRewrittenPeriodically) {
  const auto batch = sm3gen::testing::Generate({}, {}, 10);
  RecordAppender appender({dir_.file("data"), "traffic", 0, 0}, dir_.file("truth.json"));
  const Clock::time_point t0 = Clock::now();
  ASSERT_TRUE(appender.Open(t0, &error_)) << error_;
  ASSERT_TRUE(appender.Feed(batch.bytes, t0, &error_)) << error_;
  ASSERT_TRUE(appender.Tick(t0 + RecordAppender::kTruthEvery / 2, &error_));
  EXPECT_EQ(0, Truth()["records"]);
  ASSERT_TRUE(appender.Tick(t0 + RecordAppender::kTruthEvery, &error_));
  EXPECT_EQ(10, Truth()["records"]);
  EXPECT_FALSE(std::filesystem::exists(dir_.file("truth.json.tmp")));
}

}  // namespace
}  // namespace collector
