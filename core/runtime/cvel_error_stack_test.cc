#include "core/runtime/cvel_error_stack.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "core/runtime/cvel_status.h"

namespace {

// Names must outlive the stack, so the test keeps them in a fixed table.
const std::vector<std::string>& Names() {
  static const std::vector<std::string> names = [] {
    std::vector<std::string> all;
    for (int i = 1; i <= 50; ++i) {
      all.push_back("f" + std::to_string(i));
    }
    return all;
  }();
  return names;
}

TEST(CvelErrorStackTest, NewStackHoldsOnlyThePlaceholder) {
  CvelErrorStack stack;
  EXPECT_EQ(0, stack.GetErrorCode());
  EXPECT_STREQ("Error code not set.", stack.GetFirstFunction());
  EXPECT_EQ(nullptr, stack.GetNextFunction());
}

// After an error, the 50th added name wraps the ring: the failing location is dropped.
TEST(CvelErrorStackTest, RingDropsOldestWithWrapCode) {
  CvelErrorStack stack;
  stack.AddFunction("before()");  // the error starts the ring afresh wherever it is
  stack.SetErrorCode(-122, "CvelMutex::Lock()");
  EXPECT_EQ(-122, stack.GetErrorCode());
  EXPECT_STREQ("CvelMutex::Lock()", stack.GetFirstFunction());
  for (int i = 0; i < 49; ++i) {
    ASSERT_EQ(cvel::kOk, stack.AddFunction(Names()[i].c_str())) << i;
  }
  EXPECT_EQ(cvel::kErrorStackWrapped, stack.AddFunction(Names()[49].c_str()));
  EXPECT_EQ(50, stack.GetStackSize());

  std::vector<std::string> seen;
  for (const char* name = stack.GetFirstFunction(); name != nullptr;
       name = stack.GetNextFunction()) {
    seen.push_back(name);
  }
  EXPECT_EQ(Names(), seen);
  EXPECT_STREQ("f2", stack.GetNextFunction());  // the end rewound the cursor to the first name
}

// The dump lists names oldest first and leaves out a name that would fill the buffer.
TEST(CvelErrorStackTest, DumpStopsBeforeNameThatDoesNotFit) {
  CvelErrorStack stack;
  stack.SetErrorCode(-110, "Loc()");
  stack.AddFunction("a");
  stack.AddFunction("bb");
  char buffer[64];
  stack.GetStackDump(buffer, sizeof(buffer));
  EXPECT_STREQ("Loc()\na\nbb\n", buffer);
  stack.GetStackDump(buffer, 11);  // "Loc()\na\nbb\n" needs 12 with its terminator
  EXPECT_STREQ("Loc()\na\n", buffer);
  EXPECT_EQ(cvel::kOk, stack.GetStackDump(nullptr, 10));
}

}  // namespace
