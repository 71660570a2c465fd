// The loader registers all 23 exported tables with the framework, in load order, once.

#include "q7tema/exported_tables.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "framework/tables.h"
#include "framework/trace_capture.h"
#include "q7tema/table_registry.h"

namespace q7tema {
namespace {

class ExportedTablesTest : public ::testing::Test {
 protected:
  void SetUp() override { fw::ResetTablesForTesting(); }
  void TearDown() override {
    fw::ResetTablesForTesting();
  }
};

// A second load is refused per table with a trace, not a crash, and changes nothing.
TEST_F(ExportedTablesTest, RegistersEveryTableInLoadOrderOnce) {
  EXPECT_EQ(23, InitAllTables());
  std::vector<std::string> names;
  for (const auto& table : fw::ListTables()) {
    names.push_back(table->name);
  }
  const std::vector<std::string> expected{
      "Q7AGNTDTS",  "Q7AGNTMSGS", "Q7APPOT",   "Q7APPSM",    "Q7CLNTAPP", "Q7CLNTOT",
      "Q7CLNTPTNS", "Q7CLNTSM",   "Q7CLNTSRV", "Q7SRVAPPSM", "Q7SRVOT",   "Q7SRVSM",
      "Q7TXINS",    "Q7TXOT",     "Q7TXPTNS",  "Q7TXSM",     "Q7TXCS",    "Q7APPCS",
      "Q7CLNTCS",   "Q7SRVCS",    "Q7SUBTXSM", "Q7SUBTXOT",  "Q7SUBTXINS"};
  EXPECT_EQ(expected, names);
  const auto txptns = fw::FindTable("Q7TXPTNS");
  ASSERT_NE(nullptr, txptns);
  EXPECT_EQ(sizeof(kq7_q7txptns_data_t), txptns->row_size);
  EXPECT_EQ(kq7_q7txptns_columns.size(), txptns->columns.size());

  fw::TraceCapture capture("tables=ERROR");
  InitAllTables();
  EXPECT_EQ(23u, fw::ListTables().size());
  EXPECT_EQ(23, capture.count("already registered"));
  EXPECT_EQ(txptns, fw::FindTable("Q7TXPTNS"));
}

// The manager makes agent objects bound to the request; sampling adds no rows yet.
TEST_F(ExportedTablesTest, ManagerCreatesAgentsForRequests) {
  kq7_q7agntmsgs_init();
  const auto table = fw::FindTable("q7agntmsgs");
  ASSERT_NE(nullptr, table);
  fw::Request request;
  std::unique_ptr<fw::TableAgent> agent = table->manager->CreateAgent(&request);
  auto* typed = dynamic_cast<kq7_q7agntmsgs_agent*>(agent.get());
  ASSERT_NE(nullptr, typed);
  EXPECT_EQ(&request, typed->request());
  EXPECT_EQ(table->manager.get(), typed->manager());
  agent->TakeSampleConstructor();
  agent->TakeSample();
  agent->TakeSampleDestructor();
  EXPECT_EQ(0, request.row_count());
}

}  // namespace
}  // namespace q7tema
