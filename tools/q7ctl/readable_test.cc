// q7ctl's readable forms: framework timestamps as dates and times, thousandths of a percent as
// percentages, in the columns that hold them and nowhere else.

#include "tools/q7ctl/readable.h"

#include <gtest/gtest.h>

#include <sstream>

namespace q7ctl {
namespace {

TEST(ReadableTest, TimestampsAndPercentages) {
  EXPECT_EQ("2026-11-24 09:40:00", ReadableTimestamp("1261124094000000").value_or(""));
  EXPECT_EQ("1999-12-31 23:59:59", ReadableTimestamp("0991231235959000").value_or(""));
  // Not a stamp: the zero stamp, a wrong length, letters, a 13th month, a century past 2099.
  for (const char* text : {"0000000000000000", "126112409400000", "12611240940000x0",
                           "1261324094000000", "2261124094000000"}) {
    EXPECT_FALSE(ReadableTimestamp(text).has_value()) << text;
  }
  EXPECT_EQ("100%", ReadablePercent(100000));
  EXPECT_EQ("0%", ReadablePercent(0));
  EXPECT_EQ("12.5%", ReadablePercent(12500));
  EXPECT_EQ("33.3%", ReadablePercent(33333));
  EXPECT_EQ("0.1%", ReadablePercent(50));  // rounded half up
  EXPECT_EQ("-2%", ReadablePercent(-2000));
}

// Only the columns that hold them change; the table aligns readable percentages as numbers.
TEST(ReadableTest, RowsKeepOtherColumnsAndAlignPercentages) {
  const Json rows = Json::parse(R"([
    {"applicatin": "1261124094000000", "timestamp": "1261124094000000", "pcfail": 12500,
     "pct404": 100000, "totreq": 8, "sampletime": "not a time", "rank": 12500},
    {"applicatin": "Shop", "timestamp": "1261124095000000", "pcfail": 0, "pct404": 0,
     "totreq": 10, "sampletime": "1261124095012000", "rank": 3}
  ])");
  const Json readable = ReadableRows(rows);
  EXPECT_EQ("1261124094000000", readable[0]["applicatin"]);
  EXPECT_EQ("2026-11-24 09:40:00", readable[0]["timestamp"]);
  EXPECT_EQ("12.5%", readable[0]["pcfail"]);
  EXPECT_EQ("100%", readable[0]["pct404"]);
  EXPECT_EQ(12500, readable[0]["rank"]);
  EXPECT_EQ("not a time", readable[0]["sampletime"]);
  EXPECT_EQ("2026-11-24 09:50:12", readable[1]["sampletime"]);
  // An event's two times.
  const Json event = ReadableRows(Json::parse(
      R"([{"msgdattime": "1261127070204000", "sdate_time": "1261127070204000", "severity": 4}])"));
  EXPECT_EQ("2026-11-27 07:02:04", event[0]["msgdattime"]);
  EXPECT_EQ("2026-11-27 07:02:04", event[0]["sdate_time"]);
  EXPECT_EQ(4, event[0]["severity"]);

  FormatOptions options;
  std::ostringstream out;
  WriteRows(Json::array({readable[0], readable[1]}), options, out);
  EXPECT_EQ(
      "applicatin        timestamp            pcfail  pct404  totreq  sampletime            rank\n"
      "1261124094000000  2026-11-24 09:40:00   12.5%    100%       8  not a time           12500\n"
      "Shop              2026-11-24 09:50:00      0%      0%      10  2026-11-24 09:50:12      3\n",
      out.str());
}

}  // namespace
}  // namespace q7ctl
