// The stream's bytes: framing of every line, line ends, junk blocks and the cut-off tail, and
// that none of these change the records.

#include "collector/sm3gen/record_stream.h"

#include <gtest/gtest.h>

#include "collector/sm3gen/test_support.h"

namespace sm3gen {
namespace {

using testing::Generate;
using testing::ReadLines;

ModelOptions StreamModel() {
  ModelOptions options;
  options.start = 1795450020;
  options.av_share = 10;
  return options;
}

StreamOptions Stream(LineEnd line_end, int64_t junk_every = 0) {
  StreamOptions stream;
  stream.line_end = line_end;
  stream.junk_every = junk_every;
  return stream;
}

// Every line is one record between matching tags, with the layout's number of carets and no
// '<' inside.
TEST(sm3genStream, EveryLineIsOneFramedRecord) {
  for (LineEnd line_end : {LineEnd::kLf, LineEnd::kCrLf, LineEnd::kMixed}) {
    const auto out = Generate(StreamModel(), Stream(line_end), 2000);
    const auto lines = ReadLines(out.bytes);
    ASSERT_EQ(2000u, lines.size());
    int crlf = 0;
    for (const auto& line : lines) {
      ASSERT_EQ("", line.junk);
      ASSERT_EQ(line.tag, line.trailer) << line.content;
      const bool page_layout = line.tag == "hpage" || line.tag == "hobj";
      ASSERT_TRUE(page_layout || line.tag == "audio" || line.tag == "video") << line.tag;
      ASSERT_EQ(page_layout ? 45 : 30, std::count(line.content.begin(), line.content.end(), '^'));
      ASSERT_EQ(std::string::npos, line.content.find_first_of(std::string("<\r\0", 3)));
      crlf += line.eol == "\r\n";
      ASSERT_FALSE(line.eol.empty());
    }
    EXPECT_EQ(line_end == LineEnd::kLf, crlf == 0);
    EXPECT_EQ(line_end == LineEnd::kCrLf, crlf == 2000);
  }
}

TEST(sm3genStream, LineEndsJunkAndTailLeaveRecordsAlone) {
  const auto plain = Generate(StreamModel(), Stream(LineEnd::kLf), 500);
  const auto noisy = Generate(StreamModel(), Stream(LineEnd::kMixed, 3), 500, true);
  const auto a = ReadLines(plain.bytes);
  const auto b = ReadLines(noisy.bytes);
  ASSERT_EQ(501u, b.size());
  for (size_t i = 0; i < a.size(); ++i) {
    ASSERT_EQ(a[i].content, b[i].content) << i;
  }
  EXPECT_EQ(plain.truth["applications"], noisy.truth["applications"]);
  EXPECT_EQ(plain.truth["by_kind"], noisy.truth["by_kind"]);
}

// Junk comes before every Nth record only: 1-40 bytes, never '<' or NUL, some of them high.
TEST(sm3genStream, JunkBlocksPrecedeEveryNthRecord) {
  const auto out = Generate(StreamModel(), Stream(LineEnd::kLf, 3), 600);
  const auto lines = ReadLines(out.bytes);
  bool high = false;
  for (size_t i = 0; i < lines.size(); ++i) {
    const std::string& junk = lines[i].junk;
    if ((i + 1) % 3 != 0) {
      EXPECT_EQ("", junk) << i;
      continue;
    }
    EXPECT_TRUE(junk.size() >= 1 && junk.size() <= 40) << i;
    EXPECT_EQ(std::string::npos, junk.find('\0'));
    for (unsigned char c : junk) {
      high |= c >= 0x80;
      EXPECT_TRUE(c >= 0x80 || (c >= 0x20 && c < 0x7f)) << int{c};
    }
    EXPECT_FALSE(lines[i].tag.empty());  // the record still starts at the first '<'
  }
  EXPECT_TRUE(high);
  EXPECT_EQ(200, out.truth["junk_blocks"]);
  EXPECT_EQ(600, out.truth["records"]);
}

TEST(sm3genStream, TruncatedTailEndsWithoutTrailerAndIsNotCounted) {
  for (uint64_t seed = 1; seed <= 20; ++seed) {
    ModelOptions options = StreamModel();
    options.seed = seed;
    const auto whole = Generate(options, Stream(LineEnd::kCrLf), 50);
    const auto cut = Generate(options, Stream(LineEnd::kCrLf), 50, true);
    ASSERT_TRUE(cut.bytes.starts_with(whole.bytes));
    const std::string tail = cut.bytes.substr(whole.bytes.size());
    const auto lines = ReadLines(tail);
    ASSERT_EQ(1u, lines.size());
    EXPECT_FALSE(lines[0].tag.empty());
    EXPECT_EQ("", lines[0].trailer);
    EXPECT_EQ(std::string::npos, tail.find("</"));
    EXPECT_EQ("", lines[0].eol);
    EXPECT_EQ(whole.truth["applications"], cut.truth["applications"]);
    EXPECT_EQ(50, cut.truth["records"]);
    EXPECT_EQ(true, cut.truth["truncated_tail"]);
    EXPECT_EQ(cut.bytes.size(), cut.truth["bytes"]);
  }
}

}  // namespace
}  // namespace sm3gen
