// sm3capture on captures that Debian ships, with every expected figure worked out by hand from
// the packet times and sequence numbers (tshark -T fields shows them).

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <iterator>
#include <map>
#include <string>
#include <vector>

#include "tests/support/scratch_dir.h"

namespace capture {
namespace {

constexpr char kPcapfixTest[] = "/usr/share/doc/pcapfix/examples/test.pcap";
constexpr char kPcapfixDamaged[] = "/usr/share/doc/pcapfix/examples/test_damaged.pcap";
constexpr char kDpktHttp[] = "/usr/share/doc/python3-dpkt/examples/data/http.pcap";

// One output record: its tag and its fields, numbered from 1 as in the record layouts.
struct Sm3Record {
  std::string tag;
  std::vector<std::string> fields;
  const std::string& operator[](int number) const { return fields.at(number - 1); }
  long Int(int number) const { return std::stol(fields.at(number - 1)); }
};

std::vector<Sm3Record> ParseRecords(const std::string& text) {
  std::vector<Sm3Record> records;
  size_t at = 0;
  while ((at = text.find('<', at)) != std::string::npos) {
    const size_t close = text.find('>', at);
    Sm3Record record;
    record.tag = text.substr(at + 1, close - at - 1);
    const size_t end = text.find("</" + record.tag + ">", close);
    const std::string content = text.substr(close + 1, end - close - 1);
    size_t start = 0;
    for (size_t caret; (caret = content.find('^', start)) != std::string::npos; start = caret + 1) {
      record.fields.push_back(content.substr(start, caret - start));
    }
    record.fields.push_back(content.substr(start));
    records.push_back(std::move(record));
    at = end + record.tag.size() + 3;
  }
  return records;
}

class CaptureGoldenTest : public ::testing::Test {
 protected:
  // The record whose URL is url; fails the test when there is none.
  const Sm3Record& ByUrl(const std::string& url) const {
    for (const Sm3Record& record : records_) {
      if (record.fields.size() > 23 && record[23] == url) {
        return record;
      }
    }
    ADD_FAILURE() << "no record for " << url;
    static const Sm3Record kNone{"", std::vector<std::string>(46, "0")};
    return kNone;
  }
  // Runs sm3capture --read pcap --out <scratch>/out.sm3; returns its exit status.
  int Run(const std::string& pcap) {
    const std::string out = scratch_.file("out.sm3");
    const std::string err = scratch_.file("err.txt");
    const pid_t pid = fork();
    if (pid == 0) {
      std::freopen(err.c_str(), "w", stderr);
      execl(SM3CAPTURE_PATH, SM3CAPTURE_PATH, "--read", pcap.c_str(), "--out", out.c_str(),
            "--collector-id", "golden", static_cast<char*>(nullptr));
      _exit(127);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    records_ = ParseRecords(scratch_.read("out.sm3"));
    stderr_ = scratch_.read("err.txt");
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }
  // A counter from the final summary line.
  long Counter(const std::string& name) const {
    const size_t at = stderr_.find(" " + name + "=");
    return at == std::string::npos ? -1 : std::stol(stderr_.substr(at + name.size() + 2));
  }
  void SetUp() override {
    if (access(kPcapfixTest, R_OK) != 0 || access(kDpktHttp, R_OK) != 0) {
      GTEST_SKIP() << "pcapfix and python3-dpkt are not installed (make deps installs them)";
    }
    setenv("TZ", "UTC", 1);
  }

  q7test::ScratchDir scratch_;
  std::vector<Sm3Record> records_;
  std::string stderr_;
};

// pcapfix's test.pcap: GET / (text/html) and GET /favicon.ico without a Referer, each on a
// connection of its own, so two pages. The icon, a page of its own, is written at once; the
// HTML page's view stays open for objects until the capture ends.
TEST_F(CaptureGoldenTest, PcapfixPageAndFavicon) {
  ASSERT_EQ(Run(kPcapfixTest), 0) << stderr_;
  ASSERT_EQ(records_.size(), 2u) << stderr_;
  EXPECT_EQ(records_[0][23], "/favicon.ico");
  const Sm3Record& page = ByUrl("/");
  EXPECT_EQ(page.tag, "hpage");
  ASSERT_EQ(page.fields.size(), 46u);
  EXPECT_EQ(page[4], "golden");
  EXPECT_EQ(page.Int(6), 1369248420);  // the SYN's second
  EXPECT_EQ(page[11], "172.21.0.1");
  EXPECT_EQ(page.Int(12), 33733);
  EXPECT_EQ(page[13], "64.90.49.112");
  EXPECT_EQ(page.Int(14), 80);
  // SYN at .080467, request at .285347, reply at .488636 (one segment).
  EXPECT_EQ(page.Int(15), 408);  // .488636 - .080467
  EXPECT_EQ(page.Int(29), 203);  // .488636 - .285347
  EXPECT_EQ(page.Int(36), 205);
  EXPECT_EQ(page.Int(31), 0);  // no objects
  EXPECT_EQ(page.Int(16), 1);  // request packets
  EXPECT_EQ(page.Int(17), 1);  // the server's ACK before replying
  EXPECT_EQ(page.Int(18), 1);
  EXPECT_EQ(page.Int(19), 0);  // the client's ACK came after the last reply byte
  EXPECT_EQ(page.Int(21), 378);
  EXPECT_EQ(page.Int(22), 705);
  EXPECT_EQ(page.Int(20), 378 + 705);
  EXPECT_EQ(page[23], "/");
  EXPECT_EQ(page[27], "HTTP/1.1");
  EXPECT_EQ(page.Int(28), 200);
  EXPECT_EQ(page.Int(46), 1);  // GET
  EXPECT_EQ(page[41], "/");
  EXPECT_EQ(page[42], "");

  const Sm3Record& icon = ByUrl("/favicon.ico");
  EXPECT_EQ(icon.tag, "hpage");
  EXPECT_EQ(icon[23], "/favicon.ico");
  EXPECT_EQ(icon[24], "N/A");
  EXPECT_EQ(icon[42], "favicon.ico");
  // SYN at 420.641970, request at 420.843829, reply from 421.044750 to 421.242755.
  EXPECT_EQ(icon.Int(15), 601);
  EXPECT_EQ(icon.Int(29), 201);
  EXPECT_EQ(icon.Int(36), 400);
  EXPECT_EQ(icon.Int(18), 4);
  EXPECT_EQ(icon.Int(19), 3);  // three ACKs between the first and the last reply segment
  EXPECT_EQ(icon.Int(22), 3 * 1460 + 878);
  EXPECT_EQ(Counter("exchanges"), 2);
  EXPECT_EQ(Counter("gaps"), 0);
}

// python3-dpkt's http.pcap: /download.html over 14 reply segments, and an ad (text/html, so a
// page too) on a connection whose SYN the capture missed, with a retransmitted segment.
TEST_F(CaptureGoldenTest, DpktDownloadPageAndMidstreamConnection) {
  ASSERT_EQ(Run(kDpktHttp), 0) << stderr_;
  ASSERT_EQ(records_.size(), 2u) << stderr_;
  // The ad's reply ended first; the download page's own next page closed its view.
  EXPECT_EQ(records_[1][23], "/download.html");
  const Sm3Record& ad = records_[0];
  const Sm3Record& page = records_[1];
  EXPECT_EQ(ad.tag, "hpage");
  EXPECT_EQ(ad[40], "pagead2.googlesyndication.com");
  EXPECT_EQ(ad[41], "/pagead/");
  EXPECT_EQ(ad[42], "ads");
  EXPECT_EQ(ad[43].substr(0, 27), "client=ca-pub-2309191948673");
  EXPECT_EQ(ad[24], "http://www.ethereal.com/download.html");
  // No SYN: the request's own packet at 430.295515 starts it; reply 431.226854-431.266912.
  EXPECT_EQ(ad.Int(6), 1084443430);
  EXPECT_EQ(ad.Int(15), 971);
  EXPECT_EQ(ad.Int(29), 931);
  EXPECT_EQ(ad.Int(36), 40);
  EXPECT_EQ(ad.Int(18), 2);
  EXPECT_EQ(ad.Int(22), 1590);

  EXPECT_EQ(page.tag, "hpage");
  EXPECT_EQ(page[23], "/download.html");
  EXPECT_EQ(page[40], "www.ethereal.com");
  // SYN 427.311224, request 428.222534, reply 428.993643 to 432.158193.
  EXPECT_EQ(page.Int(6), 1084443427);
  EXPECT_EQ(page.Int(15), 4847);
  EXPECT_EQ(page.Int(29), 771);
  EXPECT_EQ(page.Int(36), 4076);
  EXPECT_EQ(page.Int(16), 1);
  EXPECT_EQ(page.Int(17), 1);
  EXPECT_EQ(page.Int(18), 14);
  EXPECT_EQ(page.Int(19), 10);
  EXPECT_EQ(page.Int(21), 479);
  EXPECT_EQ(page.Int(22), 18364);
  EXPECT_EQ(page.Int(28), 200);
  EXPECT_EQ(page[26], "Apache");
  EXPECT_EQ(Counter("retransmissions"), 1);
  EXPECT_EQ(Counter("not_tcp"), 2);  // the DNS query and its answer
}

// A file cut short inside a packet is read up to the damage, and that is not a failure.
TEST_F(CaptureGoldenTest, DamagedFileEndsCleanly) {
  ASSERT_EQ(Run(kPcapfixDamaged), 0) << stderr_;
  EXPECT_NE(stderr_.find("stopping there"), std::string::npos) << stderr_;
  EXPECT_GE(Counter("packets"), 0) << stderr_;
  EXPECT_TRUE(records_.empty());
}

TEST_F(CaptureGoldenTest, UnreadableInputIsExitOne) {
  scratch_.write("junk.pcap", "this is not a capture file at all");
  EXPECT_EQ(Run(scratch_.file("junk.pcap")), 1);
  EXPECT_NE(stderr_.find("cannot read"), std::string::npos) << stderr_;
}

}  // namespace
}  // namespace capture
