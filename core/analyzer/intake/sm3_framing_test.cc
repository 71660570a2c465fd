#include "core/analyzer/intake/sm3_framing.h"

#include <gtest/gtest.h>

#include <random>
#include <string>
#include <utility>
#include <vector>

#include "core/analyzer/intake/sm3_entry.h"
#include "framework/trace_capture.h"
#include "tests/support/sm3_lines.h"

namespace {

using q7test::Record;

// Remembers every record a pass hands over; refuses the record numbered stopAt (from 0).
class RecordingSink : public CSM3RecordSink {
 public:
  explicit RecordingSink(int stopAt = -1) : stopAt_(stopAt) {}
  bool processSM3Line(char* line, int recordType) override {
    if (static_cast<int>(records.size()) == stopAt_) {
      return false;
    }
    records.emplace_back(recordType, line);
    return true;
  }
  std::vector<std::pair<int, std::string>> records;

 private:
  int stopAt_;
};

struct Pass {
  long consumed;
  std::vector<std::pair<int, std::string>> records;
};

Pass RunPass(std::string chunk, bool full = false, int stopAt = -1) {
  RecordingSink sink(stopAt);
  const long consumed =
      processDPXContents(chunk.data(), static_cast<long>(chunk.size()), full, sink);
  return {consumed, sink.records};
}

struct Found {
  int result = -1;
  long header = -1;
  long trailer = -1;
  int headerLength = 0;
  int trailerLength = 0;
  int type = 0;
  bool operator==(const Found&) const = default;
};

Found Find(std::string& buffer, bool literal = false) {
  Found f;
  char* h = nullptr;
  char* t = nullptr;
  f.result = literal ? sm3_internal::findHeaderLiteral(buffer.data(), &h, &t, &f.headerLength,
                                                       &f.trailerLength, &f.type)
                     : sm3_internal::findHeaderQuiet(buffer.data(), &h, &t, &f.headerLength,
                                                     &f.trailerLength, &f.type);
  if (f.result == 0) {
    f.header = h - buffer.data();
    f.trailer = t - buffer.data();
  }
  return f;
}

// The earliest header wins whatever the search order of the kinds; a trailer before its header
// does not count.
TEST(FindHeaderTest, EarliestKindAndTrailerAfterHeader) {
  std::string chunk =
      std::string(10, 'x') + "<hobj>o</hobj>" + std::string(26, 'y') + "<hpage>p</hpage>";
  ASSERT_EQ(50u, chunk.find("<hpage>"));
  Found f = Find(chunk);
  EXPECT_EQ(0, f.result);
  EXPECT_EQ(10, f.header);
  EXPECT_EQ(SM3_RECORD_HOBJ, f.type);
  EXPECT_EQ(6, f.headerLength);
  EXPECT_EQ(7, f.trailerLength);

  std::string early = "</video><video>v</video>";
  f = Find(early);
  EXPECT_EQ(SM3_RECORD_VIDEO, f.type);
  EXPECT_EQ(8, f.header);
  EXPECT_EQ(16, f.trailer);

  std::string none = "no tags <hpag </hpage>";
  EXPECT_EQ(1, Find(none).result);
  std::string open = "<audio>still being written";
  EXPECT_EQ(2, Find(open).result);
}

// The fast search gives what searching every kind over the whole buffer gives, on chunks
// dense with whole and broken tags.
TEST(FindHeaderTest, FastSearchAgreesWithLiteralSearch) {
  const std::vector<std::string> pieces = {
      "<hpage>", "</hpage>", "<hobj>", "</hobj>", "<audio>", "</audio>", "<video>", "</video>",
      "<hp",     "<",        "</",     "<hobjx",  "a^b",     "\r\n",     "<vid",    "zz"};
  std::mt19937 rng(7);
  for (int round = 0; round < 20000; ++round) {
    std::string chunk;
    const int n = static_cast<int>(rng() % 12);
    for (int i = 0; i < n; ++i) {
      chunk += pieces[rng() % pieces.size()];
    }
    std::string copy = chunk;
    ASSERT_EQ(Find(copy, true), Find(chunk)) << chunk;
  }
}

// Line ends after the trailer belong to the record; bytes before the header are passed over
// but not consumed, and the remaining count keeps them.
TEST(GetSM3LineTest, ConsumesLineEndsButNotLeadingJunk) {
  std::string chunk = Record(1, "a^b", "\r\n\r\n") + Record(2, "c");
  char* cursor = chunk.data();
  long remaining = static_cast<long>(chunk.size());
  long consumed = -1;
  int type = 0;
  auto line = getSM3Line(&cursor, &remaining, false, &consumed, &type);
  ASSERT_TRUE(line);
  EXPECT_STREQ("a^b", line.get());
  EXPECT_EQ(1, type);
  EXPECT_EQ(7 + 3 + 8 + 4, consumed);
  EXPECT_EQ('<', *cursor);
  EXPECT_EQ(static_cast<long>(chunk.size()) - consumed, remaining);

  std::string junky = "0123456789" + Record(3, "x");
  cursor = junky.data();
  remaining = static_cast<long>(junky.size());
  line = getSM3Line(&cursor, &remaining, false, &consumed, &type);
  ASSERT_TRUE(line);
  EXPECT_EQ(7 + 1 + 8 + 1, consumed);
  EXPECT_EQ(10, remaining);
  EXPECT_EQ(junky.data() + junky.size(), cursor);
}

// A chunk of exactly the read size may end inside a record because of the read: the messages
// say so instead of reporting an error.
TEST(GetSM3LineTest, MessagesDependOnFullBuffer) {
  fw::TraceCapture capture("*=ALL");
  std::string cut = std::string(MAX_BUFFER - 10, ' ') + "<hpage>abc";
  ASSERT_EQ(MAX_BUFFER, static_cast<long>(cut.size()));
  Pass pass = RunPass(cut, true);
  EXPECT_EQ(0, pass.consumed);
  EXPECT_TRUE(capture.contains(
      "findHeader Found sm3 record header[<hpage>] but not it's associated trailer[</hpage>].  "
      "May be because of MAX_BUFFER."));
  EXPECT_TRUE(capture.contains("Failed to find sm3 line header, most likely due to MAX_BUFFER."));
  EXPECT_FALSE(capture.contains("ERROR"));

  capture.clear();
  RunPass("<hpage>abc");
  EXPECT_TRUE(
      capture.contains("findHeader ERROR: Found sm3 record header[<hpage>] but not it's associated "
                       "trailer[</hpage>]!"));
  EXPECT_TRUE(capture.contains("ERROR Failed to find sm3 line header"));

  capture.clear();
  RunPass(std::string(MAX_BUFFER, 'j'), true);
  EXPECT_TRUE(
      capture.contains("findHeader Unable to find any sm3 record header.  May be because "
                       "of MAX_BUFFER"));
  capture.clear();
  RunPass("junk only");
  EXPECT_TRUE(capture.contains("findHeader ERROR: unable to find any sm3 record header!"));
}

// A pass takes every whole record in order and leaves an unfinished one unconsumed.
TEST(ProcessContentsTest, WholeRecordsOnly) {
  const std::string whole = Record(1, "p") + Record(2, "o1", "\r\n") + Record(4, "v", "");
  Pass pass = RunPass(whole + "<audio>half");
  EXPECT_EQ(static_cast<long>(whole.size()), pass.consumed);
  ASSERT_EQ(3u, pass.records.size());
  EXPECT_EQ(std::make_pair(1, std::string("p")), pass.records[0]);
  EXPECT_EQ(std::make_pair(2, std::string("o1")), pass.records[1]);
  EXPECT_EQ(std::make_pair(4, std::string("v")), pass.records[2]);
}

// A record the sink refuses (shutdown) and everything after it stay unconsumed, and the chunk,
// whose records are handed over in place, reads as it did.
TEST(ProcessContentsTest, RefusedRecordIsNotConsumed) {
  const std::string first = Record(1, "p");
  std::string chunk = first + Record(2, "o") + Record(2, "o");
  const std::string original = chunk;
  RecordingSink sink(1);
  EXPECT_EQ(static_cast<long>(first.size()),
            processDPXContents(chunk.data(), static_cast<long>(chunk.size()), false, sink));
  EXPECT_EQ(1u, sink.records.size());
  EXPECT_EQ(original, chunk);
}

// A NUL byte in a data file neither hides the records after it nor stalls the offset.
TEST(ProcessContentsTest, NulBytesDoNotHideRecords) {
  std::string chunk = std::string("ju\0nk", 5) + Record(1, std::string("a\0b", 3)) + Record(2, "c");
  Pass pass = RunPass(chunk);
  ASSERT_EQ(2u, pass.records.size());
  EXPECT_EQ("a b", pass.records[0].second);
  EXPECT_EQ(static_cast<long>(chunk.size()) - 5, pass.consumed);
}

// The offset lags by the junk skipped, so the next pass starts that many bytes early and a
// record whose header lies in that stretch is taken a second time.
TEST(ProcessContentsTest, SkippedBytesMakeTheNextPassStartEarly) {
  const std::string r1 = Record(1, "one");
  const std::string r2 = Record(1, "two");
  const std::string file = std::string(r1.size() + r2.size(), '#') + r1 + r2;
  Pass first = RunPass(file);
  ASSERT_EQ(2u, first.records.size());
  ASSERT_EQ(static_cast<long>(r1.size() + r2.size()), first.consumed);
  // The next pass reads from the consumed offset: right at r1 again.
  Pass second = RunPass(file.substr(first.consumed));
  ASSERT_EQ(2u, second.records.size());
  EXPECT_EQ("one", second.records[0].second);
}

}  // namespace
