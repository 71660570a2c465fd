#include "framework/trace.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <stdlib.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "framework/status.h"
#include "framework/trace_capture.h"
#include "tests/support/scratch_dir.h"

namespace fw {
namespace {

// Restores the masks a test changes.
class TraceMaskTest : public ::testing::Test {
 protected:
  void SetUp() override { saved_ = TraceMasksText(); }
  void TearDown() override { ASSERT_EQ(kOk, TraceConfigure(saved_, nullptr)); }

  void Configure(std::string_view masks) {
    std::string error;
    ASSERT_EQ(kOk, TraceConfigure(masks, &error)) << error;
  }

 private:
  std::string saved_;
};

// The operator's example: '*' for the rest, names and hex for the units named.
TEST_F(TraceMaskTest, ParsesStarNamesAndHex) {
  Configure("*=ERROR analyzer=ALL intake=0x12");
  EXPECT_EQ(kTraceAll, TraceMask("analyzer"));
  EXPECT_EQ(kTraceSummary | kTraceDetail, TraceMask("intake"));
  EXPECT_EQ(kTraceError, TraceMask("tama"));
  EXPECT_TRUE(TraceEnabled("intake", kTraceDetail));
  EXPECT_FALSE(TraceEnabled("intake", kTraceFlow));
}

TEST_F(TraceMaskTest, EmptySpecMeansErrorClassOnly) {
  Configure("tama=ALL");
  Configure("");
  EXPECT_EQ(kTraceError, TraceMask("tama"));
  EXPECT_EQ(kTraceError, TraceMask("anything"));
}

// Class names combine with '|', in any case, with decimal and hex parts.
TEST_F(TraceMaskTest, CombinesClassNamesAndNumbers) {
  Configure("a=SUMMARY|detail b=18 c=NONE|DEBUG d=FLOW|0x80 e=none\tf=0X0f");
  EXPECT_EQ(kTraceSummary | kTraceDetail, TraceMask("a"));
  EXPECT_EQ(18u, TraceMask("b"));
  EXPECT_EQ(kTraceDebug, TraceMask("c"));
  EXPECT_EQ(kTraceFlow | kTraceError, TraceMask("d"));
  EXPECT_EQ(0u, TraceMask("e"));
  EXPECT_EQ(0x0Fu, TraceMask("f"));
}

// A later word wins for what it names; '*' names every unit, including earlier ones.
TEST_F(TraceMaskTest, LaterWordsOverride) {
  Configure("tama=ALL tama=DEBUG");
  EXPECT_EQ(kTraceDebug, TraceMask("tama"));
  Configure("analyzer=ALL *=NONE");
  EXPECT_EQ(0u, TraceMask("analyzer"));
  Configure("*=NONE analyzer=FLOW|ERROR");
  EXPECT_EQ(kTraceFlow | kTraceError, TraceMask("analyzer"));
  EXPECT_EQ(0u, TraceMask("tama"));
}

// A bad word rejects the whole text and names itself; the masks stay as they were.
TEST_F(TraceMaskTest, BadWordsKeepPreviousMasks) {
  Configure("tama=ALL");
  for (const char* bad : {"tama", "=ALL", "tama=BOGUS", "tama=0x", "tama=0x100", "tama=ALL|",
                          "tama=0xZZ", "tama=12abc", "tama=", "x=ALL tama=-1"}) {
    std::string error;
    EXPECT_EQ(kParseError, TraceConfigure(bad, &error)) << bad;
    const std::string word = std::string(bad).substr(std::string(bad).rfind(' ') + 1);
    EXPECT_NE(std::string::npos, error.find(word)) << error;
    EXPECT_EQ(kTraceAll, TraceMask("tama")) << bad;
    EXPECT_EQ(kTraceError, TraceMask("x")) << bad;
  }
  EXPECT_EQ(kParseError, TraceConfigure("tama=BOGUS", nullptr));
}

void FlowTracedFunction() {
  Q7_FLOW("tama");
}

// Records carry the thread name, unit, class label and function.
TEST(TraceRecordTest, RecordsCarryThreadUnitClassAndFunction) {
  TraceCapture capture;
  std::thread([] {
    SetThreadName("Worker One");
    TracePrintf("tama", kTraceDetail, "prepare", "dir=%s n=%d", "/opt", 5);
    TraceWrite("runtime", kTraceError | kTraceDebug, "", "no function");
    TraceWrite("runtime", 0x20, "f", "unnamed bit\n");
  }).join();
  const std::vector<std::string> lines = capture.lines();
  ASSERT_EQ(3u, lines.size());
  EXPECT_EQ("[Worker One] tama DETAIL prepare: dir=/opt n=5", lines[0]);
  EXPECT_EQ("[Worker One] runtime ERROR no function", lines[1]);
  EXPECT_EQ("[Worker One] runtime 0x20 f: unnamed bit", lines[2]);
}

// Records always written that are not failures say what they are, and are gated like errors: the
// default mask keeps them, a unit traced at NONE drops them.
TEST(TraceRecordTest, InfoAndWarningAreGatedLikeErrorsButNotLabelledSo) {
  TraceCapture capture("*=ERROR quiet=NONE");
  TracePrintf("tama", kTraceInfo, "run", "Starting process with command %s", "/bin/sh");
  TracePrintf("tama", kTraceWarning, "start", "Warning: %s", "path");
  TracePrintf("quiet", kTraceInfo, "run", "hidden info");
  TracePrintf("quiet", kTraceWarning, "run", "hidden warning");
  const std::vector<std::string> lines = capture.lines();
  ASSERT_EQ(2u, lines.size());
  EXPECT_NE(std::string::npos,
            lines[0].find("] tama INFO run: Starting process with command /bin/sh"));
  EXPECT_NE(std::string::npos, lines[1].find("tama WARN start: Warning: path"));
  EXPECT_TRUE(TraceEnabled("tama", kTraceInfo));
  EXPECT_FALSE(TraceEnabled("quiet", kTraceWarning));
}

// Masks gate TracePrintf and flow events, never the unconditional writers.
TEST(TraceRecordTest, MasksGateConditionalWriters) {
  TraceCapture capture("*=NONE tama=SUMMARY");
  TracePrintf("tama", kTraceDetail, "f", "hidden detail");
  TracePrintf("other", kTraceSummary, "f", "hidden other");
  TracePrintf("tama", kTraceSummary | kTraceDebug, "f", "shown %s", "summary");
  TracePrintfAlways("other", kTraceDebug, "f", "always");
  TraceWrite("other", kTraceDebug, "f", "write");
  FlowTracedFunction();
  EXPECT_FALSE(capture.contains("hidden"));
  EXPECT_TRUE(capture.contains("other DEBUG f: always"));
  EXPECT_TRUE(capture.contains("other DEBUG f: write"));
  EXPECT_TRUE(capture.contains("tama SUMMARY f: shown summary"));  // highest bit names it
  EXPECT_FALSE(capture.contains("ENTER"));
}

TEST(TraceRecordTest, FlowScopeWritesEnterAndExit) {
  TraceCapture capture("tama=FLOW");
  FlowTracedFunction();
  TraceEvent("tama", false, "g", "rc=0");
  EXPECT_EQ(1, capture.count("tama FLOW FlowTracedFunction: ENTER"));
  EXPECT_EQ(1, capture.count("tama FLOW FlowTracedFunction: EXIT"));
  EXPECT_TRUE(capture.contains("tama FLOW g: EXIT rc=0"));
}

TEST(TraceRecordTest, LongTextIsCut) {
  TraceCapture capture;
  const std::string text(10000, 'x');
  TracePrintf("tama", kTraceError, "f", "%s", text.c_str());
  const std::vector<std::string> lines = capture.lines();
  ASSERT_EQ(1u, lines.size());
  EXPECT_NE(std::string::npos, lines[0].find(": " + std::string(8191, 'x')));
  EXPECT_EQ(std::string::npos, lines[0].find(std::string(8192, 'x')));
}

// The full name stays for records; the OS gets 15 characters; unnamed threads use the OS name.
TEST(TraceRecordTest, ThreadNames) {
  std::thread([] {
    SetThreadName("A Very Long Thread Name");
    EXPECT_EQ("A Very Long Thread Name", ThreadName());
    char os_name[16];
    ASSERT_EQ(0, pthread_getname_np(pthread_self(), os_name, sizeof(os_name)));
    EXPECT_STREQ("A Very Long Thr", os_name);
  }).join();
  std::thread([] {
    pthread_setname_np(pthread_self(), "os-named");
    EXPECT_EQ("os-named", ThreadName());
  }).join();
}

// Each test writes into its own temporary directory; records go back to stderr afterwards.
class TraceFileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = scratch_.path();
    path_ = scratch_.file("trace.log");
  }
  void TearDown() override { TraceClose(); }

