#include "core/runtime/misc.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "core/runtime/paths.h"
#include "tests/support/scratch_dir.h"

namespace {

using Sleeps = std::vector<unsigned long>;

// Naps with a recording sleeper. With raise_while_sleeping, the flag goes up during the first
// sleep, as another thread's stop request would.
Sleeps Nap(unsigned long ms, std::atomic<bool>* flag, bool raise_while_sleeping = false) {
  Sleeps sleeps;
  CMisc::napWhileBoolFalse(ms, flag, [&](unsigned long step) {
    sleeps.push_back(step);
    if (raise_while_sleeping) {
      flag->store(true);
    }
  });
  return sleeps;
}

// The remainder comes first, then 200 ms steps, each preceded by a look at the flag.
TEST(NapTest, StepsAndEarlyStop) {
  std::atomic<bool> flag{false};
  EXPECT_EQ((Sleeps{50, 200, 200}), Nap(450, &flag));
  EXPECT_EQ((Sleeps{200, 200}), Nap(400, nullptr));
  EXPECT_EQ((Sleeps{50}), Nap(450, &flag, true));  // raised during the remainder
  flag = false;
  EXPECT_EQ((Sleeps{200}), Nap(400, &flag, true));  // raised during the first step
}

// The real sleeper: with the flag up, ten steps are skipped at once.
TEST(NapTest, RaisedFlagSkipsRealSteps) {
  std::atomic<bool> flag{true};
  auto start = std::chrono::steady_clock::now();
  CMisc::napWhileBoolFalse(10 * 200 + 1, &flag);
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(1500));
}

class FileHelpersTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = scratch_.path();
    scratch_.write("file", "0123456789");
  }

  q7test::ScratchDir scratch_;
  std::string root_;
};

// Backslash-separated components are created level by level as '/' paths; an existing
// directory with a trailing separator is success; nothing can be made under a regular file.
TEST_F(FileHelpersTest, Mkdirs) {
  EXPECT_EQ(0, CMisc::mkdirs((root_ + "\\one\\two\\three").c_str()));
  EXPECT_TRUE(dirExists((root_ + "/one/two/three").c_str()));
  EXPECT_EQ(0, CMisc::mkdirs((root_ + "/one/two/").c_str()));
  EXPECT_EQ(1, CMisc::mkdirs((root_ + "/file/sub/dir").c_str()));
  EXPECT_FALSE(dirExists((root_ + "/file").c_str()));
}

TEST_F(FileHelpersTest, TruncateAndSize) {
  const std::string file = root_ + "/file";
  const std::string missing = root_ + "/missing";
  long long size = -1;
  EXPECT_EQ(0, CMisc::truncateFile(file.c_str(), 3));
  ASSERT_TRUE(CMisc::getFileSize64(file.c_str(), &size));
  EXPECT_EQ(3, size);
  EXPECT_EQ(1, CMisc::truncateFile(nullptr, 0));
  EXPECT_EQ(2, CMisc::truncateFile(missing.c_str(), 0));
  EXPECT_FALSE(CMisc::getFileSize64(missing.c_str(), &size));
}

// Both separators count; the later of the two is the last one.
TEST(PathsTest, SeparatorsOfBothKinds) {
  char mixed[] = "a\\b/c\\d";
  EXPECT_EQ(mixed + 1, findPathSep(mixed));
  EXPECT_EQ(mixed + 5, getLastPathSeparator(mixed));
  char slash_last[] = "a\\b/c";
  EXPECT_EQ(slash_last + 3, getLastPathSeparator(slash_last));
  char none[] = "plain";
  EXPECT_EQ(nullptr, findPathSep(none));
  EXPECT_EQ(nullptr, getLastPathSeparator(none));
  makeNativePath(mixed);
  EXPECT_STREQ("a/b/c/d", mixed);
}

}  // namespace
