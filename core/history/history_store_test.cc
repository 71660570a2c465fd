#include "core/history/history_store.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <filesystem>
#include <set>
#include <string>
#include <vector>

#include "framework/trace_capture.h"
#include "tests/support/scratch_dir.h"

namespace history {
namespace {

// A stand-in for an over-time row layout: what matters is a fixed size and telling rows apart.
struct Record {
  int64_t interval;
  int32_t id;
  int32_t pad;
};

constexpr int64_t kT = 1700000100;  // an interval start
constexpr int64_t kStep = 60;       // interval length

class HistoryStoreTest : public ::testing::Test {
 protected:
  // Saves ids first..first+count-1 as interval `start` of stem `stem`.
  void save(int64_t start, int first, int count, const std::string& stem = "q7txot") {
    std::vector<Record> records;
    for (int i = 0; i < count; ++i) {
      records.push_back({start, first + i, 0});
    }
    ASSERT_TRUE(store_.saveInterval(start, stem, records.data(), sizeof(Record), records.size()));
  }

  std::vector<Record> load(int64_t last, int intervals, size_t max_rows) {
    std::vector<Record> out(max_rows + 1, Record{-1, -1, -1});  // one guard record past the cap
    const size_t n =
        store_.loadRows("q7txot", last, intervals, kStep, sizeof(Record), max_rows, out.data());
    EXPECT_EQ(-1, out[max_rows].id) << "wrote past max_rows";
    out.resize(n);
    return out;
  }

  static std::vector<int> ids(const std::vector<Record>& records) {
    std::vector<int> result;
    for (const Record& r : records) {
      result.push_back(r.id);
    }
    return result;
  }

  // The names in the history directory.
  std::set<std::string> files() const {
    std::set<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(dir_.file("odi/dpx"))) {
      names.insert(entry.path().filename().string());
    }
    return names;
  }

