// The live file's rollover: when it happens, what the renamed files are called, and that the
// live name is back at once.

#include "collector/common/live_file.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <set>
#include <string>

#include "tests/support/scratch_dir.h"

namespace collector {
namespace {

using Clock = LiveFile::Clock;
using std::chrono::seconds;

class LiveFileTest : public ::testing::Test {
 protected:
  LiveFileOptions Options(uint64_t roll_bytes, int64_t roll_seconds = 0) {
    return {dir_.path(), "traffic", roll_bytes, roll_seconds};
  }
  // Appends and writes one record of exactly size bytes.
  void Put(LiveFile* file, size_t size, Clock::time_point now = Clock::time_point()) {
    std::string error;
    ASSERT_TRUE(file->Append(std::string(size - 1, 'r') + "\n", now, &error)) << error;
    ASSERT_TRUE(file->Flush(&error)) << error;
    EXPECT_TRUE(std::filesystem::exists(dir_.file("traffic.sm3")));
  }
  std::set<std::string> Names() const {
    std::set<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(dir_.path())) {
      names.insert(entry.path().filename().string());
    }
    return names;
  }
  size_t Size(const std::string& name) const { return dir_.read(name).size(); }

  q7test::ScratchDir dir_;
  std::string error_;
};

// A record that would take the file past the limit goes to a fresh file; the renamed ones
// count up from 0001 and never hold more than the limit.
TEST_F(LiveFileTest, RollsBeforeExceedingTheSize) {
  LiveFile file(Options(1000));
  ASSERT_TRUE(file.Open(Clock::time_point(), &error_)) << error_;
  for (int i = 0; i < 7; ++i) {
    Put(&file, 300);
  }
  EXPECT_EQ((std::set<std::string>{"traffic-0001.sm3", "traffic-0002.sm3", "traffic.sm3"}),
            Names());
  EXPECT_EQ(900u, Size("traffic-0001.sm3"));
  EXPECT_EQ(900u, Size("traffic-0002.sm3"));
  EXPECT_EQ(300u, Size("traffic.sm3"));
  EXPECT_EQ(2, file.rolled());

  Put(&file, 5000);  // bigger than the limit: a file of its own
  Put(&file, 10);
  EXPECT_EQ(5000u, Size("traffic-0004.sm3"));
  EXPECT_EQ(10u, Size("traffic.sm3"));
}

// Numbering continues after the highest renamed file of the same stem, and what a previous
// run left in the live file stays and counts toward its size.
TEST_F(LiveFileTest, ContinuesAfterExistingFiles) {
  dir_.write("traffic-0007.sm3", "old");
  dir_.write("traffic-0002.sm3", "old");
  dir_.write("other-0042.sm3", "old");
  dir_.write("traffic-x.sm3", "old");
  dir_.write("traffic.sm3", std::string(800, 'p'));
  LiveFile file(Options(1000));
  ASSERT_TRUE(file.Open(Clock::time_point(), &error_)) << error_;
  EXPECT_EQ(800u, file.size());
  Put(&file, 300);
  EXPECT_EQ(800u, Size("traffic-0008.sm3"));
  EXPECT_EQ(300u, Size("traffic.sm3"));
  EXPECT_TRUE(Names().count("other-0042.sm3"));
}

// A file is rolled once it has held data for roll_seconds, counted from its first record;
// an empty live file is never rolled.
TEST_F(LiveFileTest, RollsByAgeOfItsFirstRecord) {
  const Clock::time_point t0{seconds(1000)};
  LiveFile file(Options(0, 60));
  ASSERT_TRUE(file.Open(t0, &error_)) << error_;
  ASSERT_TRUE(file.Tick(t0 + seconds(600), &error_));
  EXPECT_EQ(0, file.rolled());

  Put(&file, 50, t0 + seconds(600));
  ASSERT_TRUE(file.Tick(t0 + seconds(659), &error_));
  EXPECT_EQ(0, file.rolled());
  ASSERT_TRUE(file.Tick(t0 + seconds(660), &error_));
  EXPECT_EQ(1, file.rolled());
  EXPECT_EQ(50u, Size("traffic-0001.sm3"));
  EXPECT_EQ(0u, Size("traffic.sm3"));
  EXPECT_TRUE(Names().count("traffic.sm3"));
}

TEST_F(LiveFileTest, OpenFailureNamesThePath) {
  dir_.write("plain", "x");
  LiveFile file({dir_.file("plain/data"), "traffic", 0, 0});
  EXPECT_FALSE(file.Open(Clock::time_point(), &error_));
  EXPECT_NE(std::string::npos, error_.find(dir_.file("plain/data"))) << error_;
}

}  // namespace
}  // namespace collector
