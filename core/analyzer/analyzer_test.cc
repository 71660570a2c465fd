// The analyzer's small shared parts: the linked lists and waiting for situations.

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "core/analyzer/dpx_analyzer.h"
#include "core/analyzer/intake/linked_list.h"
#include "framework/trace_capture.h"
#include "tests/support/scratch_dir.h"

namespace {

TEST(LinkedListTest, AppendsInOrderAndFreesPayloads) {
  LL_ELEMENT<std::string>* list = nullptr;
  EXPECT_EQ(0, getLLCount(list));
  for (const char* text : {"a", "b", "c"}) {
    ASSERT_TRUE(addLLElement(&list, new std::string(text)));
  }
  EXPECT_EQ(3, getLLCount(list));
  EXPECT_EQ("a", *list->payload);
  EXPECT_EQ("c", *list->last->payload);
  EXPECT_EQ("b", *list->next->payload);
  freeLL(&list, true);  // the payloads go too; the sanitizer builds would report a leak
  EXPECT_EQ(nullptr, list);
}

// Situations need a transaction pattern and a client pattern; with only the first the wait
// runs to its limit.
TEST(WaitForSituationsTest, NeedsBothKindsOfPattern) {
  q7test::ScratchDir dir;
  CDPXAnalyzer analyzer({dir.file("dpx"), dir.file("state"), dir.file("data"), "", ""});
  fw::TraceCapture capture("*=ALL");
  ASSERT_TRUE(analyzer.newTransactionPattern("t", "A", "*", "T", "*", 0, 1, 0, 100, 500, 99));
  analyzer.waitForSituations(1, 3);
  EXPECT_EQ(3, capture.count("waitForSituatuions Don't have situations yet.  Going to sleep"));
  EXPECT_TRUE(
      capture.contains("waitForSituatuions Did [3] sleeps and no situations yet.  Continuing on."));
  ASSERT_TRUE(analyzer.newClientPattern("c", "Clients", "*", "*", 1));
  capture.clear();
  analyzer.waitForSituations(1, 3);
  EXPECT_TRUE(capture.contains("waitForSituatuions We have situations!  No (more) sleeps."));
  EXPECT_FALSE(capture.contains("Going to sleep"));
}

TEST(PerformanceStatsTest, AverageOnlyWhenSomethingWasProcessed) {
  q7test::ScratchDir dir;
  CDPXAnalyzer analyzer({dir.file("dpx"), dir.file("state"), dir.file("data"), "", ""});
  fw::TraceCapture capture("*=ALL");
  analyzer.printPerformanceStats();
  EXPECT_TRUE(capture.contains("Transactions Processed                 : 0"));
  EXPECT_TRUE(capture.contains("Average Time processing per transaction: 0.00 ms"));
}

}  // namespace
