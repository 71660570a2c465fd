#include "tama/properties.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

#include "framework/trace_capture.h"
#include "tests/support/scratch_dir.h"

namespace {

class PropertiesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = scratch_.path();
    path_ = scratch_.file("q7details.properties");
  }

  void Write(const std::string& bytes) { scratch_.write("q7details.properties", bytes); }
  std::string Read() { return scratch_.read("q7details.properties"); }

  q7test::ScratchDir scratch_;

  std::string root_;
  std::string path_;
};

// Split at the first '=', nothing trimmed; comments, empty lines and lines without '=' are
// ignored, and a later line wins.
TEST_F(PropertiesTest, LoadKeepsNamesAndValuesAsWritten) {
  Write(
      "# a comment\n\n a = b\nurl=http://h/p?x=1\nno equals sign\ndup=1\ndup=2\n"
      "last=no newline");
  Properties props(path_);
  props.load();
  EXPECT_EQ(" b", props.get(" a "));
  EXPECT_EQ("", props.get("a"));
  EXPECT_EQ("http://h/p?x=1", props.get("url"));
  EXPECT_EQ("2", props.get("dup"));
  EXPECT_EQ("no newline", props.get("last"));
  EXPECT_EQ(4u, props.entries().size());
}

// Loading empties the map first; a missing file leaves it empty without complaint.
TEST_F(PropertiesTest, MissingFileGivesAnEmptyMap) {
  Properties props(path_);
  props.set("stale", "1");
  fw::TraceCapture capture;
  props.load();
  EXPECT_TRUE(props.entries().empty());
  EXPECT_EQ(0, capture.count("ERROR"));
}

// Overlong and zero-byte lines are skipped whole, with one error each naming file and line;
// the good lines around them load, and the tail of a long line is not taken for an entry.
TEST_F(PropertiesTest, BadLinesAreSkippedAndTraced) {
  std::string longest(Properties::kMaxLine - 2, 'y');  // "k=" + this: exactly 4095 characters
  std::string junk = "good=1\n" + std::string(10000, 'x') + "=tail\n";
  junk += std::string("nul\0=z\n", 7);
  junk += "\x01\xfe\xff binary\n\x7f=\x80\n";
  junk += "k=" + longest + "\ngood2=2";
  Write(junk);

  fw::TraceCapture capture;
  Properties props(path_);
  props.load();
  EXPECT_EQ("1", props.get("good"));
  EXPECT_EQ("2", props.get("good2"));
  EXPECT_EQ(longest, props.get("k"));
  EXPECT_EQ("\x80", props.get("\x7f"));
  EXPECT_EQ(4u, props.entries().size());

  EXPECT_EQ(1, capture.count("line 2 of properties file \"" + path_ + "\": longer than 4095"));
  EXPECT_EQ(1, capture.count("line 3 of properties file \"" + path_ + "\": it holds a zero byte"));
  EXPECT_EQ(2, capture.count("tama ERROR"));
}

// Every entry, in key order, gets the header line; each line ends in a newline and a zero byte.
TEST_F(PropertiesTest, StoreWritesTheExactBytes) {
  Properties props(path_);
  props.set("b", "2");
  props.set(" a ", " 1");
  ASSERT_TRUE(props.store());
  const std::string header("# Created by the RT Properties class\n\0", 38);
  EXPECT_EQ(header + std::string(" a = 1\n\0", 8) + header + std::string("b=2\n\0", 5), Read());

  // What store() wrote loads back, zero bytes and all, without complaint.
  fw::TraceCapture capture;
  Properties reloaded(path_);
  reloaded.load();
  EXPECT_EQ(props.entries(), reloaded.entries());
  EXPECT_EQ(0, capture.count("tama ERROR"));

  Properties unwritable(root_ + "/no/such/dir/file");
  EXPECT_FALSE(unwritable.store());
}

}  // namespace
