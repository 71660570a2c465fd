// Sampling a table: the framework's request to the agent object, its filtering, the answer's
// JSON and CSV forms, and GET /api/v1/tables/{TABLE} on a real server.

#include "framework/table_sample.h"

#include <gtest/gtest.h>
#include <httplib.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <limits>
#include <memory>
#include <nlohmann/json.hpp>
#include <random>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "framework/http_server.h"
#include "framework/row_filter.h"
#include "framework/sample_query.h"
#include "framework/status.h"
#include "framework/trace_capture.h"

namespace fw {
namespace {

using Op = ConditionOp;

// Padding differs per row on purpose: NULs, blanks, or none (a full-width "Warehouse").
struct FakeRow {
  char name[9];
  std::int16_t delta;
  char note[12];
  std::int32_t count;
};

FakeRow Row(const char* name, std::int16_t delta, const char* note, std::int32_t count) {
  FakeRow row;
  std::memset(&row, 0, sizeof(row));
  std::memcpy(row.name, name, std::min(std::strlen(name), sizeof(row.name)));
  std::memcpy(row.note, note, std::min(std::strlen(note), sizeof(row.note)));
  row.delta = delta;
  row.count = count;
  return row;
}

constexpr int Offset(std::size_t offset) {
  return static_cast<int>(offset);
}

// What the fake agent objects hand over and what they saw; reset by the fixture.
struct FakeState {
  std::vector<FakeRow> rows;
  std::size_t row_size = sizeof(FakeRow);
  std::vector<std::string> calls;
  int request_type = 0;
  std::size_t request_conditions = 0;
  std::size_t request_row_limit = 0;
};
FakeState fake;

class FakeAgent : public TableAgent {
 public:
  explicit FakeAgent(Request* request) : request_(request) {}
  void TakeSampleConstructor() override { fake.calls.push_back("constructor"); }
  void TakeSample() override {
    fake.calls.push_back("sample");
    fake.request_type = request_->type;
    fake.request_conditions = request_->conditions.size();
    fake.request_row_limit = request_->row_limit;
    // Would deadlock if the sample held the registry's lock.
    FindTable("FAKE");
    AddRows(request_, fake.rows.data(), fake.row_size, static_cast<int>(fake.rows.size()));
  }
  void TakeSampleDestructor() override { fake.calls.push_back("destructor"); }

 private:
  Request* request_;
};

class FakeManager : public TableManager {
 public:
  std::unique_ptr<TableAgent> CreateAgent(Request* request) override {
    return std::make_unique<FakeAgent>(request);
  }
  void EventArrived(Request&) override {}
  void AddDataToEvent(Request&, const void*, int) override {}
};

class TableSampleTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ResetTablesForTesting();
    fake = FakeState{};
    fake.rows = {Row("Shop", -3, "a,b", 7), Row("Bank  ", 5, "say \"hi\"", 12),
                 Row("Shop", 100, "", -1), Row("Warehouse", -32768, "line\nend", 0)};
    TableDefinition table{"FAKE",
                          {{"name", kColumnTypeString, 9, Offset(offsetof(FakeRow, name))},
                           {"delta", kColumnTypeInt16, 2, Offset(offsetof(FakeRow, delta))},
                           {"note", kColumnTypeLongText, 12, Offset(offsetof(FakeRow, note))},
                           {"count", kColumnTypeInt32, 4, Offset(offsetof(FakeRow, count))}},
                          sizeof(FakeRow),
                          std::make_unique<FakeManager>(),
                          {},
                          false};
    ASSERT_EQ(kOk, RegisterTable(std::move(table)));
  }
  void TearDown() override { ResetTablesForTesting(); }

  // The count column of each qualifying row, in order.
  std::vector<int> Counts(std::vector<Condition> conditions) {
    Sample sample;
    std::string error;
    EXPECT_EQ(kOk, SampleTable("fake", std::move(conditions), &sample, &error)) << error;
    std::vector<int> counts;
    for (int i = 0; i < sample.row_count(); ++i) {
      counts.push_back(ColumnInteger(sample.row(i), sample.table->columns[3]));
    }
    return counts;
  }

  Sample Everything() {
    Sample sample;
    std::string error;
    EXPECT_EQ(kOk, SampleTable("FAKE", {}, &sample, &error)) << error;
    return sample;
  }
};

// The agent object serves a type-3 request in the documented order, with the conditions; the
// framework applies them afterwards.
TEST_F(TableSampleTest, ServesATypeThreeRequest) {
  EXPECT_EQ((std::vector<int>{7, -1}), Counts({{"NAME", Op::kEQ, "Shop", -1}}));
  EXPECT_EQ((std::vector<std::string>{"constructor", "sample", "destructor"}), fake.calls);
  EXPECT_EQ(3, fake.request_type);
  EXPECT_EQ(1u, fake.request_conditions);
  EXPECT_EQ((std::vector<int>{7, 12, -1, 0}), Counts({}));
}

