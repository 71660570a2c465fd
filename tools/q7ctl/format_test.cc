// q7ctl's output: the aligned table, CSV quoting, JSON passthrough and the streamed form.

#include "tools/q7ctl/format.h"

#include <gtest/gtest.h>

#include <sstream>
#include <string>

namespace q7ctl {
namespace {

std::string Render(const Json& rows, OutputFormat format, bool wide = false,
                   std::size_t max_width = 40, const Json& items = nullptr) {
  FormatOptions options;
  options.format = format;
  options.wide = wide;
  options.max_width = max_width;
  std::ostringstream out;
  WriteRows(rows, options, out, items);
  return out.str();
}

Json Rows() {
  return Json::parse(R"([
    {"applicatin": "Shop", "totreq": 7, "avgresp": 1.5},
    {"applicatin": "Warehouse", "totreq": 12345, "avgresp": null}
  ])");
}

// Text left, numbers right, header over each; no blanks at line ends; column order kept.
TEST(FormatTableTest, AlignsTextLeftAndNumbersRight) {
  EXPECT_EQ(
      "applicatin  totreq  avgresp\n"
      "Shop             7      1.5\n"
      "Warehouse    12345\n",
      Render(Rows(), OutputFormat::kTable));
}

// Long text is cut to the width with "...", never inside a UTF-8 character; --wide keeps it;
// numbers are never cut; control characters cannot break a line.
TEST(FormatTableTest, TruncatesWideTextUnlessWide) {
  const Json rows = Json::parse(R"([{"url": "/a/very/long/path", "n": 1234567890123},
                                    {"url": "caf\u00e9s-\u00e9t\u00e9s!", "n": 1},
                                    {"url": "two\nlines", "n": 2}])");
  EXPECT_EQ(
      "url                     n\n"
      "/a/very...  1234567890123\n"
      "caf\u00e9s-\u00e9...              1\n"
      "two\\nlines              2\n",
      Render(rows, OutputFormat::kTable, false, 10));
  EXPECT_NE(std::string::npos,
            Render(rows, OutputFormat::kTable, true, 10).find("/a/very/long/path"));
}

// Rows that differ in attributes share one header; missing cells stay empty.
TEST(FormatTableTest, UnionOfColumnsInFirstSeenOrder) {
  const Json rows = Json::parse(R"([{"b": "x"}, {"a": "y", "b": "z"}])");
  EXPECT_EQ("b  a\nx\nz  y\n", Render(rows, OutputFormat::kTable));
  EXPECT_EQ("", Render(Json::array(), OutputFormat::kTable));
}

// Fields with commas, quotes or line breaks are quoted and their quotes doubled.
TEST(FormatCsvTest, QuotesPerRfc4180) {
  EXPECT_EQ("plain", CsvField("plain"));
  EXPECT_EQ("\"a,b\"", CsvField("a,b"));
  EXPECT_EQ("\"say \"\"hi\"\"\"", CsvField("say \"hi\""));
  EXPECT_EQ("\"two\nlines\"", CsvField("two\nlines"));
  EXPECT_EQ("\"cr\r\"", CsvField("cr\r"));
  const Json rows = Json::parse(R"([{"name": "a,b", "n": 3, "flag": true, "x": null}])");
  EXPECT_EQ("name,n,flag,x\n\"a,b\",3,true,\n", Render(rows, OutputFormat::kCsv));
}

// JSON output is the reply's own objects, in their order, not the table's summary rows.
TEST(FormatJsonTest, PassesItemsThrough) {
  EXPECT_EQ(Rows(), Json::parse(Render(Rows(), OutputFormat::kJson)));
  const std::string text = Render(Rows(), OutputFormat::kJson);
  EXPECT_LT(text.find("applicatin"), text.find("totreq"));
  const Json items = Json::parse(R"([{"name": "T", "columns": [{"name": "c"}]}])");
  EXPECT_EQ(items, Json::parse(Render(Rows(), OutputFormat::kJson, false, 40, items)));
}

// A stream keeps the first batch's columns, prints one row per event, and prints the header
// again only when an event brings new attributes.
TEST(StreamWriterTest, PrintsEventsAsTheyCome) {
  FormatOptions options;
  std::ostringstream out;
  StreamWriter writer(options, out);
  writer.Begin(Json::array());
  writer.Write(Json::parse(R"({"msg": "started", "n": 1})"));
  writer.Write(Json::parse(R"({"msg": "a much longer message", "n": 22})"));
  writer.Write(Json::parse(R"({"msg": "x", "n": 3, "extra": "e"})"));
  EXPECT_EQ(
      "msg      n\n"
      "started  1\n"
      "a much longer message  22\n"
      "msg      n  extra\n"
      "x        3  e\n",
      out.str());

  options.format = OutputFormat::kJson;
  std::ostringstream json;
  StreamWriter json_writer(options, json);
  json_writer.Begin(Json::parse(R"([{"a": 1}])"));
  json_writer.Write(Json::parse(R"({"a": 2})"));
  EXPECT_EQ("{\"a\":1}\n{\"a\":2}\n", json.str());
}

}  // namespace
}  // namespace q7ctl
