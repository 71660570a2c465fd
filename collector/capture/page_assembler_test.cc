#include "collector/capture/page_assembler.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "collector/sm3gen/record_format.h"

namespace capture {
namespace {

constexpr Micros kSecond = 1000000;
constexpr Micros kMillis = 1000;

class RecordCollector : public RecordSink {
 public:
  void Write(const sm3gen::Record& record) override { records.push_back(record); }
  std::vector<sm3gen::Record> records;
};

// Exchanges of one client (10.0.0.<client>) with shop.example, built by what a test cares about.
HttpExchange Exchange(const std::string& target, const std::string& content_type,
                      const std::string& referer, Micros start, Micros end, int client = 1) {
  HttpExchange e;
  e.connection.client.bytes = {10, 0, 0, static_cast<uint8_t>(client)};
  e.connection.server.bytes = {192, 0, 2, 80};
  e.connection.client_port = 50000;
  e.connection.server_port = 80;
  e.request.method = "GET";
  e.request.target = target;
  e.request.host = "Shop.Example";
  e.request.referer = referer;
  e.response.status = 200;
  e.response.content_type = content_type;
  e.start = start;
  e.request_last = start + 1 * kMillis;
  e.response_first = start + 21 * kMillis;
  e.response_last = end;
  e.response_bytes = 1000;
  return e;
}

class PageAssemblerTest : public ::testing::Test {
 protected:
  PageAssemblerTest() : builder_("1.0.0", "test"), pages_(&builder_, &sink_, &stats_) {}

  void Add(const HttpExchange& e) { pages_.OnExchange(e); }
  // "hpage /a", "hobj /a.css", ... for the records written so far.
  std::vector<std::string> Written() const {
    std::vector<std::string> out;
    for (const auto& r : sink_.records) {
      out.push_back(std::string(sm3gen::KindTag(r.kind)) + " " + r.url);
    }
    return out;
  }

