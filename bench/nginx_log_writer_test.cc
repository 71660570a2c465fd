#include "bench/nginx_log_writer.h"

#include <gtest/gtest.h>

#include <fstream>
#include <map>
#include <regex>
#include <set>
#include <string>
#include <vector>

#include "tests/support/scratch_dir.h"

namespace bench {
namespace {

constexpr int64_t kEnd = 1795690800;  // 2026-11-26 11:00:00 UTC

std::vector<std::string> Lines(const std::string& path) {
  std::ifstream in(path);
  std::vector<std::string> lines;
  for (std::string line; std::getline(in, line);) {
    lines.push_back(line);
  }
  return lines;
}

class NginxLogWriterTest : public ::testing::Test {
 protected:
  std::vector<std::string> Write(uint64_t lines, int64_t end, LogSummary* summary) {
    const std::string path = dir_.file("access.log");
    std::string error;
    EXPECT_TRUE(WriteNginxLog({lines, 7, end}, path, summary, &error)) << error;
    return Lines(path);
  }
  q7test::ScratchDir dir_;
};

// Every line is nginx-timed; stamps are in nginx's order and end at the asked second.
TEST_F(NginxLogWriterTest, LinesAreNginxTimedInTimeOrder) {
  LogSummary summary;
  const std::vector<std::string> lines = Write(5000, kEnd, &summary);
  ASSERT_EQ(5000u, lines.size());
  EXPECT_EQ(5000u, summary.lines);
  const std::regex timed(
      R"re(^(\S+) - - \[(\d\d)/Nov/2026:(\d\d):(\d\d):(\d\d) \+0000\] "(GET|POST) (/\S*) HTTP/(1\.1|2\.0)" )re"
      R"re((\d{3}) \d+ "([^"]*)" "[^"]+" \d+\.\d{3} (-|\d+\.\d{3})$)re");
  long previous = 0;
  std::map<std::string, int> statuses;
  for (const std::string& line : lines) {
    std::smatch m;
    ASSERT_TRUE(std::regex_match(line, m, timed)) << line;
    EXPECT_EQ(std::string::npos, m[7].str().find('?')) << "no query strings: " << line;
    const long second =
        std::stol(m[2]) * 86400 + std::stol(m[3]) * 3600 + std::stol(m[4]) * 60 + std::stol(m[5]);
    EXPECT_LE(previous, second) << line;
    previous = second;
    ++statuses[m[9].str()];
    ++statuses[m[9].str().substr(0, 1) + "xx"];
  }
  // The last request ended within the second before 11:00:00, the end asked for.
  constexpr long kEndOfDay = 26 * 86400 + 11 * 3600;
  EXPECT_GE(previous, kEndOfDay - 1);
  EXPECT_LE(previous, kEndOfDay);
  EXPECT_GE(summary.last_unix, kEnd - 1);
  EXPECT_LE(summary.last_unix, kEnd);
  EXPECT_GT(summary.last_unix - summary.first_unix, 3600) << "spread over an hour or two";
  for (const char* status : {"200", "304", "301", "302", "403", "404", "5xx"}) {
    EXPECT_GT(statuses[status], 0) << status;
  }
  EXPECT_GT(statuses["200"], 5000 * 7 / 10);
}

// The traffic depends on lines and seed only: another end moves it in time and nothing else.
TEST_F(NginxLogWriterTest, EndOnlyMovesTheTraffic) {
  LogSummary summary;
  std::vector<std::string> first = Write(2000, kEnd, &summary);
  std::vector<std::string> later = Write(2000, kEnd + 86400 + 17, &summary);
  ASSERT_EQ(first.size(), later.size());
  const std::regex stamp(R"(\[[^\]]*\])");
  for (size_t i = 0; i < first.size(); ++i) {
    ASSERT_EQ(std::regex_replace(first[i], stamp, ""), std::regex_replace(later[i], stamp, ""));
  }
}

// Objects come after their page from the same client, whose full URL is their Referer (or,
// for fonts and sprites, their style sheet's); the rest are pages, hotlinks and direct hits.
TEST_F(NginxLogWriterTest, ObjectsFollowTheirPage) {
  LogSummary summary;
  const std::vector<std::string> lines = Write(5000, kEnd, &summary);
  const std::regex fields(R"re(^(\S+) .*"(?:GET|POST) (\S+) [^"]*" (\d+) \d+ "([^"]*)")re");
  const std::regex object(R"(\.(css|js|woff2|png|jpg|gif|svg|ico)$)");
  std::set<std::string> seen;  // client + " " + full URL requested so far
  int objects = 0;
  int claimed = 0;
  int ipv6 = 0;
  for (const std::string& line : lines) {
    std::smatch m;
    ASSERT_TRUE(std::regex_search(line, m, fields)) << line;
    const std::string client = m[1];
    ipv6 += client.find(':') != std::string::npos ? 1 : 0;
    if (std::regex_search(m[2].str(), object)) {
      ++objects;
      claimed += seen.count(client + " " + m[4].str()) != 0 ? 1 : 0;
    }
    seen.insert(client + " http://" + kLogHost + m[2].str());
  }
  EXPECT_GT(objects, 5000 / 2);
  EXPECT_GT(claimed, objects * 9 / 10) << "most objects name a page their client fetched";
  EXPECT_LT(claimed, objects) << "some are hotlinked";
  EXPECT_GT(ipv6, 0);
}

}  // namespace
}  // namespace bench
