#include "core/runtime/clog.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "framework/trace_capture.h"

namespace {

class ClogTest : public ::testing::Test {
 protected:
  void TearDown() override { CLOG::setLogLevel(2); }
};

// Each function tests its own classes of the "analyzer" unit; a mask argument is a class mask.
TEST_F(ClogTest, FunctionsFollowTheUnitMask) {
  {
    fw::TraceCapture capture("*=ALL analyzer=SUMMARY");
    CLOG::enter(2, "in %s", "Run");
    CLOG::exit(2, "out %d", 7);
    CLOG::trace(0x12, "wide mask");
    CLOG::message("summary message");
    CLOG::max("summary max");
    CLOG::trace(0x10, "detail mask");
    CLOG::enter(0, "no class");
    CLOG::med("detail med");
    CLOG::debug("debug text");
    EXPECT_TRUE(capture.contains("ENTER, in Run"));
    EXPECT_TRUE(capture.contains("EXIT, out 7"));
    EXPECT_EQ(5u, capture.lines().size());
  }
  {
    fw::TraceCapture capture("*=ALL analyzer=DETAIL|DEBUG");
    CLOG::message(2, "summary mask");
    CLOG::max("summary max");
    CLOG::med("detail med");
    CLOG::debug("debug text");
    EXPECT_EQ(2u, capture.lines().size());
    EXPECT_TRUE(capture.contains("detail med"));
    EXPECT_TRUE(capture.contains("debug text"));
  }
}

// error and min are written with every class off; with the flow class on, min's record sits
// between an entry and an exit event.
TEST_F(ClogTest, ErrorAndMinAreAlwaysWritten) {
  {
    fw::TraceCapture capture("*=NONE");
    CLOG::error("broken %d", 3);
    CLOG::min("minimal %s", "text");
    ASSERT_EQ(2u, capture.lines().size());
    EXPECT_NE(std::string::npos, capture.lines()[0].find("analyzer ERROR broken 3"));
    EXPECT_NE(std::string::npos, capture.lines()[1].find("minimal text"));
  }
  fw::TraceCapture capture("*=NONE analyzer=FLOW");
  CLOG::min("between");
  std::vector<std::string> lines = capture.lines();
  ASSERT_EQ(3u, lines.size());
  EXPECT_NE(std::string::npos, lines[0].find("ENTER"));
  EXPECT_NE(std::string::npos, lines[1].find("between"));
  EXPECT_NE(std::string::npos, lines[2].find("EXIT"));
}

// trace_padded cuts at the width and drops trailing blanks; a blank field keeps one blank.
TEST_F(ClogTest, TracePaddedTrimsTheField) {
  fw::TraceCapture capture("*=NONE analyzer=SUMMARY");
  CLOG::trace_padded(2, "padded<%s>", "abc   ", 6);
  CLOG::trace_padded(2, "cut<%s>", "abcdefgh", 3);
  CLOG::trace_padded(2, "blank<%s>", "    ", 4);
  EXPECT_TRUE(capture.contains("padded<abc>"));
  EXPECT_TRUE(capture.contains("cut<abc>"));
  EXPECT_TRUE(capture.contains("blank< >"));
}

// The level must pass both as a number (<= VLevel) and as a class mask.
TEST_F(ClogTest, TracePaddedNeedsLevelAndClass) {
  fw::TraceCapture capture("*=NONE analyzer=SUMMARY|DETAIL");
  CLOG::trace_padded(1, "level ok, debug class off %s", "a", 1);
  CLOG::trace_padded(0x12, "class ok, level above 2 %s", "b", 1);
  EXPECT_TRUE(capture.lines().empty());
  CLOG::setLogLevel(0x12);
  CLOG::trace_padded(0x12, "both pass %s", "c", 1);
  EXPECT_TRUE(capture.contains("both pass c"));
}

}  // namespace