// Each operator on a text column (without padding) and on a 16-bit integer column; several
// conditions must all hold.
TEST_F(TableSampleTest, FiltersWithEveryOperator) {
  const struct {
    const char* column;
    Op op;
    const char* value;
    std::vector<int> counts;
  } cases[] = {
      {"name", Op::kEQ, "Bank", {12}},       {"name", Op::kNE, "Shop", {12, 0}},
      {"name", Op::kLT, "Shop", {12}},       {"name", Op::kLE, "Shop", {7, 12, -1}},
      {"name", Op::kGT, "Shop", {0}},        {"name", Op::kGE, "Shop", {7, -1, 0}},
      {"name", Op::kEQ, "Warehouse", {0}},   {"delta", Op::kEQ, "-3", {7}},
      {"delta", Op::kNE, "-3", {12, -1, 0}}, {"delta", Op::kLT, "-3", {0}},
      {"delta", Op::kLE, "-3", {7, 0}},      {"delta", Op::kGT, "5", {-1}},
      {"delta", Op::kGE, "5", {12, -1}},     {"count", Op::kGT, "9", {12}},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(c.counts, Counts({{c.column, c.op, c.value, -1}}))
        << c.column << " " << ConditionOpName(c.op) << " " << c.value;
  }
  EXPECT_EQ((std::vector<int>{-1}),
            Counts({{"name", Op::kEQ, "Shop", -1}, {"delta", Op::kGT, "0", -1}}));
}

TEST_F(TableSampleTest, RefusesWhatCannotBeServed) {
  Sample sample;
  std::string error;
  EXPECT_EQ(kNotFound, SampleTable("NOPE", {}, &sample, &error));
  EXPECT_EQ("no table named NOPE", error);
  EXPECT_EQ(kInvalidArgument, SampleTable("FAKE", {{"nosuch", Op::kEQ, "1", -1}}, &sample, &error));
  EXPECT_TRUE(fake.calls.empty()) << "a bad condition must not cost a sample";
  fake.row_size = sizeof(FakeRow) - 2;
  TraceCapture capture("tables=ERROR");
  EXPECT_EQ(kInvalidArgument, SampleTable("FAKE", {}, &sample, &error));
  EXPECT_NE(std::string::npos, error.find("-byte rows")) << error;
  EXPECT_TRUE(capture.contains("sample refused"));
}

// Keys in column order, text without NUL or blank padding, a full-width text whole, and
// 16-bit integers sign-extended.
TEST_F(TableSampleTest, JsonDecodesRowsThroughTheColumns) {
  Sample sample = Everything();
  sample.Truncate(99);  // more than there are: all stay
  const nlohmann::ordered_json body = SampleToJson(sample);
  EXPECT_EQ(R"({"table":"FAKE","rows":[)"
            R"({"name":"Shop","delta":-3,"note":"a,b","count":7},)"
            R"({"name":"Bank","delta":5,"note":"say \"hi\"","count":12},)"
            R"({"name":"Shop","delta":100,"note":"","count":-1},)"
            R"({"name":"Warehouse","delta":-32768,"note":"line\nend","count":0}]})",
            body.dump());
  sample.Truncate(0);
  EXPECT_EQ(R"({"table":"FAKE","rows":[]})", SampleToJson(sample).dump());
}

