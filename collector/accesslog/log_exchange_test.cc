#include "collector/accesslog/log_exchange.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <string>
#include <vector>

#include "tests/support/scratch_dir.h"

namespace accesslog {
namespace {

constexpr int64_t kSecond = 1000000;

TEST(LogExchangeTest, ExtensionsMakePagesObjectsAndMedia) {
  EXPECT_EQ(ContentTypeOf("/"), "text/html");
  EXPECT_EQ(ContentTypeOf("/shop/cart.php?x=a.png"), "text/html");
  EXPECT_EQ(ContentTypeOf("/api/items"), "text/html");
  EXPECT_EQ(ContentTypeOf("/static/site.CSS?v=3"), "text/css");
  EXPECT_EQ(ContentTypeOf("/img/logo.png#top"), "image/png");
  EXPECT_EQ(ContentTypeOf("/a.b/track.mp3"), "audio/mpeg");
  EXPECT_EQ(ContentTypeOf("/v/clip.webm"), "video/webm");
}

TEST(LogExchangeTest, TimesFromTheStampAndTheRequestTime) {
  ServerSide server;
  server.host = "fallback.example";
  server.port = 443;
  LogEntry entry;
  entry.client = "2001:db8::7";
  entry.method = "GET";
  entry.target = "/a.html";
  entry.protocol = "HTTP/1.0";
  entry.status = 200;
  entry.body_bytes = 512;
  entry.time_us = 1000 * kSecond;  // nginx: when the request ended
  entry.request_time_us = 250000;
  entry.upstream_time_us = 180000;
  capture::HttpExchange e;
  ToExchange(entry, server, &e);
  EXPECT_TRUE(e.connection.client.v6);
  EXPECT_EQ(e.start, 1000 * kSecond - 250000);
  EXPECT_EQ(e.response_last, 1000 * kSecond);
  EXPECT_EQ(e.response_first - e.request_last, 180000);  // the server time
  EXPECT_EQ(e.response_bytes, 512u);
  EXPECT_EQ(e.request.host, "fallback.example");
  EXPECT_EQ(e.response.version_minor, 0);
  EXPECT_EQ(e.connection.server_port, 443);

  // Apache: the stamp is the start; no upstream, so the whole time is the server's.
  entry.time_is_start = true;
  entry.upstream_time_us = -1;
  entry.vhost = "shop.example";
  entry.client = "proxy.corp.example";  // logged by name
  ToExchange(entry, server, &e);
  EXPECT_EQ(e.start, 1000 * kSecond);
  EXPECT_EQ(e.response_last, 1000 * kSecond + 250000);
  EXPECT_EQ(e.response_first - e.request_last, 250000);
  EXPECT_EQ(e.request.host, "shop.example");
  EXPECT_EQ(e.client_name, "proxy.corp.example");
}

// sm3logs --read on a small nginx-timed log: records in page-view order, exact times, bad lines
// skipped and counted, never fatal.
TEST(Sm3logsTest, ReadsALogIntoRecords) {
  q7test::ScratchDir dir;
  const std::string ua = "\"Mozilla/5.0 (X11) \\\"quoted\\\"\"";
  std::string log =
      "192.0.2.1 - - [24/Nov/2026:10:00:00 +0000] \"GET /index.html HTTP/1.1\" 200 5120 \"-\" " +
      ua + " 0.120 0.100\n" +
      "192.0.2.1 - - [24/Nov/2026:10:00:00 +0000] \"GET /s.css HTTP/1.1\" 200 900 "
      "\"https://shop.example/index.html\" " +
      ua + " 0.010 -\n" + "this is not a log line\n" + std::string(1 << 20, 'x') + "\n" +
      "192.0.2.9 - - [24/Nov/2026:11:00:00 +0100] \"POST /api/cart HTTP/1.1\" 503 0 \"-\" \"-\" "
      "1.005 1.000\n" +
      std::string("\x01\x02\xff binary\n");
  dir.write("access.log", log);
  const std::string out = dir.file("out.sm3");
  const std::string err = dir.file("err.txt");
  const pid_t pid = fork();
  if (pid == 0) {
    std::freopen(err.c_str(), "w", stderr);
    execl(SM3LOGS_PATH, SM3LOGS_PATH, "--format", "nginx-timed", "--read",
          dir.file("access.log").c_str(), "--out", out.c_str(), "--host", "shop.example",
          "--server-address", "198.51.100.5", "--server-port", "443", static_cast<char*>(nullptr));
    _exit(127);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  const std::string errors = dir.read("err.txt");
  ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << errors;
  EXPECT_NE(errors.find("lines=6 bad_lines=3 records=3 pages=2 objects=1"), std::string::npos)
      << errors;
  EXPECT_NE(errors.find("this is not a log line"), std::string::npos) << errors;

  std::vector<std::vector<std::string>> records;
  const std::string text = dir.read("out.sm3");
  for (size_t at = 0; (at = text.find('<', at)) != std::string::npos;) {
    const size_t open_end = text.find('>', at);
    const size_t close = text.find("</", open_end);
    const std::string content = text.substr(open_end + 1, close - open_end - 1);
    std::vector<std::string> fields;
    size_t start = 0;
    for (size_t caret; (caret = content.find('^', start)) != std::string::npos; start = caret + 1) {
      fields.push_back(content.substr(start, caret - start));
    }
    fields.push_back(content.substr(start));
    records.push_back(fields);
    at = text.find('\n', close);
  }
  ASSERT_EQ(records.size(), 3u) << text;
  // The POST's view (a page of its own, no Referer) is written at once; the index page's
  // view, with its style sheet, at the end of the log.
  const auto& post = records[0];
  const auto& page = records[1];
  const auto& css = records[2];
  EXPECT_EQ(post[22], "/api/cart");
  EXPECT_EQ(post[5], "1795514398");  // ended 10:00:00 UTC (11:00 +0100), 1.005 s long
  EXPECT_EQ(post[14], "1005");
  EXPECT_EQ(post[28], "1000");
  EXPECT_EQ(post[35], "5");
  EXPECT_EQ(post[27], "503");
  EXPECT_EQ(post[45], "2");
  EXPECT_EQ(page[22], "/index.html");
  EXPECT_EQ(page[10], "192.0.2.1");
  EXPECT_EQ(page[12], "198.51.100.5");
  EXPECT_EQ(page[13], "443");
  EXPECT_EQ(page[39], "shop.example");
  EXPECT_EQ(page[14], "120");  // its own request time: the style sheet ended inside it
  EXPECT_EQ(page[28], "100");
  EXPECT_EQ(page[31], "1");  // one object
  EXPECT_EQ(page[32], "900");
  EXPECT_EQ(page[24], "Mozilla/5.0 (X11) \"quoted\"");
  EXPECT_EQ(css[22], "/s.css");
  EXPECT_EQ(css[14], "10");
  EXPECT_EQ(css[28], "10");  // no upstream: the whole request time is the server's
}

}  // namespace
}  // namespace accesslog
