#include "collector/capture/record_output.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <string>

#include "collector/common/process.h"
#include "collector/common/unique_fd.h"
#include "tests/support/scratch_dir.h"

namespace capture {
namespace {

sm3gen::Record Page(int n, size_t url_size = 10) {
  sm3gen::Record r;
  r.url = "/" + std::string(url_size, 'a') + std::to_string(n);
  r.referrer = "N/A";
  return r;
}

// Everything a non-blocking reader can take now.
std::string Drain(int fd) {
  std::string out;
  char buffer[65536];
  for (ssize_t n; (n = ::read(fd, buffer, sizeof(buffer))) > 0;) {
    out.append(buffer, static_cast<size_t>(n));
  }
  return out;
}

class FifoOutputTest : public ::testing::Test {
 protected:
  void SetUp() override { ::signal(SIGPIPE, SIG_IGN); }
  collector::UniqueFd OpenReader() {
    return collector::UniqueFd(::open(path_.c_str(), O_RDONLY | O_NONBLOCK));
  }

  q7test::ScratchDir scratch_;
  std::string path_ = scratch_.file("sm3.fifo");
  CaptureStats stats_;
  std::string error_;
};

TEST_F(FifoOutputTest, RecordsWaitForAReaderAndOverflowIsCounted) {
  FifoOutput out(&stats_, /*max_queued_bytes=*/600);
  ASSERT_TRUE(out.Open(path_, &error_)) << error_;
  EXPECT_FALSE(out.connected());
  for (int i = 0; i < 20; ++i) {
    out.Write(Page(i));  // about 100 bytes each: the queue holds six
  }
  EXPECT_EQ(stats_.records, 6u);
  EXPECT_EQ(stats_.records_lost, 14u);
  collector::UniqueFd reader = OpenReader();
  ASSERT_TRUE(reader.valid());
  ASSERT_TRUE(out.Finish(std::chrono::steady_clock::now() + std::chrono::seconds(2), &error_));
  const std::string text = Drain(reader.get());
  EXPECT_EQ(text.find("<hpage>"), 0u);
  EXPECT_NE(text.find("/aaaaaaaaaa5^"), std::string::npos);
  EXPECT_EQ(text.find("/aaaaaaaaaa6^"), std::string::npos);
  EXPECT_EQ(text.back(), '\n');
}

TEST_F(FifoOutputTest, AReaderThatLeavesMidRecordCostsOnlyThatRecord) {
  ASSERT_TRUE(collector::EnsureFifo(path_, &error_)) << error_;
  collector::UniqueFd reader = OpenReader();
  FifoOutput out(&stats_);
  ASSERT_TRUE(out.Open(path_, &error_)) << error_;
  ASSERT_TRUE(out.connected());
  // Far more than the pipe holds, in records of 250 bytes.
  for (int i = 0; i < 2000; ++i) {
    out.Write(Page(i, 200));
  }
  ASSERT_TRUE(out.Pump(&error_));
  const std::string first = Drain(reader.get());
  reader.reset();  // gone, most likely in the middle of a record
  ASSERT_TRUE(out.Pump(&error_));
  EXPECT_FALSE(out.connected());
  // A new reader starts on a whole record, and every record is either read whole or lost.
  collector::UniqueFd next = OpenReader();
  std::string second;
  const std::string last = "/" + std::string(200, 'a') + "1999^";
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (std::chrono::steady_clock::now() < deadline && second.find(last) == std::string::npos) {
    ASSERT_TRUE(out.Pump(&error_));
    second += Drain(next.get());
  }
  EXPECT_EQ(second.compare(0, 7, "<hpage>"), 0);
  const auto count = [](const std::string& text) {
    size_t n = 0;
    for (size_t at = 0; (at = text.find("</hpage>\n", at)) != std::string::npos; ++at) {
      ++n;
    }
    return n;
  };
  EXPECT_EQ(count(second) + count(first), stats_.records);
  EXPECT_EQ(stats_.records + stats_.records_lost, 2000u);
  // The pipe's 64 KiB end inside a record, whose rest is dropped; at a boundary nothing is.
  EXPECT_EQ(stats_.records_lost, first.back() == '\n' ? 0u : 1u);
}

}  // namespace
}  // namespace capture
