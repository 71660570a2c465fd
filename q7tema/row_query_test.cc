// How a row table's agent object gets its rows (the registered row query) and what its
// constructor traces. Q7TXOT stands for all tables.

#include "q7tema/row_query.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "framework/trace_capture.h"
#include "q7tema/exported_tables.h"

namespace q7tema {
namespace {

using Row = kq7_q7txot_data_t;

class RowQueryTest : public ::testing::Test {
 protected:
  void TearDown() override { SetRowQuery<Row>({}); }

  // Runs one request of the given type through a fresh agent object.
  void Serve(int type, std::vector<fw::Condition> conditions = {}) {
    request_ = fw::Request{};
    request_.type = type;
    request_.conditions = std::move(conditions);
    std::unique_ptr<fw::TableAgent> agent = manager_.CreateAgent(&request_);
    agent->TakeSampleConstructor();
    agent->TakeSample();
    agent->TakeSampleDestructor();
  }

  Row RowAt(int index) const {
    Row row;
    std::memcpy(&row, request_.rows.data() + index * sizeof(Row), sizeof(Row));
    return row;
  }

  kq7_q7txot_manager manager_;
  fw::Request request_;
};

// The query's rows reach the request in order; the request type goes to the query unchanged.
TEST_F(RowQueryTest, QueryRowsReachTheRequest) {
  std::vector<int> types;
  SetRowQuery<Row>([&types](int sample_type, int* count) {
    types.push_back(sample_type);
    *count = 2;
    Row* rows = new Row[2]{};
    std::strcpy(rows[0].applicatin, "Shop");
    rows[0].totreq = 7;
    rows[1].totreq = sample_type;
    return rows;
  });
  Serve(3);
  ASSERT_EQ(2, request_.row_count());
  EXPECT_STREQ("Shop", RowAt(0).applicatin);
  EXPECT_EQ(7, RowAt(0).totreq);
  for (int type : {1, 4, 7, 0, -2}) {
    Serve(type);
    EXPECT_EQ(type, RowAt(1).totreq);
  }
  EXPECT_EQ((std::vector<int>{3, 1, 4, 7, 0, -2}), types);
}

// A null array, an empty one, and no query at all each add nothing.
TEST_F(RowQueryTest, NoRowsWithoutAnArrayOrAQuery) {
  SetRowQuery<Row>([](int, int* count) -> Row* {
    *count = 3;
    return nullptr;
  });
  Serve(3);
  EXPECT_EQ(0, request_.row_count());
  SetRowQuery<Row>([](int, int* count) {
    *count = 0;
    return new Row[1]{};
  });
  Serve(3);
  EXPECT_EQ(0, request_.row_count());
  SetRowQuery<Row>({});
  Serve(3);
  EXPECT_EQ(0, request_.row_count());
}

// A query that takes a limit hears the request's only when no condition is left for the
// framework to apply afterwards; read back as a plain query, it is asked for every row.
TEST_F(RowQueryTest, LimitReachesTheQueryOnlyWithoutConditions) {
  std::vector<std::size_t> limits;
  SetLimitedRowQuery<Row>([&limits](int, std::size_t limit, int* count) {
    limits.push_back(limit);
    *count = 1;
    return new Row[1]{};
  });
  request_ = fw::Request{};
  request_.type = 3;
  request_.row_limit = 5;
  manager_.CreateAgent(&request_)->TakeSample();
  request_.conditions = {{"applicatin", fw::ConditionOp::kEQ, "Shop", -1}};
  manager_.CreateAgent(&request_)->TakeSample();
  int count = 0;
  std::unique_ptr<Row[]>(RowQueryFor<Row>()(3, &count));
  EXPECT_EQ((std::vector<std::size_t>{5, fw::kNoRowLimit, fw::kNoRowLimit}), limits);
  EXPECT_EQ(2, request_.row_count());
}

// A type-1 request's conditions are traced by column; OATIME and PCGOOD also by value.
TEST_F(RowQueryTest, TypeOneConstructorTracesTheConditions) {
  fw::TraceCapture capture("tables=DETAIL");
  Serve(1, {{"APPLICATIN", fw::ConditionOp::kEQ, "Shop", -1},
            {"oatime", fw::ConditionOp::kGT, "250", -1},
            {"PcGood", fw::ConditionOp::kLT, "905", 2}});
  EXPECT_TRUE(capture.contains("kq7txot:: Column Name=APPLICATIN"));
  EXPECT_TRUE(capture.contains("kq7txot:: Column Name=oatime"));
  EXPECT_TRUE(capture.contains("kq7txot:: Column Name=PcGood"));
  EXPECT_TRUE(capture.contains("kq7txot:: Column Value=250"));
  // value_length cuts "905" to "90".
  const std::vector<std::string> lines = capture.lines();
  EXPECT_TRUE(std::any_of(lines.begin(), lines.end(), [](const std::string& line) {
    return line.ends_with("Column Value=90") || line.ends_with("Column Value=90\n");
  }));
  EXPECT_EQ(2, capture.count("Column Value="));

  capture.clear();
  Serve(3, {{"oatime", fw::ConditionOp::kGT, "250", -1}});
  EXPECT_EQ(0, capture.count("Column Name="));
}

}  // namespace
}  // namespace q7tema