  RecordCollector sink_;
  CaptureStats stats_;
  RecordBuilder builder_;
  PageAssembler pages_;
};

using Strings = std::vector<std::string>;

TEST_F(PageAssemblerTest, PageIsWrittenWithItsObjectsWhenTheNextPageArrives) {
  const Micros t = 1000 * kSecond;
  Add(Exchange("/index.html", "text/html; charset=utf-8", "", t, t + 100 * kMillis));
  Add(Exchange("/s.css", "text/css", "http://shop.example/index.html", t + 150 * kMillis,
               t + 300 * kMillis));
  HttpExchange revalidated = Exchange("/logo.png", "", "http://SHOP.example:80/index.html#top",
                                      t + 160 * kMillis, t + 250 * kMillis);
  revalidated.response.status = 304;
  revalidated.response_bytes = 200;
  Add(revalidated);
  Add(Exchange("/clip.mp4", "video/mp4", "http://shop.example/index.html", t + 170 * kMillis,
               t + 900 * kMillis));
  EXPECT_TRUE(sink_.records.empty());  // the view is still open
  Add(Exchange("/next.html", "text/html", "http://shop.example/index.html", t + 2 * kSecond,
               t + 2100 * kMillis));
  EXPECT_EQ(Written(),
            (Strings{"hpage /index.html", "hobj /s.css", "hobj /logo.png", "video /clip.mp4"}));
  const sm3gen::Record& page = sink_.records[0];
  EXPECT_EQ(page.object_count, 3);
  EXPECT_EQ(page.object_bytes, 2200);
  EXPECT_EQ(page.header_requests, 1);
  EXPECT_EQ(page.load_ms, 800);            // 900 - 100
  EXPECT_EQ(page.response_ms, 100 + 800);  // exchange + load
  EXPECT_EQ(page.server_ms + page.network_ms + page.load_ms, page.response_ms);
  EXPECT_EQ(page.host, "Shop.Example");
  EXPECT_EQ(sink_.records[1].load_ms, 0);
  EXPECT_EQ(sink_.records[1].response_ms, 150);  // an object's total is its own exchange
  pages_.Flush();
  EXPECT_EQ(Written().back(), "hpage /next.html");
  EXPECT_EQ(stats_.pages, 2u);
  EXPECT_EQ(stats_.objects, 3u);
}

TEST_F(PageAssemblerTest, ViewsCloseAfterQuietOrAfterThirtySeconds) {
  const Micros t = 2000 * kSecond;
  Add(Exchange("/a.html", "text/html", "", t, t + 10 * kMillis));
  Add(Exchange("/a.js", "application/javascript", "http://shop.example/a.html", t + 1 * kSecond,
               t + 1100 * kMillis));
  pages_.Advance(t + 6 * kSecond);  // 4.9 s after the last reply: still open
  EXPECT_TRUE(sink_.records.empty());
  pages_.Advance(t + 7200 * kMillis);  // looked at once a second of capture time
  EXPECT_EQ(Written(), (Strings{"hpage /a.html", "hobj /a.js"}));

  // A page whose objects keep coming is closed 30 s after it started; a later object is no
  // longer its own.
  sink_.records.clear();
  const Micros u = 3000 * kSecond;
  Add(Exchange("/live.html", "text/html", "", u, u + 10 * kMillis));
  for (int i = 1; i <= 31; ++i) {
    Add(Exchange("/poll", "application/json", "http://shop.example/live.html", u + i * kSecond,
                 u + i * kSecond + 50 * kMillis));
  }
  ASSERT_FALSE(sink_.records.empty());
  EXPECT_EQ(Written()[0], "hpage /live.html");
  EXPECT_EQ(sink_.records[0].object_count, 29);
}

TEST_F(PageAssemblerTest, ObjectsThatEndBeforeTheirPageAreClaimedByIt) {
  const Micros t = 4000 * kSecond;
  // The style sheet and an image it loads finish while the HTML is still arriving.
  Add(Exchange("/s.css", "text/css", "http://shop.example/big.html", t + 50 * kMillis,
               t + 80 * kMillis));
  Add(Exchange("/bg.png", "image/png", "http://shop.example/s.css", t + 90 * kMillis,
               t + 120 * kMillis));
  Add(Exchange("/big.html", "text/html", "", t, t + 2 * kSecond));
  pages_.Flush();
  EXPECT_EQ(Written(), (Strings{"hpage /big.html", "hobj /s.css", "hobj /bg.png"}));
  EXPECT_EQ(stats_.orphan_objects, 0u);
}

// An access log without virtual hosts names no host: its pages match Referers by path.
TEST_F(PageAssemblerTest, PagesWithoutAHostMatchByPath) {
  const Micros t = 6000 * kSecond;
  HttpExchange page = Exchange("/shop/index.html?a=1", "text/html", "", t, t + 10 * kMillis);
  page.request.host.clear();
  HttpExchange css = Exchange("/s.css", "text/css", "https://www.example/shop/index.html?a=1",
                              t + 20 * kMillis, t + 30 * kMillis);
  css.request.host.clear();
  Add(page);
  Add(css);
  pages_.Flush();
  EXPECT_EQ(Written(), (Strings{"hpage /shop/index.html?a=1", "hobj /s.css"}));

  // A host the log did not name but the operator gave (--host) matches by path too: the site
  // may be reached, and referred to, under another name.
  page.request.host = "shop.example";
  page.host_assumed = true;
  css.request.referer = "http://127.0.0.1:8080/shop/index.html?a=1";
  Add(page);
  Add(css);
  pages_.Flush();
  EXPECT_EQ(sink_.records.size(), 4u);
  EXPECT_EQ(sink_.records[2].object_count, 1);
}

TEST_F(PageAssemblerTest, ObjectsWithoutTheirPageBecomePagesOfTheirOwn) {
  const Micros t = 5000 * kSecond;
  // No Referer: a page at once (an API call, a download).
  Add(Exchange("/api/cart", "application/json", "", t, t + 5 * kMillis));
  EXPECT_EQ(Written(), (Strings{"hpage /api/cart"}));
  // A Referer naming a page never seen: it waits for that page, then stands alone.
  Add(Exchange("/x.png", "image/png", "http://elsewhere.example/", t + kSecond,
               t + kSecond + 5 * kMillis));
  pages_.Advance(t + 20 * kSecond);
  EXPECT_EQ(sink_.records.size(), 1u);
  pages_.Advance(t + 32 * kSecond);
  EXPECT_EQ(Written(), (Strings{"hpage /api/cart", "hpage /x.png"}));
  EXPECT_EQ(stats_.orphan_objects, 1u);
  // Another client's page does not claim this client's objects.
  Add(Exchange("/p.html", "text/html", "", t + 40 * kSecond, t + 41 * kSecond, 1));
  Add(Exchange("/p.css", "text/css", "http://shop.example/p.html", t + 40 * kSecond,
               t + 41 * kSecond, 2));
  pages_.Flush();
  EXPECT_EQ(Written().back(), "hpage /p.css");
  EXPECT_EQ(sink_.records[2].object_count, 0);
}

// What is still held, by the producer's sequence numbers: an open view's page and objects, and
// an object waiting for its page; a page of its own never is.
TEST_F(PageAssemblerTest, OldestHeldNamesTheEarliestUnwrittenExchange) {
  const Micros t = 7000 * kSecond;
  EXPECT_EQ(pages_.OldestHeld(), UINT64_MAX);
  const auto add = [&](HttpExchange e, uint64_t sequence) {
    e.sequence = sequence;
    Add(e);
  };
  add(Exchange("/api/ping", "application/json", "", t, t + kMillis), 1);
  EXPECT_EQ(pages_.OldestHeld(), UINT64_MAX);
  add(Exchange("/x.png", "image/png", "http://elsewhere.example/", t, t + kMillis, 2), 2);
  add(Exchange("/a.html", "text/html", "", t, t + 10 * kMillis), 3);
  add(Exchange("/a.css", "text/css", "http://shop.example/a.html", t, t + 20 * kMillis), 4);
  EXPECT_EQ(pages_.OldestHeld(), 2u);
  pages_.Advance(t + 10 * kSecond);  // the view closed; the orphan still waits
  EXPECT_EQ(Written(), (Strings{"hpage /api/ping", "hpage /a.html", "hobj /a.css"}));
  EXPECT_EQ(pages_.OldestHeld(), 2u);
  add(Exchange("/b.html", "text/html", "", t + 11 * kSecond, t + 11 * kSecond), 5);
  pages_.Advance(t + 40 * kSecond);
  EXPECT_EQ(pages_.OldestHeld(), UINT64_MAX);
}

TEST(RecordBuilderTest, FieldsFromAnExchange) {
  RecordBuilder builder("1.0.0", "col");
  HttpExchange e = Exchange("/shop/cart/view.php?id=7^x<y#frag", "text/html", "", 0, 0);
  e.connection.client.v6 = true;
  e.connection.client.bytes = {0x20, 0x01, 0x0d, 0xb8, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1};
  e.request.method = "POST";
  e.request.host = "shop.example:8080";
  e.request.user_agent = std::string(300, 'u') + "\r\n";
  e.response.version_minor = 0;
  e.start = 1700000000 * kSecond + 999 * kMillis;
  e.request_last = e.start + 10 * kMillis + 400;   // 10.4 ms
  e.response_first = e.start + 30 * kMillis;       // server 19.6 ms -> 20
  e.response_last = e.start + 55 * kMillis + 600;  // 55.6 ms -> 56
  e.request_bytes = 300;
  e.response_bytes = 5000;
  e.request_packets = 1;
  e.response_packets = 4;
  e.request_acks = 1;
  e.response_acks = 2;
  PageFigures figures;
  figures.load = 100 * kMillis;
  const sm3gen::Record r = builder.Build(e, sm3gen::RecordKind::kPage, figures);
  EXPECT_EQ(r.time_utc, 1700000000);
  EXPECT_EQ(r.client_address, "2001:db8::1");
  EXPECT_EQ(r.server_address, "192.0.2.80");
  EXPECT_EQ(r.response_ms, 156);
  EXPECT_EQ(r.server_ms, 20);
  EXPECT_EQ(r.network_ms, 36);
  EXPECT_EQ(r.load_ms, 100);
  EXPECT_EQ(r.total_bytes, 5300);
  EXPECT_EQ(r.reply_ack_packets, 2);
  EXPECT_EQ(r.method, sm3gen::Method::kPost);
  EXPECT_EQ(r.protocol, "HTTP/1.0");
  EXPECT_EQ(r.referrer, "N/A");
  EXPECT_EQ(r.host, "shop.example");
  EXPECT_EQ(r.url, "/shop/cart/view.php?id=7%5Ex%3Cy#frag");
  EXPECT_EQ(r.url_path, "/shop/cart/");
  EXPECT_EQ(r.url_file, "view.php");
  EXPECT_EQ(r.url_query, "id=7%5Ex%3Cy");
  EXPECT_EQ(r.url_anchor, "frag");
  EXPECT_EQ(r.browser.size(), 254u);  // cut to the field, control characters never reach it
  EXPECT_EQ(r.browser.find('\r'), std::string::npos);
  EXPECT_EQ(r.guid.size(), 32u);
  EXPECT_NE(builder.Build(e, sm3gen::RecordKind::kPage, figures).guid, r.guid);
  // The line has exactly the layout's fields, whatever the text held.
  const std::string line = sm3gen::FormatRecord(r);
  EXPECT_EQ(std::count(line.begin(), line.end(), '^'), 45);
}

TEST(RecordBuilderTest, UrlsAndHosts) {
  EXPECT_EQ(NormaliseUrl("HTTPS://Shop.Example:443/a/b?c=1#d"), "shop.example/a/b?c=1");
  EXPECT_EQ(NormaliseUrl("http://shop.example:8080"), "shop.example:8080/");
  EXPECT_EQ(HostWithoutPort("[2001:db8::1]:8080"), "[2001:db8::1]");
  EXPECT_EQ(HostWithoutPort("2001:db8::1"), "2001:db8::1");
  const UrlParts absolute = SplitTarget("http://proxy.example:3128/x/y.gif");
  EXPECT_EQ(absolute.origin, "/x/y.gif");
  EXPECT_EQ(absolute.host_from_target, "proxy.example:3128");
  EXPECT_EQ(SplitTarget("*").file, "*");
}

}  // namespace
}  // namespace capture
