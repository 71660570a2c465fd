#include "tools/q7ctl/top.h"

#include <gtest/gtest.h>

#include <sstream>
#include <vector>

namespace q7ctl {
namespace {

std::vector<std::string> Lines(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) {
    lines.push_back(line);
  }
  return lines;
}

// Index of the first line holding text, or -1.
int LineOf(const std::vector<std::string>& lines, const std::string& text) {
  for (std::size_t i = 0; i < lines.size(); ++i) {
    if (lines[i].find(text) != std::string::npos) {
      return static_cast<int>(i);
    }
  }
  return -1;
}

// Shop is busy and quick, Intranet quiet and slow; Portal has no latency answer yet.
TopData Data() {
  TopData data;
  data.applications = Json::parse(R"([
    {"applicatin": "Intranet", "totreq": 10, "pcgood": 50000, "pcslow": 40000, "pcfail": 10000,
     "pcavail": 90000, "oatime": 2400},
    {"applicatin": "Shop", "totreq": 900, "pcgood": 99500, "pcslow": 500, "pcfail": 0,
     "pcavail": 100000, "oatime": 120},
    {"applicatin": "Portal", "totreq": 50, "pcgood": 100000, "pcslow": 0, "pcfail": 0,
     "pcavail": 100000, "oatime": 80}])");
  data.application_latency = Json::parse(R"([
    {"application": "Shop", "requests": 900, "p50_ms": 101.4, "p95_ms": 180.6, "p99_ms": 250.2,
     "max_ms": 900.0, "apdex": 0.9949, "threshold_ms": 250},
    {"application": "Intranet", "requests": 10, "p50_ms": 2000.0, "p95_ms": 6000.0,
     "p99_ms": 7000.0, "max_ms": 7100.0, "apdex": 0.55, "threshold_ms": 2000}])");
  data.transaction_latency = Json::parse(R"([
    {"application": "Shop", "transaction": "Checkout", "requests": 100, "p50_ms": 300.0,
     "p95_ms": 700.0, "p99_ms": 800.0, "max_ms": 900.0, "apdex": 0.8, "threshold_ms": 250},
    {"application": "Shop", "transaction": "Catalog", "requests": 800, "p50_ms": 90.0,
     "p95_ms": 150.0, "p99_ms": 200.0, "max_ms": 300.0, "apdex": 1.0, "threshold_ms": 250}])");
  return data;
}

TEST(TopTest, BusiestFirstMergesTheTableWithTheLatencyAnswer) {
  const std::vector<std::string> lines =
      Lines(RenderTop(Data(), TopView{}, "http://127.0.0.1:7420", "2026-11-27 08:00:00", 120, 40));
  ASSERT_GE(lines.size(), 10u);
  EXPECT_NE(std::string::npos, lines[0].find("current interval"));
  const int shop = LineOf(lines, "Shop  "), portal = LineOf(lines, "Portal"),
            intranet = LineOf(lines, "Intranet");
  ASSERT_GT(shop, 0);
  EXPECT_LT(shop, portal);
  EXPECT_LT(portal, intranet);
  // Whole milliseconds, percentages, two-decimal apdex; nothing invented for Portal.
  EXPECT_NE(std::string::npos, lines[shop].find("99.5%")) << lines[shop];
  EXPECT_NE(std::string::npos, lines[shop].find(" 181 ")) << lines[shop];
  EXPECT_NE(std::string::npos, lines[shop].find("0.99")) << lines[shop];
  EXPECT_EQ(std::string::npos, lines[portal].find("0.")) << lines[portal];
  EXPECT_LT(LineOf(lines, "Catalog"), LineOf(lines, "Checkout"));
  for (const std::string& line : lines) {
    EXPECT_LE(line.size(), 120u) << line;
  }
}

TEST(TopTest, SlowestFirstOrdersByP95AndSummaryIsNamed) {
  TopView view;
  view.slowest = true;
  view.summary = true;
  const std::vector<std::string> lines = Lines(RenderTop(Data(), view, "agent", "now", 120, 40));
  EXPECT_NE(std::string::npos, lines[0].find("summary period"));
  EXPECT_LT(LineOf(lines, "Intranet"), LineOf(lines, "Shop  "));
  EXPECT_LT(LineOf(lines, "Shop  "), LineOf(lines, "Portal"));  // no p95: last
  EXPECT_LT(LineOf(lines, "Checkout"), LineOf(lines, "Catalog"));
}

TEST(TopTest, SmallTerminalsGetFewerRowsAndFailuresAreShown) {
  // 13 lines: the chrome and two rows per section.
  const std::string small = RenderTop(Data(), TopView{}, "agent", "now", 60, 13);
  EXPECT_EQ(std::string::npos, small.find("Intranet")) << small;
  EXPECT_NE(std::string::npos, small.find("Checkout"));
  for (const std::string& line : Lines(small)) {
    EXPECT_LE(line.size(), 60u) << line;
  }
  TopData failed;
  failed.error = "cannot connect to http://127.0.0.1:1";
  const std::string screen = RenderTop(failed, TopView{}, "agent", "now", 120, 40);
  EXPECT_NE(std::string::npos, screen.find("cannot read the agent: cannot connect")) << screen;
  EXPECT_NE(std::string::npos,
            RenderTop(TopData{}, TopView{}, "a", "n", 120, 40).find("no requests in this window"));
}

}  // namespace
}  // namespace q7ctl
