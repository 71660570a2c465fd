#include "tools/q7ctl/column_sets.h"

#include <gtest/gtest.h>

#include <sstream>

namespace q7ctl {
namespace {

// An aggregate row as the agent sends it: keys first, then 50-odd counters.
Json WideRow(const std::string& application, const std::string& transaction) {
  Json row = Json::object();
  row["applicatin"] = application;
  row["transactn"] = transaction;
  row["client"] = "2001:db8:c1:1::e22c:24";
  row["server"] = "2001:db8:5e::1";
  row["rootuuid"] = "CB7E718F9F6BBDDE6250D08730B9DFF7";
  row["timestamp"] = "1261127074000000";
  for (const char* name : {"pcfail", "pcslow", "pcgood", "pcavail"}) {
    row[name] = 33333;
  }
  for (const char* name : {"oatime", "failreq", "totreq", "slowreq", "succreq", "mrtthres",
                           "minrtt", "maxrtt", "clienttime", "netwtime", "servtime", "totbytes",
                           "reqbytes", "replybyt", "num2xx", "num4xx", "num5xx"}) {
    row[name] = 1234567;
  }
  return row;
}

TEST(ColumnSetsTest, EveryAggregateTableLeadsWithItsKeysAndFigures) {
  const std::vector<std::string> set = DefaultColumns("Q7TXSM");
  ASSERT_GE(set.size(), 5u);
  EXPECT_EQ((std::vector<std::string>{"applicatin", "transactn", "client", "server", "totreq"}),
            std::vector<std::string>(set.begin(), set.begin() + 5));
  EXPECT_EQ("timestamp", DefaultColumns("q7appot").front());  // over time: the interval first
  EXPECT_EQ(DefaultColumns("Q7APPSM"), DefaultColumns("q7appsm"));
  EXPECT_TRUE(DefaultColumns("Q7NOSUCH").empty());
}

TEST(ColumnSetsTest, SelectionKeepsTheOrderAskedAndTheRowsSpelling) {
  const Json rows = Json::array({WideRow("Shop", "Checkout"), Json::object({{"totreq", 5}})});
  std::vector<std::string> unknown;
  const Json picked = SelectColumns(rows, {"TOTREQ", "applicatin", "nosuch", "totreq"}, &unknown);
  ASSERT_EQ(2u, picked.size());
  EXPECT_EQ((std::vector<std::string>{"totreq", "applicatin"}), ColumnsOf(picked));
  EXPECT_EQ((std::vector<std::string>{"nosuch"}), unknown);
  EXPECT_EQ(Json::object({{"totreq", 5}}), picked[1]);  // a row lacking a column lacks it still
}

// The default set of the widest table, with long keys, still fits: the trailing figures go.
TEST(ColumnSetsTest, DefaultSetFitsTheLineWidthByDroppingTrailingColumns) {
  const Json rows = Json::array({WideRow("portal.customer-self-service.example", "Checkout"),
                                 WideRow("Shop", "/static/img/thumbs/44966.webp?size=large")});
  std::vector<std::string> unknown;
  FormatOptions options;
  options.max_line = kDefaultLineWidth;
  std::ostringstream out;
  const std::size_t dropped =
      WriteRows(SelectColumns(rows, DefaultColumns("Q7TXOT"), &unknown), options, out);
  EXPECT_TRUE(unknown.empty());
  EXPECT_GT(dropped, 0u);
  std::istringstream lines(out.str());
  std::string line;
  std::size_t count = 0;
  while (std::getline(lines, line)) {
    EXPECT_LE(line.size(), kDefaultLineWidth) << line;
    ++count;
  }
  EXPECT_EQ(3u, count);
  EXPECT_EQ(0u, out.str().find("timestamp"));
  EXPECT_LT(out.str().find("applicatin"), out.str().find("transactn"));
  // Without a limit nothing is dropped.
  std::ostringstream all;
  EXPECT_EQ(0u, WriteRows(rows, FormatOptions(), all));
  EXPECT_GT(all.str().find('\n'), kDefaultLineWidth);
}

}  // namespace
}  // namespace q7ctl
