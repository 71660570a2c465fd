// What every table's agent object shares: column descriptions, row tracing, filter conditions
// and handing rows to the request. Q7APPOT stands for all tables.

#include "q7tema/table_base.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <tuple>

#include "framework/trace_capture.h"
#include "q7tema/exported_tables.h"

namespace q7tema {
namespace {

using Op = fw::ConditionOp;

class TableBaseTest : public ::testing::Test {
 protected:
  TableBaseTest() : agent_(&request_, &manager_) {
    std::memset(&row_, 0, sizeof(row_));
    std::memcpy(row_.applicatin, "Shop  ", 6);  // blank padding, then NULs
    std::memcpy(row_.originnode, "node1:Q7", 8);
    row_.importance = -3;
    row_.dintval = 10;
  }

  fw::Request request_;
  kq7_q7appot_manager manager_;
  kq7_q7appot_agent agent_;
  kq7_q7appot_data_t row_;
};

// Indexes below 0 and beyond one past the last column are refused; one past the last describes
// nothing.
TEST_F(TableBaseTest, ColumnInfoAtTheEdges) {
  fw::ColumnInfo info;
  const int n = agent_.NumColumns();
  ASSERT_EQ(static_cast<int>(kq7_q7appot_columns.size()), n);
  EXPECT_EQ(0x21060007, agent_.GetColumnInfo(&info, -1));
  EXPECT_EQ(0x21060007, agent_.GetColumnInfo(&info, n + 1));
  ASSERT_EQ(0, agent_.GetColumnInfo(&info, 0));
  EXPECT_STREQ("applicatin", info.name);
  EXPECT_EQ((std::tuple{9, 128, 0}), std::tuple(info.type, info.width, info.offset));
  ASSERT_EQ(0, agent_.GetColumnInfo(&info, n - 1));
  EXPECT_STREQ("pct500", info.name);
  EXPECT_EQ((std::tuple{3, 4, 412}), std::tuple(info.type, info.width, info.offset));
  ASSERT_EQ(0, agent_.GetColumnInfo(&info, n));
  EXPECT_STREQ("", info.name);
  EXPECT_EQ(0, info.width);
}

// One line per column; a full-width string stops at its width, not at the next column.
TEST_F(TableBaseTest, PrintSelfTracesEveryColumn) {
  std::memset(row_.applicatin, 'a', sizeof(row_.applicatin));
  fw::TraceCapture capture("tables=DETAIL");
  agent_.PrintSelf(row_);
  EXPECT_EQ(agent_.NumColumns(), capture.count("PrintSelf: \t\t"));
  EXPECT_TRUE(capture.contains("\t\tapplicatin=\"" + std::string(128, 'a') + "\""));
  EXPECT_TRUE(capture.contains("\t\timportance=-3"));
  EXPECT_TRUE(capture.contains("\t\toriginnode=\"node1:Q7\""));
  EXPECT_TRUE(capture.contains("\t\ttimestamp=\"\""));
  EXPECT_TRUE(capture.contains("\t\tdintval=10"));
}

// Each operator on a string column (compared without padding, byte-wise, column named in any
// case) and on integer columns (compared numerically: 10 > 9, unlike "10" < "9"; 16-bit signed).
TEST_F(TableBaseTest, ConditionsOnStringsAndIntegers) {
  const struct {
    const char* column;
    Op op;
    const char* value;
    bool exception;
  } cases[] = {
      {"applicatin", Op::kEQ, "Shop", false},  {"APPLICATIN", Op::kEQ, "Shop  ", false},
      {"applicatin", Op::kEQ, "Sho", true},    {"applicatin", Op::kEQ, "shop", true},
      {"applicatin", Op::kNE, "Shop", true},   {"applicatin", Op::kNE, "Shops", false},
      {"applicatin", Op::kLT, "Shops", false}, {"applicatin", Op::kLT, "Shop", true},
      {"applicatin", Op::kLE, "Shop", false},  {"applicatin", Op::kLE, "Sho", true},
      {"applicatin", Op::kGT, "Sho", false},   {"applicatin", Op::kGT, "Shop", true},
      {"applicatin", Op::kGE, "Shop", false},  {"applicatin", Op::kGE, "Z", true},
      {"timestamp", Op::kEQ, "", false},       {"dintval", Op::kEQ, "10", false},
      {"dintval", Op::kEQ, "9", true},         {"dintval", Op::kNE, "9", false},
      {"dintval", Op::kNE, "10", true},        {"dintval", Op::kGT, "9", false},
      {"dintval", Op::kGT, "10", true},        {"dintval", Op::kGE, "10", false},
      {"dintval", Op::kGE, "11", true},        {"dintval", Op::kLT, "11", false},
      {"dintval", Op::kLT, "10", true},        {"dintval", Op::kLE, "10", false},
      {"dintval", Op::kLE, "9", true},         {"importance", Op::kLT, "0", false},
      {"importance", Op::kEQ, " -3 ", false},  {"importance", Op::kGT, "-3", true},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(c.exception, agent_.ColumnIsException(row_, {c.column, c.op, c.value, -1}))
        << c.column << " " << fw::ConditionOpName(c.op) << " \"" << c.value << "\"";
  }
  // Only value_length characters of the value count.
  EXPECT_FALSE(agent_.ColumnIsException(row_, {"applicatin", Op::kEQ, "Shopping", 4}));
}

// A condition that cannot be evaluated lets no row through, and says why.
TEST_F(TableBaseTest, UnusableConditionsExcludeTheRow) {
  fw::TraceCapture capture("tables=ERROR");
  EXPECT_TRUE(agent_.ColumnIsException(row_, {"nosuch", Op::kNE, "x", -1}));
  EXPECT_TRUE(capture.contains("Q7APPOT has no column \"nosuch\""));
  EXPECT_TRUE(agent_.ColumnIsException(row_, {"dintval", Op::kNE, "ten", -1}));
  EXPECT_TRUE(agent_.ColumnIsException(row_, {"dintval", Op::kNE, "", -1}));
  EXPECT_EQ(2, capture.count("not a whole number"));
}

// Rows are copied into the request in order; a different row size is refused.
TEST_F(TableBaseTest, AddDataKeepsRowsInTheRequest) {
  kq7_q7appot_data_t rows[2] = {row_, row_};
  rows[1].dintval = 20;
  ASSERT_EQ(fw::kOk, agent_.AddData(rows, 2));
  EXPECT_EQ(fw::kInvalidArgument, agent_.AddData(rows, -1));
  EXPECT_EQ(fw::kInvalidArgument, fw::AddRows(&request_, rows, sizeof(rows[0]) - 2, 1));
  ASSERT_EQ(2, request_.row_count());
  kq7_q7appot_data_t second;
  std::memcpy(&second, request_.rows.data() + sizeof(second), sizeof(second));
  EXPECT_EQ(20, second.dintval);
}

}  // namespace
}  // namespace q7tema
