#include "core/history/state_file.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "framework/trace_capture.h"
#include "tests/support/scratch_dir.h"

namespace history {
namespace {

class StateFileTest : public ::testing::Test {
 protected:
  q7test::ScratchDir dir_;
  const std::string path_ = dir_.file("q7state.properties");
};

// What is saved loads back into a fresh object, one line per table, with no temporary left.
TEST_F(StateFileTest, RoundTrip) {
  StateFile state(path_);
  ASSERT_TRUE(state.load());
  EXPECT_FALSE(state.getLastHistoricalQueryTime("q7txot").has_value());
  state.setLastHistoricalQueryTime("q7txot", 1700000000);
  state.setLastHistoricalQueryTime("q7srvot", 5);
  state.setLastHistoricalQueryTime("q7txot", 1700000060);
  ASSERT_TRUE(state.save());

  EXPECT_EQ("LastHistoricalQueryTime.q7srvot=5\nLastHistoricalQueryTime.q7txot=1700000060\n",
            dir_.read("q7state.properties"));
  EXPECT_FALSE(std::filesystem::exists(path_ + ".tmp"));

  StateFile reloaded(path_);
  ASSERT_TRUE(reloaded.load());
  EXPECT_EQ(1700000060, reloaded.getLastHistoricalQueryTime("q7txot"));
  EXPECT_EQ(5, reloaded.getLastHistoricalQueryTime("q7srvot"));
  EXPECT_FALSE(reloaded.getLastHistoricalQueryTime("q7appot").has_value());
}

// Lines of other keys survive a save; unreadable times are skipped and reported.
TEST_F(StateFileTest, KeepsOtherLinesAndSkipsBadTimes) {
  dir_.write("q7state.properties",
             "# written by hand\r\r\nOther.key=1\nLastHistoricalQueryTime.q7txot=12x\n"
             "LastHistoricalQueryTime.q7clntot=7\r\n\nLastHistoricalQueryTime.=3\n");
  fw::TraceCapture capture;
  StateFile state(path_);
  ASSERT_TRUE(state.load());
  EXPECT_FALSE(state.getLastHistoricalQueryTime("q7txot").has_value());
  EXPECT_EQ(7, state.getLastHistoricalQueryTime("q7clntot"));
  EXPECT_EQ(2, capture.count("skipping bad line"));

  ASSERT_TRUE(state.save());
  EXPECT_EQ("# written by hand\nOther.key=1\nLastHistoricalQueryTime.q7clntot=7\n",
            dir_.read("q7state.properties"));
}

}  // namespace
}  // namespace history