  q7test::ScratchDir dir_;
  HistoryStore store_{dir_.path() + "/odi/dpx/"};
};

// Records come back byte for byte from a file under the documented name, with no leftovers.
TEST_F(HistoryStoreTest, SaveThenLoadRoundTrip) {
  save(kT, 1, 3);
  const std::vector<std::byte> bytes = store_.loadInterval(kT, "q7txot", sizeof(Record));
  ASSERT_EQ(3 * sizeof(Record), bytes.size());
  std::vector<Record> records(3);
  std::memcpy(records.data(), bytes.data(), bytes.size());
  EXPECT_EQ((std::vector<int>{1, 2, 3}), ids(records));
  EXPECT_EQ(kT, records[2].interval);
  EXPECT_EQ((std::set<std::string>{"1700000100_1_q7txot.dat"}), files());
}

// Saving an interval again replaces it; saving no rows leaves an empty interval behind.
TEST_F(HistoryStoreTest, SaveReplacesAndEmptySaveRemoves) {
  save(kT, 1, 3);
  save(kT, 7, 1);
  EXPECT_EQ((std::vector<int>{7}), ids(load(kT, 1, 10)));
  ASSERT_TRUE(store_.saveInterval(kT, "q7txot", nullptr, sizeof(Record), 0));
  EXPECT_FALSE(std::filesystem::exists(store_.pathOf(kT, "q7txot")));
  EXPECT_EQ(0u, store_.countRows("q7txot", kT, 1, kStep, sizeof(Record)));
  EXPECT_TRUE(store_.loadInterval(kT, "q7txot", sizeof(Record)).empty());
}

// Records made a stretch at a time write the same file as one buffer, across piece boundaries;
// each stretch starts zeroed, so columns a row leaves unset read as zero.
TEST_F(HistoryStoreTest, SavingInPiecesWritesTheSameFile) {
  const size_t count = HistoryStore::kPieceRecords * 2 + 7;
  std::vector<Record> records(count);
  for (size_t i = 0; i < count; ++i) {
    records[i] = {kT, static_cast<int32_t>(i), 0};
  }
  ASSERT_TRUE(store_.saveInterval(kT, "q7txot", records.data(), sizeof(Record), count));
  const std::vector<std::byte> whole = store_.loadInterval(kT, "q7txot", sizeof(Record));
  size_t next = 0;
  ASSERT_TRUE(store_.saveIntervalInPieces(kT + kStep, "q7txot", sizeof(Record), count,
                                          [&](size_t first, size_t n, void* out) {
                                            EXPECT_EQ(next, first);
                                            EXPECT_LE(n, HistoryStore::kPieceRecords);
                                            next = first + n;
                                            auto* rows = static_cast<Record*>(out);
                                            for (size_t i = 0; i < n; ++i) {
                                              EXPECT_EQ(0, rows[i].pad);
                                              rows[i].interval = kT;
                                              rows[i].id = static_cast<int32_t>(first + i);
                                            }
                                          }));
  EXPECT_EQ(count, next);
  EXPECT_TRUE(whole == store_.loadInterval(kT + kStep, "q7txot", sizeof(Record)));
}

// Counting and loading walk back from the last interval, skip gaps, stop at the window and cap.
TEST_F(HistoryStoreTest, CountAndLoadSeveralIntervalsNewestFirst) {
  save(kT + kStep, 90, 5);  // after the window
  save(kT, 1, 2);
  // kT - kStep is missing.
  save(kT - 2 * kStep, 10, 3);
  save(kT - 3 * kStep, 20, 1);
  save(kT - 4 * kStep, 80, 4);  // before the window
  save(kT, 50, 6, "q7clntot");  // another stem

  EXPECT_EQ(6u, store_.countRows("q7txot", kT, 4, kStep, sizeof(Record)));
  EXPECT_EQ(2u, store_.countRows("q7txot", kT, 2, kStep, sizeof(Record)));
  EXPECT_EQ(0u, store_.countRows("q7txot", kT, 0, kStep, sizeof(Record)));

  EXPECT_EQ((std::vector<int>{1, 2, 10, 11, 12, 20}), ids(load(kT, 4, 100)));
  // The cap cuts inside the second file.
  EXPECT_EQ((std::vector<int>{1, 2, 10}), ids(load(kT, 4, 3)));
  EXPECT_TRUE(load(kT, 4, 0).empty());
}

// Interval starts before 1970 do not exist; a walk running past it just ends.
TEST_F(HistoryStoreTest, WalkStopsAtTheEpoch) {
  save(0, 1, 1);
  save(kStep, 2, 1);
  EXPECT_EQ(2u, store_.countRows("q7txot", kStep, 5, kStep, sizeof(Record)));
  EXPECT_EQ((std::vector<int>{2, 1}), ids(load(kStep, 5, 10)));
}

// --- What a crash can leave behind ---

// A temporary file from a save that never finished is invisible to every reader.
TEST_F(HistoryStoreTest, LeftoverTemporaryFileIsNotData) {
  save(kT, 1, 2);
  dir_.write("odi/dpx/.1700000100_1_q7txot.dat.tmp", std::string(5 * sizeof(Record), 'x'));
  dir_.write("odi/dpx/.1700000040_1_q7txot.dat.tmp", std::string(5 * sizeof(Record), 'x'));
  EXPECT_EQ(2u, store_.countRows("q7txot", kT, 2, kStep, sizeof(Record)));
  EXPECT_EQ((std::vector<int>{1, 2}), ids(load(kT, 2, 10)));
}

// A file cut inside a record yields its whole records only to the row readers (an instance
// file cut by a crash), and says so. Loaded as an interval's rows it is set aside: interval
// files are replaced whole, so a cut one is damaged.
TEST_F(HistoryStoreTest, RecordCutMidwayIsIgnored) {
  save(kT, 1, 3);
  save(kT - kStep, 10, 2);
  const std::string path = store_.pathOf(kT, "q7txot");
  std::filesystem::resize_file(path, 2 * sizeof(Record) + 5);
  fw::TraceCapture capture;

  EXPECT_EQ(4u, store_.countRows("q7txot", kT, 2, kStep, sizeof(Record)));
  EXPECT_EQ((std::vector<int>{1, 2, 10, 11}), ids(load(kT, 2, 10)));
  EXPECT_TRUE(capture.contains("not a whole number of 16-byte records"));

  EXPECT_TRUE(store_.loadInterval(kT, "q7txot", sizeof(Record)).empty());
  EXPECT_TRUE(capture.contains("History file " + path + " does not load"));
  EXPECT_TRUE(std::filesystem::exists(path + ".bad"));
  EXPECT_EQ(2u, store_.countRows("q7txot", kT, 2, kStep, sizeof(Record)));
}

// A save that cannot write keeps the previous file and reports the path.
TEST_F(HistoryStoreTest, FailedSaveKeepsPreviousContents) {
  save(kT, 1, 2);
  // A directory in the temporary file's place makes the write fail, even for root.
  std::filesystem::create_directory(dir_.file("odi/dpx/.1700000100_1_q7txot.dat.tmp"));
  fw::TraceCapture capture;
  const Record replacement{kT, 9, 0};
  EXPECT_FALSE(store_.saveInterval(kT, "q7txot", &replacement, sizeof(Record), 1));
  EXPECT_EQ((std::vector<int>{1, 2}), ids(load(kT, 1, 10)));
  EXPECT_TRUE(capture.contains("cannot write " + store_.pathOf(kT, "q7txot")));
}

// --- Cleanup ---

// Only this store's files older than the summary period go; everything else stays.
TEST_F(HistoryStoreTest, CleanupRemovesOnlyOldStoreFiles) {
  const int64_t now = kT + 7200;  // the summary period starts at kT + 3600
  const std::vector<std::string> removed = {
      "odi/dpx/1700000100_1_q7txot.dat",
      "odi/dpx/1700000040_1_q7clntsrvot.dat",
      "odi/dpx/1700000100_1_q7txins.dat",
      "odi/dpx/.1700000100_1_q7appot.dat.tmp",
  };
  const std::vector<std::string> kept = {
      "odi/dpx/1700003700_1_q7txot.dat",   // exactly at the start of the summary period
      "odi/dpx/1700003760_1_q7txot.dat",   // recent
      "odi/dpx/1700000100_2_q7txot.dat",   // another format
      "odi/dpx/1700000100_1_.dat",         // no stem
      "odi/dpx/1700000100_1_q7txot.datx",  // not a .dat file
      "odi/dpx/x1700000100_1_q7txot.dat",
      "odi/dpx/.1700000100_1_q7txot.dat",  // looks temporary but is not
      "odi/dpx/DPXLastFile",
      "odi/dpx/tpatterns.dat",
      "odi/dpx/cpatterns.dat",
  };
  for (const std::string& name : removed) {
    dir_.write(name, "x");
  }
  for (const std::string& name : kept) {
    dir_.write(name, "x");
  }
  std::filesystem::create_directory(dir_.file("odi/dpx/1700000000_1_dir.dat"));

  fw::TraceCapture capture;
  EXPECT_EQ(4, store_.cleanupOldFiles(now, 3600));
  for (const std::string& name : removed) {
    EXPECT_FALSE(std::filesystem::exists(dir_.file(name))) << name;
  }
  for (const std::string& name : kept) {
    EXPECT_TRUE(std::filesystem::exists(dir_.file(name))) << name;
  }
  EXPECT_TRUE(std::filesystem::is_directory(dir_.file("odi/dpx/1700000000_1_dir.dat")));
  EXPECT_EQ(4, capture.count("removed "));
}

// Saves, removals and cleanups each move the generation on, so readers can tell their copies
// stale; reading leaves it.
TEST_F(HistoryStoreTest, ChangesAdvanceTheGeneration) {
  uint64_t seen = HistoryStore::generation();
  auto advanced = [&seen] {
    const uint64_t now = HistoryStore::generation();
    const bool moved = now > seen;
    seen = now;
    return moved;
  };
  save(kT, 1, 2);
  EXPECT_TRUE(advanced());
  EXPECT_EQ(2u, load(kT, 1, 10).size());
  EXPECT_FALSE(advanced());
  ASSERT_TRUE(store_.saveInterval(kT, "q7txot", nullptr, sizeof(Record), 0));
  EXPECT_TRUE(advanced());
  save(kT, 1, 2);
  advanced();
  EXPECT_EQ(0, store_.cleanupOldFiles(kT, 3600));
  EXPECT_FALSE(advanced());
  EXPECT_EQ(1, store_.cleanupOldFiles(kT + 7200, 3600));
  EXPECT_TRUE(advanced());
}

// A history directory that was never written has nothing to clean.
TEST_F(HistoryStoreTest, CleanupOfMissingDirectoryRemovesNothing) {
  EXPECT_EQ(0, store_.cleanupOldFiles(kT, 60));
  EXPECT_FALSE(std::filesystem::exists(dir_.file("odi")));
}

}  // namespace
}  // namespace history
