// The agent loader initialises registered tables in load order and skips absent ones.

#include "q7tema/table_registry.h"

#include <gtest/gtest.h>

#include <string>

namespace q7tema {
namespace {

std::string g_calls;

TEST(TableRegistryTest, InitialisesRegisteredTablesInLoadOrder) {
  g_calls.clear();
  // Registered out of order on purpose: the load order decides.
  ASSERT_TRUE(RegisterTableInit("q7subtxins", [] { g_calls += "subtxins "; }));
  ASSERT_TRUE(RegisterTableInit("q7agntdts", [] { g_calls += "agntdts "; }));
  ASSERT_TRUE(RegisterTableInit("q7txcs", [] { g_calls += "txcs "; }));
  EXPECT_FALSE(RegisterTableInit("q7nosuch", [] {}));
  EXPECT_EQ(3, InitAllTables());
  EXPECT_EQ("agntdts txcs subtxins ", g_calls);
}

}  // namespace
}  // namespace q7tema