  void Open(std::size_t max_bytes, std::size_t max_files) {
    std::string error;
    ASSERT_EQ(kOk, TraceOpen(path_, max_bytes, max_files, &error)) << error;
  }

  static std::vector<std::string> ReadLines(const std::string& path) {
    std::ifstream in(path);
    std::vector<std::string> lines;
    for (std::string line; std::getline(in, line);) {
      lines.push_back(line);
    }
    return lines;
  }

  q7test::ScratchDir scratch_;
  std::string dir_;
  std::string path_;
};

// An error record reaches the file at once, with the time stamp and everything before it.
TEST_F(TraceFileTest, ErrorRecordsAreFlushedWithTimestamp) {
  Open(1 << 20, 2);
  TraceWrite("tama", kTraceDetail, "f", "before");
  TraceWrite("tama", kTraceError, "g", "failed");
  const std::vector<std::string> lines = ReadLines(path_);
  ASSERT_EQ(2u, lines.size());
  const std::regex record(
      R"(\d{4}-\d\d-\d\d \d\d:\d\d:\d\d\.\d{3} \[[^\]]+\] tama ERROR g: failed)");
  EXPECT_TRUE(std::regex_match(lines[1], record)) << lines[1];
  EXPECT_NE(std::string::npos, lines[0].find("tama DETAIL f: before"));
}

