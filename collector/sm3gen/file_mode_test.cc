// Writing files: repeatable output and truth, appending, and I/O errors that name the file.

#include "collector/sm3gen/file_mode.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>
#include <string>

#include "tests/support/scratch_dir.h"

namespace sm3gen {
namespace {

class FileModeTest : public ::testing::Test {
 protected:
  FileJob Job(const std::string& name, uint64_t seed = 1) {
    FileJob job;
    job.out_path = dir_.file(name + ".sm3");
    job.truth_path = dir_.file(name + ".json");
    job.records = 400;
    job.model.seed = seed;
    job.model.start = 1795450020;
    job.stream.junk_every = 5;
    return job;
  }
  void Run(const FileJob& job) {
    std::string error;
    ASSERT_TRUE(RunFileMode(job, &error)) << error;
  }
  std::string Read(const std::string& name) { return dir_.read(name); }

  q7test::ScratchDir dir_;
};

using sm3genFile = FileModeTest;

TEST_F(sm3genFile, SameOptionsSameBytesAndTruthOtherSeedDiffers) {
  Run(Job("a"));
  Run(Job("b"));
  Run(Job("c", 2));
  EXPECT_FALSE(Read("a.sm3").empty());
  EXPECT_EQ(Read("a.sm3"), Read("b.sm3"));
  EXPECT_EQ(Read("a.json"), Read("b.json"));
  EXPECT_NE(Read("a.sm3"), Read("c.sm3"));
  EXPECT_NE(Read("a.json"), Read("c.json"));
  const auto truth = nlohmann::json::parse(Read("a.json"));
  EXPECT_EQ(400, truth["records"]);
  EXPECT_EQ(Read("a.sm3").size(), truth["bytes"]);
}

TEST_F(sm3genFile, AppendGrowsTheFileByTheTruthsBytes) {
  Run(Job("grow"));
  const size_t before = Read("grow.sm3").size();
  FileJob more = Job("grow", 7);
  more.append = true;
  more.truncate_tail = true;
  Run(more);
  const auto truth = nlohmann::json::parse(Read("grow.json"));
  EXPECT_EQ(Read("grow.sm3").size() - before, truth["bytes"]);
  EXPECT_EQ(400, truth["records"]);
}

TEST_F(sm3genFile, IoErrorsNameTheFile) {
  FileJob job = Job("missing/dir/out");
  std::string error;
  EXPECT_FALSE(RunFileMode(job, &error));
  EXPECT_EQ(job.out_path + ": No such file or directory", error);

  job = Job("ok");
  job.truth_path = dir_.file("no/such/truth.json");
  EXPECT_FALSE(RunFileMode(job, &error));
  EXPECT_EQ(job.truth_path + ": No such file or directory", error);
}

}  // namespace
}  // namespace sm3gen
