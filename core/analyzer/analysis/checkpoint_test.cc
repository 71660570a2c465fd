// Checkpoints: what a crash leaves behind is put back exactly as the last checkpoint saw it,
// so that reading again from its position counts every record once; a checkpoint that does not
// load is set aside and the analyzer starts without it.

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>

#include "core/analyzer/analysis/analyzer_fixture.h"
#include "core/analyzer/analysis/checkpoint_state.h"
#include "core/history/checkpoint_file.h"
#include "core/history/history_store.h"
#include "core/layouts/table_layouts.h"
#include "framework/trace_capture.h"

namespace {

using q7test::kStart;

class CheckpointTest : public q7test::AnalyzerFixture {
 protected:
  void SetUp() override {
    AnalyzerFixture::SetUp();
    analyzer_ = NewAnalyzer(true, true);
    // Half the shop's pages are sampled: the counters decide which, so they must survive.
    AddPattern("shop", "Shop", "shop.example", "Tx", "*", 50, 1);
  }
  std::string checkpoint() { return dir_.file("q7checkpoint.dat"); }
  static long long PositionOf(const history::CheckpointImage& image) {
    CheckpointState state;
    std::string why;
    return CheckpointState::decode(image.description, &state, &why) ? state.position.offset : -1;
  }
  history::CheckpointImage image_;