TEST_F(TraceFileTest, RotatesBySize) {
  Open(4096, 2);
  const std::string text(100, 'r');
  for (int i = 0; i < 200; ++i) {
    TraceWrite("tama", kTraceDetail, "f", text);
  }
  TraceFlush();
  namespace fs = std::filesystem;
  EXPECT_TRUE(fs::exists(dir_ + "/trace.1.log"));
  EXPECT_TRUE(fs::exists(dir_ + "/trace.2.log"));
  EXPECT_FALSE(fs::exists(dir_ + "/trace.3.log"));
  EXPECT_LE(fs::file_size(path_), 4096u);
}

TEST_F(TraceFileTest, FailedOpenKeepsDestination) {
  Open(1 << 20, 1);
  std::string error;
  EXPECT_EQ(kIoError, TraceOpen(dir_ + "/missing/trace.log", 1 << 20, 1, &error));
  EXPECT_NE(std::string::npos, error.find("missing")) << error;
  EXPECT_FALSE(std::filesystem::exists(dir_ + "/missing"));
  EXPECT_EQ(kIoError, TraceOpen(dir_, 1 << 20, 1, &error));  // a directory, not a file
  TraceWrite("tama", kTraceError, "f", "still here");
  EXPECT_EQ(1u, ReadLines(path_).size());
}

// Several threads write while the masks change: every record arrives whole and in order.
TEST_F(TraceFileTest, ConcurrentRecordsStayWhole) {
  Open(64 << 20, 1);
  constexpr int kThreads = 6;
  constexpr int kRecords = 400;
  std::atomic<bool> done{false};
  std::thread reconfigure([&done] {
    while (!done.load()) {
      TraceConfigure("*=ERROR tama=ALL", nullptr);
      TraceEnabled("tama", kTraceDetail);
    }
  });
  std::vector<std::thread> writers;
  for (int t = 0; t < kThreads; ++t) {
    writers.emplace_back([t] {
      SetThreadName(("writer" + std::to_string(t)).c_str());
      const std::string payload(300, static_cast<char>('a' + t));
      for (int i = 0; i < kRecords; ++i) {
        TracePrintfAlways("tama", kTraceDetail, "w", "%d %d %s", t, i, payload.c_str());
      }
    });
  }
  for (std::thread& writer : writers) {
    writer.join();
  }
  done = true;
  reconfigure.join();
  ASSERT_EQ(kOk, TraceConfigure("", nullptr));
  TraceFlush();

  // Time stamp, then "[writerT] tama DETAIL w: T I " and 300 copies of the thread's letter.
  const std::regex head(
      R"(\d{4}-\d\d-\d\d \d\d:\d\d:\d\d\.\d{3} \[writer(\d)\] tama DETAIL w: (\d) (\d+) )");
  std::vector<int> next(kThreads, 0);
  const std::vector<std::string> lines = ReadLines(path_);
  ASSERT_EQ(static_cast<std::size_t>(kThreads * kRecords), lines.size());
  for (const std::string& line : lines) {
    std::smatch m;
    ASSERT_TRUE(std::regex_search(line, m, head, std::regex_constants::match_continuous))
        << line.substr(0, 80);
    const int t = std::stoi(m[1]);
    ASSERT_EQ(m[1], m[2]);
    ASSERT_EQ(next[t], std::stoi(m[3]));
    ++next[t];
    ASSERT_EQ(std::string(300, static_cast<char>('a' + t)), m.suffix().str());
  }
}

}  // namespace
}  // namespace fw
