#include "core/history/instance_file.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "core/history/history_store.h"
#include "framework/trace_capture.h"
#include "tests/support/scratch_dir.h"

namespace history {
namespace {

struct Instance {
  int64_t id;
  char name[24];
};

constexpr int64_t kIntervalStart = 1700000100;
constexpr int64_t kIntervalLength = 60;

class InstanceFileTest : public ::testing::Test {
 protected:
  static Instance make(int64_t id) { return Instance{id, "instance"}; }

  // The ids readable through the store over `intervals` intervals ending at `last`.
  std::vector<int64_t> readIds(int64_t last, int intervals) const {
    const size_t count =
        store_.countRows("q7txins", last, intervals, kIntervalLength, sizeof(Instance));
    std::vector<Instance> out(count);
    out.resize(store_.loadRows("q7txins", last, intervals, kIntervalLength, sizeof(Instance), count,
                               out.data()));
    std::vector<int64_t> ids;
    for (const Instance& instance : out) {
      ids.push_back(instance.id);
    }
    return ids;
  }

  q7test::ScratchDir dir_;
  HistoryStore store_{dir_.file("dpx")};
  InstanceFile file_{dir_.file("dpx"), "q7txins", sizeof(Instance)};
};

// Appends follow the interval: a change closes one file and opens the next.
TEST_F(InstanceFileTest, IntervalChangeLandsInTwoFiles) {
  for (int64_t id : {1, 2}) {
    const Instance instance = make(id);
    ASSERT_TRUE(file_.append(kIntervalStart, &instance));
  }
  for (int64_t id : {3, 4, 5}) {
    const Instance instance = make(id);
    ASSERT_TRUE(file_.append(kIntervalStart + kIntervalLength, &instance));
  }
  ASSERT_TRUE(file_.flush());
  EXPECT_EQ(kIntervalStart + kIntervalLength, file_.interval());
  EXPECT_EQ((std::vector<int64_t>{1, 2}), readIds(kIntervalStart, 1));
  EXPECT_EQ((std::vector<int64_t>{3, 4, 5, 1, 2}), readIds(kIntervalStart + kIntervalLength, 2));
}

// Going back to an interval appends to its file rather than replacing it, and the destructor
// writes what is still buffered.
TEST_F(InstanceFileTest, ReopenedIntervalIsAppendedAndDestructorFlushes) {
  {
    InstanceFile other(dir_.file("dpx"), "q7txins", sizeof(Instance));
    const Instance first = make(1);
    ASSERT_TRUE(other.append(kIntervalStart, &first));
  }
  const Instance second = make(2);
  ASSERT_TRUE(file_.append(kIntervalStart, &second));
  ASSERT_TRUE(file_.flush());
  EXPECT_EQ((std::vector<int64_t>{1, 2}), readIds(kIntervalStart, 1));
}

// More records than the buffer holds all arrive, in order.
TEST_F(InstanceFileTest, ManyRecordsArriveInOrder) {
  constexpr int kCount = 10000;
  for (int64_t id = 0; id < kCount; ++id) {
    const Instance instance = make(id);
    ASSERT_TRUE(file_.append(kIntervalStart, &instance));
  }
  ASSERT_TRUE(file_.flush());
  const std::vector<int64_t> ids = readIds(kIntervalStart, 1);
  ASSERT_EQ(static_cast<size_t>(kCount), ids.size());
  for (int64_t id = 0; id < kCount; ++id) {
    ASSERT_EQ(id, ids[id]);
  }
}

// --- Failures ---

// A record cut by a crash is dropped before appending, so later records stay aligned.
TEST_F(InstanceFileTest, CutRecordIsRemovedBeforeAppending) {
  {
    InstanceFile before_crash(dir_.file("dpx"), "q7txins", sizeof(Instance));
    const Instance instance = make(1);
    ASSERT_TRUE(before_crash.append(kIntervalStart, &instance));
  }
  const std::string path = store_.pathOf(kIntervalStart, "q7txins");
  std::filesystem::resize_file(path, sizeof(Instance) + 10);

  fw::TraceCapture capture;
  const Instance instance = make(2);
  ASSERT_TRUE(file_.append(kIntervalStart, &instance));
  ASSERT_TRUE(file_.flush());
  EXPECT_EQ(2 * sizeof(Instance), std::filesystem::file_size(path));
  EXPECT_EQ((std::vector<int64_t>{1, 2}), readIds(kIntervalStart, 1));
  EXPECT_TRUE(capture.contains("cut a partial record of 10 bytes"));
}

// Records whose file cannot be written (here a directory stands in its place; a full disk is
// the same) are held, in order, traced once, and written once the file can be: none is lost.
TEST_F(InstanceFileTest, UnwritableFileHoldsItsRecordsUntilItCanBeWritten) {
  const std::string blocked = store_.pathOf(kIntervalStart, "q7txins");
  std::filesystem::create_directories(blocked);
  fw::TraceCapture capture;
  for (int64_t id = 1; id <= 2; ++id) {
    const Instance instance = make(id);
    EXPECT_TRUE(file_.append(kIntervalStart, &instance));
    EXPECT_FALSE(file_.flush());
  }
  const Instance next = make(3);
  EXPECT_TRUE(file_.append(kIntervalStart + kIntervalLength, &next));
  EXPECT_FALSE(file_.flush());  // the older interval first: order is kept
  EXPECT_EQ(3u, file_.heldRecords());
  EXPECT_EQ(0u, file_.droppedRecords());
  EXPECT_EQ(1, capture.count("holding"));
  EXPECT_TRUE(readIds(kIntervalStart + kIntervalLength, 2).empty());

  std::filesystem::remove(blocked);
  EXPECT_TRUE(file_.flush());
  EXPECT_EQ(0u, file_.heldRecords());
  EXPECT_EQ((std::vector<int64_t>{3, 1, 2}),
            readIds(kIntervalStart + kIntervalLength, 2));  // newest interval first
  EXPECT_TRUE(capture.contains("records are written again"));
}

}  // namespace
}  // namespace history
