// The table registry: order, refusals and readers running alongside registration.

#include "framework/tables.h"

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "framework/status.h"
#include "framework/trace_capture.h"

namespace fw {
namespace {

class NullManager : public TableManager {
 public:
  std::unique_ptr<TableAgent> CreateAgent(Request*) override { return nullptr; }
  void EventArrived(Request&) override {}
  void AddDataToEvent(Request&, const void*, int) override {}
};

// A 12-byte row: 6 characters of text, then an integer at 8.
TableDefinition Table(const std::string& name,
                      std::vector<ColumnInfo> columns = {{"text", kColumnTypeString, 6, 0},
                                                         {"count", kColumnTypeInt32, 4, 8}}) {
  return TableDefinition{name, std::move(columns), 12, std::make_unique<NullManager>(), {}, false};
}

class TablesTest : public ::testing::Test {
 protected:
  void SetUp() override { ResetTablesForTesting(); }
  void TearDown() override { ResetTablesForTesting(); }
};

// Registration order is listing order; names are found in any case.
TEST_F(TablesTest, KeepsOrderAndFindsInAnyCase) {
  for (const char* name : {"ZETA", "ALPHA", "MIDDLE"}) {
    ASSERT_EQ(kOk, RegisterTable(Table(name)));
  }
  const auto tables = ListTables();
  ASSERT_EQ(3u, tables.size());
  EXPECT_EQ("ZETA", tables[0]->name);
  EXPECT_EQ("MIDDLE", tables[2]->name);
  ASSERT_NE(nullptr, FindTable("alpha"));
  EXPECT_EQ(tables[1], FindTable("alpha"));
  EXPECT_EQ(nullptr, FindTable("BETA"));
  EXPECT_EQ(8, FindColumn(tables[1]->columns, "COUNT")->offset);
  EXPECT_EQ(nullptr, FindColumn(tables[1]->columns, "cou"));
}

// A second table of the same name (in any case) is refused and traced; the first stays.
TEST_F(TablesTest, RefusesDuplicates) {
  ASSERT_EQ(kOk, RegisterTable(Table("Q7APPOT")));
  TraceCapture capture("tables=ERROR");
  EXPECT_EQ(kAlreadyExists, RegisterTable(Table("q7appot", {{"other", kColumnTypeInt16, 2, 0}})));
  EXPECT_TRUE(capture.contains("table q7appot refused: it is already registered"));
  ASSERT_EQ(1u, ListTables().size());
  EXPECT_STREQ("text", ListTables()[0]->columns[0].name);
}

// Definitions whose rows the framework could not read are refused.
TEST_F(TablesTest, RefusesUnusableDefinitions) {
  TraceCapture capture("tables=ERROR");
  EXPECT_EQ(kInvalidArgument, RegisterTable(Table("")));
  EXPECT_EQ(kInvalidArgument, RegisterTable(Table("EMPTY", {})));
  EXPECT_EQ(kInvalidArgument, RegisterTable(Table("PAST", {{"text", kColumnTypeString, 13, 0}})));
  EXPECT_EQ(kInvalidArgument, RegisterTable(Table("WIDE", {{"n", kColumnTypeInt32, 2, 0}})));
  EXPECT_EQ(kInvalidArgument, RegisterTable(Table("TYPE", {{"n", 7, 4, 0}})));
  EXPECT_EQ(kInvalidArgument,
            RegisterTable(TableDefinition{"NONE", {{"n", 5, 2, 0}}, 2, {}, {}, false}));
  EXPECT_TRUE(ListTables().empty());
  EXPECT_TRUE(capture.contains("text does not lie within the 12-byte row"));
}

// Readers listing while tables register always see a prefix of the registration order.
TEST_F(TablesTest, ReadersSeeConsistentPrefixes) {
  std::atomic<bool> done{false};
  std::atomic<int> bad{0};
  std::vector<std::thread> readers;
  for (int r = 0; r < 4; ++r) {
    readers.emplace_back([&] {
      while (!done) {
        const auto tables = ListTables();
        for (std::size_t i = 0; i < tables.size(); ++i) {
          bad += tables[i]->name != "T" + std::to_string(i) ? 1 : 0;
        }
      }
    });
  }
  for (int i = 0; i < 200; ++i) {
    RegisterTable(Table("T" + std::to_string(i)));
  }
  done = true;
  for (auto& reader : readers) {
    reader.join();
  }
  EXPECT_EQ(0, bad);
  EXPECT_EQ(200u, ListTables().size());
}

}  // namespace
}  // namespace fw
