// The model's records: order of pages and objects, time stamps, value limits, the promised
// variety, and options that switch features off.

#include "collector/sm3gen/traffic_model.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <limits>
#include <set>
#include <string>
#include <vector>

#include "collector/sm3gen/record_format.h"

namespace sm3gen {
namespace {

constexpr int64_t kStart = 1795450020;  // 2026-11-23 16:07:00 UTC

std::vector<Record> Take(const ModelOptions& options, int count) {
  TrafficModel model(options);
  std::vector<Record> records;
  for (int i = 0; i < count; ++i) {
    records.push_back(model.Next());
  }
  return records;
}

ModelOptions Options() {
  ModelOptions options;
  options.start = kStart;
  return options;
}

bool Clean(const std::string& text, size_t width) {
  return text.size() <= width &&
         text.find_first_of(std::string("^<\r\n\0", 5)) == std::string::npos;
}

TEST(sm3genModel, SameSeedSameRecordsOtherSeedOthers) {
  ModelOptions options = Options();
  const auto a = Take(options, 300);
  const auto b = Take(options, 300);
  options.seed = 2;
  const auto c = Take(options, 300);
  std::string text_a, text_b, text_c;
  for (int i = 0; i < 300; ++i) {
    text_a += FormatRecord(a[i]);
    text_b += FormatRecord(b[i]);
    text_c += FormatRecord(c[i]);
  }
  EXPECT_EQ(text_a, text_b);
  EXPECT_NE(text_a, text_c);
}

// Each page is followed by exactly the objects it counts, so objects always belong to the page
// before them.
TEST(sm3genModel, ObjectsFollowTheirPage) {
  const auto records = Take(Options(), 3000);
  ASSERT_EQ(RecordKind::kPage, records[0].kind);
  size_t i = 0;
  int pages = 0;
  while (i < records.size()) {
    ASSERT_EQ(RecordKind::kPage, records[i].kind) << "record " << i;
    const size_t expected = static_cast<size_t>(records[i].object_count);
    size_t objects = 0;
    for (++i; i < records.size() && records[i].kind != RecordKind::kPage; ++i) {
      ++objects;
    }
    if (i < records.size()) {  // the last page may be cut short by the record count
      EXPECT_EQ(expected, objects);
    }
    ++pages;
  }
  EXPECT_GT(pages, 100);
}

TEST(sm3genModel, TimeStampsAdvanceByRate) {
  ModelOptions options = Options();
  options.rate = 4;
  const auto records = Take(options, 10);
  for (int i = 0; i < 10; ++i) {
    EXPECT_EQ(kStart + i / 4, records[i].time_utc) << i;
  }
  EXPECT_EQ("2026-11-23", records[0].date);
  EXPECT_EQ("16:07:00", records[0].time_of_day);
  EXPECT_EQ("16:07:02", records[9].time_of_day);
}

// Every value fits its field and the framing, and the data has the variety the agent must
// cope with.
TEST(sm3genModel, ValuesFitTheirFieldsAndCoverTheCases) {
  ModelOptions options = Options();
  options.sites = 8;
  options.error_share = 20;
  options.av_share = 15;
  options.ipv6_share = 40;
  const auto records = Take(options, 20000);
  std::set<std::string> guids;
  std::set<int> kinds, methods;
  bool ipv6_client = false, ipv6_server = false, long_url = false, long_host = false;
  bool no_host = false, odd_status = false, query = false;
  for (const Record& r : records) {
    SCOPED_TRACE(FormatRecord(r));
    EXPECT_TRUE(Clean(r.product_version, 10) && Clean(r.application_id, 2) &&
                Clean(r.reserved1, 64) && Clean(r.collector_id, 31) && Clean(r.guid, 64) &&
                Clean(r.date, 10) && Clean(r.time_of_day, 8) && Clean(r.time_zone, 32) &&
                Clean(r.client_address, 64) && Clean(r.server_address, 64));
    EXPECT_TRUE(Clean(r.url, 254) && Clean(r.referrer, 254) && Clean(r.browser, 254) &&
                Clean(r.server_description, 254) && Clean(r.protocol, 32) && Clean(r.host, 254) &&
                Clean(r.url_path, 254) && Clean(r.url_file, 254) && Clean(r.url_query, 254) &&
                Clean(r.url_anchor, 126) && Clean(r.title, 254));
    EXPECT_EQ(32u, r.guid.size());
    EXPECT_TRUE(guids.insert(r.guid).second) << "GUID repeated";
    for (int32_t v : {r.response_ms, r.server_ms, r.network_ms, r.request_bytes, r.reply_bytes,
                      r.total_bytes, r.request_packets, r.reply_packets, r.client_port}) {
      EXPECT_GE(v, 0);
    }
    EXPECT_EQ(int64_t{r.request_bytes} + r.reply_bytes, r.total_bytes);
    EXPECT_EQ('/', r.url[0]);
    kinds.insert(static_cast<int>(r.kind));
    if (UsesPageLayout(r.kind)) {
      methods.insert(static_cast<int>(r.method));
      EXPECT_EQ(r.url_path + r.url_file + (r.url_query.empty() ? "" : "?" + r.url_query), r.url);
    }
    ipv6_client |= r.client_address.find(':') != std::string::npos;
    ipv6_server |= r.server_address.find(':') != std::string::npos;
    long_url |= r.url.size() > 127;
    long_host |= r.host.size() > 127;
    no_host |= r.kind == RecordKind::kPage && r.host.empty();
    odd_status |= r.status < 100 || r.status > 599;
    query |= !r.url_query.empty();
  }
  EXPECT_EQ((std::set<int>{1, 2, 3, 4}), kinds);
  EXPECT_EQ((std::set<int>{1, 2, 3, 4, 5, 6, 7, 8}), methods);
  EXPECT_TRUE(ipv6_client && ipv6_server && long_url && long_host && no_host && odd_status &&
              query);
}

// A key count gives exactly that many URLs over its first that many records, then repeats.
TEST(sm3genModel, UrlKeysCycleThroughDistinctUrls) {
  ModelOptions options = Options();
  options.url_keys = 1000;
  std::set<std::string> urls;
  for (const Record& r : Take(options, 1500)) {
    urls.insert(r.url_path + r.url_file);
    EXPECT_EQ("/key/", r.url_path);
  }
  EXPECT_EQ(1000u, urls.size());
}

TEST(sm3genModel, ZeroSharesSwitchFeaturesOff) {
  ModelOptions options = Options();
  options.error_share = 0;
  options.ipv6_share = 0;
  options.av_share = 0;
  for (const Record& r : Take(options, 3000)) {
    EXPECT_TRUE(r.status >= 100 && r.status < 400) << r.status;
    EXPECT_EQ(std::string::npos, r.client_address.find(':'));
    EXPECT_TRUE(UsesPageLayout(r.kind));
  }
  options.objects = 0;
  for (const Record& r : Take(options, 200)) {
    EXPECT_EQ(RecordKind::kPage, r.kind);
  }
}

}  // namespace
}  // namespace sm3gen
