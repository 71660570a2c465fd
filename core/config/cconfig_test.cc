#include "core/config/cconfig.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "core/runtime/paths.h"
#include "framework/trace_capture.h"
#include "tests/support/scratch_dir.h"

namespace {

class CConfigTest : public ::testing::Test {
 protected:
  void SetUp() override {
    CConfig::resetForTesting();
    unsetenv("OXA_COLLECTOR");
    root_ = scratch_.path();
  }
  void TearDown() override {
    CConfig::resetForTesting();
    unsetenv("OXA_COLLECTOR");
  }

  q7test::ScratchDir scratch_;

  // Index of the first captured line containing text, or -1.
  static int LineOf(const fw::TraceCapture& capture, const std::string& text) {
    std::vector<std::string> lines = capture.lines();
    for (std::size_t i = 0; i < lines.size(); ++i) {
      if (lines[i].find(text) != std::string::npos) {
        return static_cast<int>(i);
      }
    }
    return -1;
  }

  std::string root_;
};

// A zero interval (an absent or non-numeric property converts to 0) falls back to the default
// with an error; the summary interval reuses the over-time text. Negative values are kept.
TEST_F(CConfigTest, ZeroIntervalsFallBackWithAnError) {
  fw::TraceCapture capture("*=NONE");
  CConfig::setOverTimeInterval(0);
  CConfig::setSummaryInterval(0);
  CConfig::setMaxThreads(0);
  EXPECT_EQ(5, CConfig::getOverTimeInterval());
  EXPECT_EQ(24, CConfig::getSummaryInterval());
  EXPECT_EQ(40, CConfig::getMaxThreads());
  EXPECT_EQ(2, capture.count("ERROR Invalid Overtime Interval 0"));
  EXPECT_EQ(1, capture.count("ERROR Invalid Max Threads 0"));
  EXPECT_TRUE(capture.contains("Overtime Interval set to 5"));
  EXPECT_TRUE(capture.contains("Summary Interval set to 24"));
  EXPECT_TRUE(capture.contains("Max Threads set to 40"));

  capture.clear();
  CConfig::setOverTimeInterval(-3);
  CConfig::setSummaryInterval(48);
  EXPECT_EQ(-3, CConfig::getOverTimeInterval());
  EXPECT_EQ(48, CConfig::getSummaryInterval());
  EXPECT_FALSE(capture.contains("Invalid"));
}

// Seconds become milliseconds in 32-bit arithmetic: above 2147483 the result wraps to -1000.
TEST_F(CConfigTest, OutlierSecondsWrapLikeThirtyTwoBits) {
  const std::vector<std::pair<int, int>> cases = {
      {3, 3000},        {2147483, 2147483000},   {2147484, -1000},
      {3000000, -1000}, {2147483647, -1000},     {0, 0},
      {-5, -5000},      {-2147483, -2147483000},
  };
  for (const auto& [seconds, millis] : cases) {
    CConfig::setExcludeOutlierSeconds(seconds);
    EXPECT_EQ(millis, CConfig::getExcludeOutlierMillis()) << seconds;
  }
}

TEST_F(CConfigTest, DpxDataDirectoryIsCreated) {
  fw::TraceCapture capture("*=NONE analyzer=SUMMARY");
  std::string dir = root_ + "/sm3data";
  CConfig::setDpxDataDirectory(dir.c_str());
  EXPECT_EQ(dir, CConfig::getDpxDataDirectory());
  EXPECT_TRUE(dirExists(dir.c_str()));
  EXPECT_TRUE(capture.contains("DPX data dir=" + dir));
}

// On a first start the base itself is missing: it and the whole tree appear, in order.
TEST_F(CConfigTest, BaseDirectoryBuildsTheTree) {
  fw::TraceCapture capture("*=NONE analyzer=SUMMARY");
  const std::string base = root_ + "/zorvan6";
  CConfig::setBaseDirectory(base.c_str());

  EXPECT_EQ(base, CConfig::getBaseDirectory());
  EXPECT_EQ(base + "/logs/", CConfig::getLogDirectory());
  EXPECT_EQ(base + "/odi", CConfig::getOdiDataDirectory());
  EXPECT_EQ(base + "/odi/dpx/", CConfig::getDpxOdiDataDirectory());
  for (const char* sub :
       {"logs", "odi/dpx", "odi/lyn", "odi/arm", "arm/log/lyn/delete", "lyn/Mgmt/Log"}) {
    EXPECT_TRUE(dirExists((base + "/" + sub).c_str())) << sub;
  }

  const std::vector<std::string> order = {
      "Base dir=" + base,
      "ARM data dir=" + base + "/arm/log/lyn",
      "ARM data delete dir=" + base + "/arm/log/lyn/delete",
      "DPX ODI dir=" + base + "/odi/dpx/",
      "LYN ODI dir=" + base + "/odi/lyn/",
      "ARM ODI dir=" + base + "/odi/arm/",
      "LYN data dir=[" + base + "/lyn/Mgmt/Log]",
  };
  int previous = -1;
  for (const std::string& text : order) {
    int at = LineOf(capture, text);
    EXPECT_GT(at, previous) << text;
    previous = at;
  }
  EXPECT_FALSE(capture.contains("ERROR"));
}

TEST_F(CConfigTest, CollectorVariableNamesTheArmDirectory) {
  setenv("OXA_COLLECTOR", "x", 1);
  const std::string base = root_ + "/base";
  CConfig::setBaseDirectory(base.c_str());
  EXPECT_EQ(base + "/arm/log/x", CConfig::getArmDataDirectory());
  EXPECT_TRUE(dirExists((base + "/arm/log/x/delete").c_str()));
  EXPECT_FALSE(dirExists((base + "/arm/log/lyn").c_str()));
}

// A base that cannot exist (under a regular file) is traced per directory and start-up goes on.
TEST_F(CConfigTest, UncreatableBaseIsTracedNotFatal) {
  std::ofstream(root_ + "/file") << "x";
  const std::string base = root_ + "/file/zorvan6";
  fw::TraceCapture capture("*=ERROR");
  CConfig::setBaseDirectory(base.c_str());
  EXPECT_EQ(base, CConfig::getBaseDirectory());
  EXPECT_EQ(base + "/odi/dpx/", CConfig::getDpxOdiDataDirectory());
  EXPECT_TRUE(capture.contains("Could not create directory " + base + ": Not a directory"));
  EXPECT_TRUE(capture.contains("Could not create directory " + base + "/lyn/Mgmt/Log"));
  EXPECT_FALSE(dirExists(base.c_str()));
}

}  // namespace