// The answer written straight from the rows is the document tree's dump, byte for byte: random
// rows whose text needs escaping, holds UTF-8 (valid, cut short or invalid), or is padded, and
// a column name given twice (the later column's value, at the first's place).
TEST(SampleJsonTextTest, IsTheDocumentDumped) {
  struct Wide {
    char name[9];
    std::int16_t delta;
    char note[24];
    std::int32_t count;
    char tail[5];
  };
  auto table = std::make_shared<TableDefinition>();
  table->name = "WIDE \"x\"";
  table->columns = {{"name", kColumnTypeString, 9, Offset(offsetof(Wide, name))},
                    {"delta", kColumnTypeInt16, 2, Offset(offsetof(Wide, delta))},
                    {"note", kColumnTypeLongText, 24, Offset(offsetof(Wide, note))},
                    {"count", kColumnTypeInt32, 4, Offset(offsetof(Wide, count))},
                    {"name", kColumnTypeString, 5, Offset(offsetof(Wide, tail))}};
  table->row_size = sizeof(Wide);
  const std::vector<std::string> pieces = {
      "a",    "Z",    " ",        "\"",       "\\",           "\n",
      "\t",   "\x01", "\x7f",     "\xc3\xa9", "\xe2\x82\xac", "\xf0\x9f\x98\x80",
      "\x80", "\xc3", "\xe2\x82", "\xff",     "\xed\xa0\x80", std::string(1, '\0')};
  std::mt19937 rng(1);
  auto fill = [&](char* field, std::size_t width) {
    std::string text;
    for (int n = static_cast<int>(rng() % 8); n > 0; --n) {
      text += pieces[rng() % pieces.size()];
    }
    text.resize(std::min(text.size(), width));
    std::memset(field, rng() % 2 == 0 ? '\0' : ' ', width);
    std::memcpy(field, text.data(), text.size());
  };
  for (int round = 0; round < 500; ++round) {
    Sample sample;
    sample.table = table;
    for (int r = static_cast<int>(rng() % 6); r > 0; --r) {
      Wide row;
      std::memset(&row, 0, sizeof(row));
      fill(row.name, sizeof(row.name));
      fill(row.note, sizeof(row.note));
      fill(row.tail, sizeof(row.tail));
      row.delta = static_cast<std::int16_t>(rng());
      row.count = rng() % 5 == 0 ? std::numeric_limits<std::int32_t>::min()
                                 : static_cast<std::int32_t>(rng());
      const auto* bytes = reinterpret_cast<const std::byte*>(&row);
      sample.rows.insert(sample.rows.end(), bytes, bytes + sizeof(row));
    }
    const std::string want =
        SampleToJson(sample).dump(2, ' ', false, nlohmann::ordered_json::error_handler_t::replace) +
        "\n";
    ASSERT_EQ(want, SampleToJsonText(sample)) << "round " << round;
    // Written in pieces of any size, as a streamed reply is, the text is the same.
    SampleJsonWriter writer(sample);
    std::string pieces;
    const int rows = static_cast<int>(rng() % 3);
    while (writer.Next(&pieces, rows)) {
    }
    ASSERT_EQ(want, pieces) << "round " << round << ", " << rows << " rows a piece";
    EXPECT_FALSE(writer.Next(&pieces, rows));
    EXPECT_EQ(want, pieces);
  }
}

// A limit keeps the first rows that qualify, the same rows as cutting the whole sample, and the
// agent object is told it.
TEST_F(TableSampleTest, LimitKeepsTheFirstQualifyingRows) {
  const std::vector<std::vector<Condition>> filters = {
      {}, {{"name", Op::kEQ, "Shop", -1}}, {{"count", Op::kGE, "0", -1}}};
  for (const auto& conditions : filters) {
    Sample whole;
    std::string error;
    ASSERT_EQ(kOk, SampleTable("FAKE", conditions, &whole, &error)) << error;
    for (std::size_t limit = 0; limit <= 5; ++limit) {
      Sample limited;
      ASSERT_EQ(kOk, SampleTable("FAKE", conditions, &limited, &error, limit)) << error;
      Sample cut = whole;
      cut.Truncate(limit);
      EXPECT_EQ(cut.rows, limited.rows) << conditions.size() << " conditions, limit " << limit;
      EXPECT_EQ(limit, fake.request_row_limit);
    }
  }
}

TEST_F(TableSampleTest, CsvQuotesWhatNeedsIt) {
  Sample sample = Everything();
  EXPECT_EQ(
      "name,delta,note,count\n"
      "Shop,-3,\"a,b\",7\n"
      "Bank,5,\"say \"\"hi\"\"\",12\n"
      "Shop,100,,-1\n"
      "Warehouse,-32768,\"line\nend\",0\n",
      SampleToCsv(sample));
  sample.Truncate(0);
  EXPECT_EQ("name,delta,note,count\n", SampleToCsv(sample));
}

// Column and operator in any case; the value is everything after the second blank.
TEST_F(TableSampleTest, ParsesWhereClauses) {
  const auto columns = FindTable("FAKE")->columns;
  Condition condition;
  std::string error;
  ASSERT_EQ(kOk, ParseWhere("NAME ne Big  Shop ", columns, &condition, &error));
  EXPECT_EQ("name", condition.column);
  EXPECT_EQ(Op::kNE, condition.op);
  EXPECT_EQ("Big  Shop ", condition.value);
  ASSERT_EQ(kOk, ParseWhere("Delta Ge -7", columns, &condition, &error));
  EXPECT_EQ(Op::kGE, condition.op);
}

// Where clauses refused here are covered over HTTP below; limit's edges are checked here.
TEST_F(TableSampleTest, ParsesLimitAndFormat) {
  std::size_t limit = 1;
  std::string error;
  ASSERT_EQ(kOk, ParseLimit("0", &limit, &error));
  EXPECT_EQ(0u, limit);
  for (const char* bad : {"", "-1", "+1", "2x", " 2", "99999999999999999999999"}) {
    EXPECT_EQ(kInvalidArgument, ParseLimit(bad, &limit, &error)) << bad;
  }
  SampleFormat format = SampleFormat::kJson;
  ASSERT_EQ(kOk, ParseSampleFormat("csv", &format, &error));
  EXPECT_EQ(SampleFormat::kCsv, format);
}