  // Pages i..j-1 of the collector's file, each noted as read up to its end (100 bytes each)
  // unless the crash comes before the notes.
  void Read(int from, int to, bool noted = true) {
    for (int i = from; i < to; ++i) {
      Process(Page("shop.example", ("/p" + std::to_string(i)).c_str()));
      if (noted) {
        analyzer_->notePosition({"/data/live.sm3", 0, 0, 100LL * (i + 1)});
        analyzer_->awaitCheckpoint();  // one the note started is on disk
      }
    }
  }
  // A crash: the analyzer goes without finishing its run (what it buffered is written, as a
  // kill after its last write would leave it), and a new one starts on the same files.
  void CrashAndRestart() {
    analyzer_->flushInstanceFiles();
    analyzer_.reset();
    analyzer_ = NewAnalyzer(true, true);
  }
  size_t HistoryRows(const char* stem, size_t size, long last) {
    return analyzer_->historyStore().countRows(stem, last, 10, 300, size);
  }
  long SavedRequests(long interval) {
    const auto bytes =
        analyzer_->historyStore().loadInterval(interval, "q7appot", sizeof(kq7_q7appot_data_t));
    long sum = 0;
    for (size_t at = 0; at + sizeof(kq7_q7appot_data_t) <= bytes.size();
         at += sizeof(kq7_q7appot_data_t)) {
      kq7_q7appot_data_t row;
      memcpy(&row, bytes.data() + at, sizeof(row));
      sum += row.totreq;
    }
    return sum;
  }
};

// A crash after a rollover and into the next interval: the ended interval's saved rows, the
// next interval's files and the instance records after the checkpoint are all put back, and
// the pages read again count once, sampled as before.
TEST_F(CheckpointTest, CrashAfterARolloverCountsEveryPageOnce) {
  Read(0, 6);  // 3 sampled
  ASSERT_TRUE(analyzer_->writeCheckpoint());
  Read(6, 10);  // 2 more: 5 in the interval
  now_ = kStart + 301;
  analyzer_->rollover();
  Read(10, 14, false);  // 2 more, in the next interval; the next checkpoint never comes
  ASSERT_EQ(5, SavedRequests(kStart));

  CrashAndRestart();
  EXPECT_EQ("/data/live.sm3", analyzer_->resumePosition().file);
  EXPECT_EQ(600, analyzer_->resumePosition().offset);
  EXPECT_EQ(3, SavedRequests(kStart));  // the checkpoint's rows, as that interval's
  EXPECT_FALSE(std::filesystem::exists(analyzer_->historyStore().pathOf(kStart + 300, "q7appot")));
  EXPECT_EQ(3u, HistoryRows("q7txins", sizeof(kq7_q7txins_data_t), kStart + 300));
  EXPECT_TRUE(Rows().empty());

  Read(6, 14);  // read again from the checkpoint's position
  EXPECT_EQ(4, Rows()[App("Shop")]);
  analyzer_->flushInstanceFiles();
  EXPECT_EQ(7u, HistoryRows("q7txins", sizeof(kq7_q7txins_data_t), kStart + 300));
}

// Within one interval the checkpoint's rows become the current rows again; a clean stop is a
// last checkpoint, so the start after it goes on from its end.
TEST_F(CheckpointTest, CrashWithinTheIntervalAndCleanStop) {
  Read(0, 4);
  ASSERT_TRUE(analyzer_->writeCheckpoint());
  Read(4, 8);
  CrashAndRestart();
  EXPECT_EQ(2, Rows()[App("Shop")]);
  EXPECT_EQ(400, analyzer_->resumePosition().offset);
  Read(4, 8);
  EXPECT_EQ(4, Rows()[App("Shop")]);

  analyzer_->finishRun();
  analyzer_ = NewAnalyzer(true, true);
  EXPECT_EQ(4, Rows()[App("Shop")]);
  EXPECT_EQ(800, analyzer_->resumePosition().offset);
  Read(8, 10);
  EXPECT_EQ(5, Rows()[App("Shop")]);
}

// The first position noted after a rollover takes a checkpoint: a crash after it leaves the
// ended interval's rows as they were saved.
TEST_F(CheckpointTest, CrashAfterTheCheckpointThatFollowsARollover) {
  Read(0, 6);
  now_ = kStart + 301;
  analyzer_->rollover();
  Read(6, 8);  // the checkpoint is taken at the first (match 7, not sampled), not the second
  Read(8, 10, false);
  CrashAndRestart();
  EXPECT_EQ(700, analyzer_->resumePosition().offset);
  EXPECT_EQ(3, SavedRequests(kStart));
  EXPECT_TRUE(Rows().empty());
  Read(7, 10);
  EXPECT_EQ(2, Rows()[App("Shop")]);
}

// Checkpoints fall due by time and after a rollover, at the next position noted.
TEST_F(CheckpointTest, TakenWhenDue) {
  Read(0, 1);
  EXPECT_FALSE(std::filesystem::exists(checkpoint()));
  now_ += 10;
  Read(1, 2);
  ASSERT_TRUE(std::filesystem::exists(checkpoint()));
  std::filesystem::remove(checkpoint());
  now_ = kStart + 301;
  analyzer_->rollover();
  EXPECT_FALSE(std::filesystem::exists(checkpoint()));
  Read(2, 3);
  EXPECT_TRUE(std::filesystem::exists(checkpoint()));
}

// A checkpoint that does not load, whatever is wrong with it, is set aside with a trace naming
// it; the analyzer starts from the saved rows as it would without one.
TEST_F(CheckpointTest, BadCheckpointsAreSetAside) {
  Read(0, 4);
  ASSERT_TRUE(analyzer_->writeCheckpoint());
  analyzer_->finishRun();
  std::string good;
  {
    std::ifstream in(checkpoint(), std::ios::binary);
    good.assign(std::istreambuf_iterator<char>(in), {});
  }
  std::string newer = good;
  newer[13] = '2';
  std::string flipped = good;
  flipped[good.size() / 2] ^= 1;
  const std::string cases[] = {"",    "garbage", good.substr(0, good.size() - 3),
                               newer, flipped,   good + "x"};
  for (const std::string& bytes : cases) {
    std::ofstream(checkpoint(), std::ios::binary | std::ios::trunc) << bytes;
    fw::TraceCapture capture("*=ALL");
    analyzer_ = NewAnalyzer(true, true);
    EXPECT_TRUE(capture.contains("Checkpoint " + checkpoint() + " does not load")) << bytes.size();
    EXPECT_TRUE(capture.contains("set aside as " + checkpoint() + ".bad"));
    EXPECT_FALSE(std::filesystem::exists(checkpoint()));
    EXPECT_TRUE(std::filesystem::exists(checkpoint() + ".bad"));
    EXPECT_EQ(2, Rows()[App("Shop")]);  // the interval's saved rows
    EXPECT_EQ("", analyzer_->resumePosition().file);
  }
}

// An interval that cannot be saved at its rollover (a full disk; here a directory where its
// temporary file goes) keeps its rows; no checkpoint is taken until they are saved, so a crash
// meanwhile recovers from the one before; once the disk takes them, both follow.
TEST_F(CheckpointTest, UnsavedIntervalIsKeptAndPutsCheckpointsOff) {
  Read(0, 4);  // 2 sampled
  ASSERT_TRUE(analyzer_->writeCheckpoint());
  Read(4, 6);  // 1 more
  const std::string blocker = dir_.file("dpx/." + std::to_string(kStart) + "_1_q7appot.dat.tmp");
  std::filesystem::create_directories(blocker);
  now_ = kStart + 301;
  analyzer_->rollover();
  EXPECT_EQ(0, SavedRequests(kStart));
  Read(6, 8);  // the checkpoint due after the rollover is put off
  ASSERT_EQ(history::CheckpointFile::Load::kLoaded,
            history::CheckpointFile(checkpoint()).load(&image_));
  EXPECT_EQ(400, PositionOf(image_));

  std::filesystem::remove(blocker);
  now_ += 1;
  Read(8, 10);
  EXPECT_EQ(3, SavedRequests(kStart));
  ASSERT_EQ(history::CheckpointFile::Load::kLoaded,
            history::CheckpointFile(checkpoint()).load(&image_));
  EXPECT_EQ(900, PositionOf(image_));
}

// A checkpoint that cannot be written leaves the previous one whole, and processing goes on.
TEST_F(CheckpointTest, FailedWriteKeepsThePreviousCheckpoint) {
  Read(0, 2);
  ASSERT_TRUE(analyzer_->writeCheckpoint());
  // The temporary file cannot be created where a directory stands in the way.
  std::filesystem::create_directories(dir_.file("blocker"));
  analyzer_.reset();
  auto blocked = std::make_unique<CDPXAnalyzer>(
      CDPXAnalyzer::Paths{dir_.file("dpx"), dir_.file("q7state.properties"), "",
                          dir_.file("nodir/x/../../blocker"), ""});
  blocked->startRun();
  EXPECT_FALSE(blocked->writeCheckpoint());
  blocked.reset();
  analyzer_ = NewAnalyzer(true, true);
  EXPECT_EQ(200, analyzer_->resumePosition().offset);
}

// With checkpoints off, an earlier run's checkpoint is removed at start: were checkpoints
// turned on again later, loading it would put back rows and a position long overtaken.
TEST_F(CheckpointTest, TurnedOffRemovesTheOldCheckpoint) {
  Read(0, 4);
  ASSERT_TRUE(analyzer_->writeCheckpoint());
  analyzer_.reset();
  fw::TraceCapture capture("*=ALL");
  auto off = std::make_unique<CDPXAnalyzer>(
      CDPXAnalyzer::Paths{dir_.file("dpx"), dir_.file("q7state.properties"), "", "", checkpoint()});
  off->startRun();
  EXPECT_FALSE(std::filesystem::exists(checkpoint()));
  EXPECT_TRUE(capture.contains("removed the checkpoint " + checkpoint()));
  EXPECT_EQ("", off->resumePosition().file);
}

}  // namespace
