#include "core/history/checkpoint_writer.h"

#include <gtest/gtest.h>

#include <cstddef>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "core/history/checkpoint_file.h"
#include "tests/support/scratch_dir.h"

namespace history {
namespace {

struct Row {
  int64_t id;
  char name[16];
};

// A section whose records come from rows the test then changes: the copy must not follow.
RecordSection SectionOver(const std::vector<Row>& rows) {
  return {"q7txot", sizeof(Row), rows.size(), [&rows](size_t first, size_t n, void* out) {
            std::memcpy(out, rows.data() + first, n * sizeof(Row));
          }};
}

CheckpointJob Job(uint64_t sequence, std::vector<Row>& rows) {
  return {sequence, "sequence " + std::to_string(sequence),
          CopySections({SectionOver(rows), {"q7appot", 8, 0, {}}})};
}

std::vector<int64_t> SavedIds(const CheckpointFile& file, std::string* description) {
  CheckpointImage image;
  std::vector<int64_t> ids;
  if (file.load(&image) != CheckpointFile::Load::kLoaded) {
    return ids;
  }
  *description = image.description;
  for (const LoadedSection& section : image.sections) {
    for (size_t i = 0; section.stem == "q7txot" && i < section.count(); ++i) {
      Row row;
      std::memcpy(&row, section.records.data() + i * sizeof(Row), sizeof(Row));
      ids.push_back(row.id);
    }
  }
  return ids;
}

// The file holds the rows as they were when the job was made; one job at a time, each result
// given back once, and the writer's destruction finishes the write in progress.
TEST(CheckpointWriterTest, WritesTheCopyOneJobAtATime) {
  q7test::ScratchDir dir;
  const CheckpointFile file(dir.file("q7checkpoint.dat"));
  std::vector<Row> rows = {{1, "a"}, {2, "b"}, {3, "c"}};
  std::string description;
  {
    CheckpointWriter writer(file);
    EXPECT_FALSE(writer.wait().has_value());  // nothing handed over yet
    ASSERT_TRUE(writer.start(Job(1, rows)));
    rows[0].id = 100;  // processing goes on meanwhile
    EXPECT_FALSE(writer.start(Job(2, rows)));
    const auto result = writer.wait();
    ASSERT_TRUE(result.has_value());
    EXPECT_TRUE(result->written);
    EXPECT_EQ(1u, result->sequence);
    EXPECT_EQ(3 * sizeof(Row), result->bytes);
    EXPECT_FALSE(writer.finished().has_value());  // taken already
    EXPECT_FALSE(writer.busy());
    EXPECT_EQ((std::vector<int64_t>{1, 2, 3}), SavedIds(file, &description));
    EXPECT_EQ("sequence 1", description);

    ASSERT_TRUE(writer.start(Job(2, rows)));
  }
  EXPECT_EQ((std::vector<int64_t>{100, 2, 3}), SavedIds(file, &description));
  EXPECT_EQ("sequence 2", description);
}

// A checkpoint that cannot be written comes back as not written, and the file before it
// stays.
TEST(CheckpointWriterTest, FailedWriteIsReported) {
  q7test::ScratchDir dir;
  const CheckpointFile good(dir.file("q7checkpoint.dat"));
  std::vector<Row> rows = {{7, "x"}};
  CheckpointWriter first(good);
  ASSERT_TRUE(first.start(Job(1, rows)));
  ASSERT_TRUE(first.wait()->written);

  std::filesystem::create_directories(dir.file("q7checkpoint.dat.tmp"));
  ASSERT_TRUE(first.start(Job(2, rows)));
  const auto result = first.wait();
  ASSERT_TRUE(result.has_value());
  EXPECT_FALSE(result->written);
  std::string description;
  EXPECT_EQ(std::vector<int64_t>{7}, SavedIds(good, &description));
  EXPECT_EQ("sequence 1", description);
}

}  // namespace
}  // namespace history