// The endpoint on a real server: its answers and each kind of refusal.
class SampleEndpointTest : public TableSampleTest {
 protected:
  void SetUp() override {
    TableSampleTest::SetUp();
    std::string error;
    ASSERT_EQ(kOk, server_.Start("127.0.0.1:0", &error)) << error;
    client_ = std::make_unique<httplib::Client>("http://" + server_.bound_address());
  }
  void TearDown() override {
    server_.Stop();
    TableSampleTest::TearDown();
  }

  // The status, and the body's "error" text or the whole body.
  std::pair<int, std::string> Get(const std::string& path) {
    auto res = client_->Get(path.c_str());
    if (!res) {
      return {-1, ""};
    }
    const auto json = nlohmann::json::parse(res->body, nullptr, false);
    if (json.is_object() && json.contains("error")) {
      return {res->status, json["error"].get<std::string>()};
    }
    return {res->status, res->body};
  }

  HttpServer server_;
  std::unique_ptr<httplib::Client> client_;
};

TEST_F(SampleEndpointTest, AnswersFilteredLimitedSamples) {
  auto [status, body] = Get("/api/v1/tables/fake?where=NAME%20eq%20Shop&limit=1");
  ASSERT_EQ(200, status) << body;
  EXPECT_EQ(nlohmann::json::parse(
                R"({"table":"FAKE","rows":[{"name":"Shop","delta":-3,"note":"a,b","count":7}]})"),
            nlohmann::json::parse(body));
  std::tie(status, body) =
      Get("/api/v1/tables/FAKE?format=csv&where=delta%20GT%200&where=count%20LT%2050");
  EXPECT_EQ(200, status);
  EXPECT_EQ("name,delta,note,count\nBank,5,\"say \"\"hi\"\"\",12\nShop,100,,-1\n", body);
}

// A sample too large for one piece is sent in chunks as it is written, and arrives whole.
TEST_F(SampleEndpointTest, LargeSamplesArriveWhole) {
  fake.rows.clear();
  for (int i = 0; i < 1500; ++i) {
    const std::string name = "row" + std::to_string(i);
    fake.rows.push_back(
        Row(name.c_str(), static_cast<std::int16_t>(i % 100), i % 7 == 0 ? "q\"uote" : "", i));
  }
  Sample sample;
  std::string error;
  ASSERT_EQ(kOk, SampleTable("FAKE", {}, &sample, &error)) << error;
  auto res = client_->Get("/api/v1/tables/FAKE");
  ASSERT_TRUE(res);
  ASSERT_EQ(200, res->status);
  EXPECT_EQ(SampleToJsonText(sample), res->body);
  EXPECT_EQ("application/json", res->get_header_value("Content-Type"));
}

// Rows need not be valid UTF-8; the answer still goes out.
TEST_F(SampleEndpointTest, InvalidUtf8InRowsIsReplaced) {
  fake.rows = {Row("Caf\xe9", 0, "", 1)};
  const auto [status, body] = Get("/api/v1/tables/FAKE");
  ASSERT_EQ(200, status) << body;
  EXPECT_EQ("Caf\xef\xbf\xbd", nlohmann::json::parse(body)["rows"][0].value("name", ""));
}

TEST_F(SampleEndpointTest, RefusesWithJsonErrors) {
  EXPECT_EQ((std::pair<int, std::string>{404, "no table named NOPE"}), Get("/api/v1/tables/NOPE"));
  EXPECT_EQ(404, Get("/api/v1/tables/NO-PE").first);  // not a table name at all
  const struct {
    const char* query;
    const char* names;  // what the error must mention
  } cases[] = {
      {"where=name%20EQ", "COLUMN OP VALUE"},
      {"where=size%20EQ%201", "unknown column \"size\""},
      {"where=name%20IS%20x", "unknown operator \"IS\""},
      {"where=count%20GT%20many", "not a whole number"},
      {"where=name%20EQ%20x&where=count", "COLUMN OP VALUE"},
      {"limit=-1", "limit"},
      {"limit=1&limit=2", "more than once"},
      {"format=xml", "format \"xml\""},
  };
  for (const auto& c : cases) {
    const auto [status, error] = Get(std::string("/api/v1/tables/FAKE?") + c.query);
    EXPECT_EQ(400, status) << c.query;
    EXPECT_NE(std::string::npos, error.find(c.names)) << c.query << ": " << error;
  }
  EXPECT_TRUE(fake.calls.empty()) << "a refused request must not cost a sample";
}

}  // namespace
}  // namespace fw
