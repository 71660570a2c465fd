// ReplaceFile: new contents whole, the mode asked for, missing directories made, nothing left
// behind, and on failure the old file untouched with the step that failed.

#include "framework/atomic_file.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <string>

#include "framework/status.h"
#include "tests/support/scratch_dir.h"

namespace fw {
namespace {

size_t EntriesIn(const std::string& dir) {
  size_t n = 0;
  for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator(dir)) {
    ++n;
  }
  return n;
}

TEST(AtomicFileTest, ReplacesWholeWithModeAndLeavesNothingBehind) {
  q7test::ScratchDir dir;
  const std::string path = dir.file("deep/er/list.json");  // parents made on the way
  ReplaceResult result;
  ASSERT_EQ(kOk, ReplaceFile(path, "first\n", {0600, ""}, &result));
  EXPECT_EQ("first\n", dir.read("deep/er/list.json"));
  ASSERT_EQ(kOk, ReplaceFile(path, "second, longer\n", {0600, ""}, &result));
  EXPECT_EQ("second, longer\n", dir.read("deep/er/list.json"));
  struct stat st {};
  ASSERT_EQ(0, ::stat(path.c_str(), &st));
  EXPECT_EQ(0600u, st.st_mode & 0777);
  EXPECT_EQ(st.st_mtim.tv_sec, result.modified.tv_sec);
  EXPECT_EQ(st.st_mtim.tv_nsec, result.modified.tv_nsec);
  EXPECT_EQ(1u, EntriesIn(dir.file("deep/er")));  // no temporary file left

  // A fixed temporary name, as a directory's owner asks for, is gone afterwards too.
  ASSERT_EQ(kOk, ReplaceFile(path, "", {0644, dir.file("deep/er/.list.tmp")}));
  EXPECT_EQ("", dir.read("deep/er/list.json"));
  EXPECT_EQ(1u, EntriesIn(dir.file("deep/er")));
}

// Contents in pieces arrive in order; a producer that fails part-way (a full disk) leaves the
// old file whole and no temporary file.
TEST(AtomicFileTest, PiecesInOrderAndAFailedPieceKeepsTheOldFile) {
  q7test::ScratchDir dir;
  const std::string path = dir.file("data");
  ASSERT_EQ(kOk, ReplaceFileInPieces(path, [](const ContentSink& sink) {
              return sink("one,") && sink("") && sink("two");
            }));
  EXPECT_EQ("one,two", dir.read("data"));
  ReplaceResult result;
  EXPECT_EQ(kIoError, ReplaceFileInPieces(
                          path,
                          [](const ContentSink& sink) {
                            if (!sink("half")) {
                              return false;
                            }
                            errno = ENOSPC;
                            return false;
                          },
                          {}, &result));
  EXPECT_EQ(ReplaceStep::kWrite, result.failed);
  EXPECT_EQ(ENOSPC, result.error_number);
  EXPECT_EQ("one,two", dir.read("data"));
  EXPECT_EQ(1u, EntriesIn(dir.path()));
}

TEST(AtomicFileTest, FailureLeavesTheOldFileAndNamesTheStep) {
  q7test::ScratchDir dir;
  // The target is a directory that is not empty: the rename fails after the write.
  std::filesystem::create_directories(dir.file("taken/inside"));
  ReplaceResult result;
  std::string error;
  EXPECT_EQ(kIoError, ReplaceFile(dir.file("taken"), "x", {}, &result, &error));
  EXPECT_EQ(ReplaceStep::kRename, result.failed);
  EXPECT_NE(0, result.error_number);
  EXPECT_EQ(0u, error.find("cannot write " + dir.file("taken") + ": ")) << error;
  EXPECT_EQ(1u, EntriesIn(dir.path()));  // the temporary file was removed

  // A parent that is a file: nothing can be created.
  dir.write("plain", "old");
  EXPECT_EQ(kIoError, ReplaceFile(dir.file("plain/child"), "x", {}, &result));
  EXPECT_EQ(ReplaceStep::kCreate, result.failed);
  EXPECT_EQ("old", dir.read("plain"));
}

}  // namespace
}  // namespace fw
