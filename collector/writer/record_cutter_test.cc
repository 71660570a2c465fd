// Cutting records out of a stream that arrives in arbitrary pieces.

#include "collector/writer/record_cutter.h"

#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "collector/sm3gen/test_support.h"

namespace collector {
namespace {

class RecordCutterTest : public ::testing::Test {
 protected:
  static std::string Stream(int64_t records, sm3gen::LineEnd line_end, int64_t junk_every = 0) {
    sm3gen::ModelOptions model;
    model.seed = 11;
    model.start = 1795450020;
    return sm3gen::testing::Generate(model, {line_end, junk_every}, records).bytes;
  }
  // Feeds bytes in pieces of the given sizes (the last piece takes the rest).
  void Feed(std::string_view bytes, const std::vector<size_t>& pieces) {
    for (size_t size : pieces) {
      size = std::min(size, bytes.size());
      cutter_.Feed(bytes.substr(0, size), emit_);
      bytes.remove_prefix(size);
    }
    cutter_.Feed(bytes, emit_);
  }
  std::string Joined() const {
    std::string all;
    for (const std::string& record : records_) {
      all += record;
    }
    return all;
  }

  RecordCutter cutter_;
  std::vector<std::string> records_;
  RecordCutter::Emit emit_ = [this](std::string_view record) { records_.emplace_back(record); };
};

// However the stream is cut into reads, the same records come out, each whole.
TEST_F(RecordCutterTest, ByteByByteAndRandomSplitsGiveTheStreamBack) {
  const std::string bytes = Stream(300, sm3gen::LineEnd::kMixed);
  Feed(bytes, std::vector<size_t>(bytes.size(), 1));
  EXPECT_EQ(bytes, Joined());
  EXPECT_EQ(300u, records_.size());
  EXPECT_EQ(0u, cutter_.dropped_bytes());

  std::mt19937 rng(5);
  for (int round = 0; round < 20; ++round) {
    RecordCutter fresh;
    std::vector<std::string> got;
    std::string_view rest = bytes;
    while (!rest.empty()) {
      const size_t size = std::min<size_t>(rest.size(), rng() % 3000 + 1);
      fresh.Feed(rest.substr(0, size), [&](std::string_view r) { got.emplace_back(r); });
      rest.remove_prefix(size);
    }
    ASSERT_EQ(300u, got.size()) << "round " << round;
    for (const std::string& record : got) {
      ASSERT_EQ('<', record.front());
      ASSERT_EQ('\n', record.back());
    }
  }
}

// Until a record's line end has arrived it stays in the buffer, whatever the cut point.
TEST_F(RecordCutterTest, NeverEmitsAPartialRecord) {
  const std::string bytes = Stream(3, sm3gen::LineEnd::kCrLf);
  const size_t first_end = bytes.find("\r\n") + 2;
  for (size_t cut = 1; cut < first_end; ++cut) {
    RecordCutter cutter;
    int emitted = 0;
    cutter.Feed(std::string_view(bytes).substr(0, cut), [&](std::string_view) { ++emitted; });
    ASSERT_EQ(0, emitted) << "cut at " << cut;
    ASSERT_EQ(cut, cutter.pending());
    cutter.Feed(std::string_view(bytes).substr(cut, first_end - cut), [&](std::string_view record) {
      ++emitted;
      EXPECT_EQ(bytes.substr(0, first_end), record);
    });
    ASSERT_EQ(1, emitted) << "cut at " << cut;
  }
}

// Junk between records is dropped; the records are those of the same stream without junk.
TEST_F(RecordCutterTest, JunkBetweenRecordsIsDropped) {
  const std::string junky = Stream(200, sm3gen::LineEnd::kLf, 3);
  const std::string clean = Stream(200, sm3gen::LineEnd::kLf);
  Feed(junky, std::vector<size_t>(junky.size() / 7, 7));
  EXPECT_EQ(clean, Joined());
  EXPECT_EQ(junky.size() - clean.size(), cutter_.dropped_bytes());
}

// A record its producer never finished is dropped when the next record's header arrives, and
// at the end of input; a record missing only its line end is kept at the end.
TEST_F(RecordCutterTest, CutOffRecordsAreDroppedCompleteOnesKept) {
  const std::string record = "<hobj>a^b</hobj>\n";
  Feed("<hpage>1^2^3" + record + "<video>x^y</vid", {5});
  ASSERT_EQ(1u, records_.size());
  EXPECT_EQ(record, records_[0]);
  EXPECT_EQ(12u, cutter_.dropped_bytes());
  EXPECT_EQ(15u, cutter_.Finish(emit_));

  cutter_.Feed("<audio>1</audio>", emit_);
  EXPECT_EQ(1u, records_.size());  // its line end may still come
  cutter_.Feed("\r", emit_);
  cutter_.Feed("\n<audio>2</audio>", emit_);
  EXPECT_EQ(0u, cutter_.Finish(emit_));
  ASSERT_EQ(3u, records_.size());
  EXPECT_EQ("<audio>1</audio>\r\n", records_[1]);
  EXPECT_EQ("<audio>2</audio>\n", records_[2]);
}

// Wrong trailers, unknown tags and records past the size limit are dropped, and cutting
// resumes at the next real record.
TEST_F(RecordCutterTest, MalformedRecordsAreDroppedAndCuttingResumes) {
  const std::string good = "<hpage>ok</hpage>\n";
  Feed("<hpage>a</hobj>\n<div>x</div>\n" + good, {1, 2, 3});
  ASSERT_EQ(1u, records_.size());
  EXPECT_EQ(good, records_[0]);

  const std::string huge = "<hobj>" + std::string(RecordCutter::kMaxRecord, 'x');
  cutter_.Feed(huge, emit_);
  EXPECT_EQ(0u, cutter_.pending());
  cutter_.Feed("</hobj>\n" + good, emit_);
  ASSERT_EQ(2u, records_.size());
  EXPECT_EQ(good, records_[1]);
}

}  // namespace
}  // namespace collector
