// Each field lands in its place in both layouts, between the kind's tags.

#include "collector/sm3gen/record_format.h"

#include <gtest/gtest.h>

#include "collector/sm3gen/test_support.h"

namespace sm3gen {
namespace {

// A record whose integers all differ, so a field out of place shows.
Record Numbered(RecordKind kind) {
  Record r;
  r.kind = kind;
  r.product_version = "3.1.0";
  r.guid = "0123456789abcdef0123456789abcdef";
  r.time_utc = 1795450020;
  r.server_address = "2001:db8:5e::1";
  r.response_ms = 1015;
  r.reply_bytes = 1022;
  r.url = "/shop/cart?x=1";
  r.referrer = "N/A";
  r.status = 404;
  r.server_ms = 1029;
  r.network_ms = 1036;
  r.host = "www.shop.example";
  r.url_query = "x=1";
  r.title = "404 Not Found";
  r.method = Method::kConnect;
  r.duration_ms = 1023;
  r.bit_rate_kbps = 1030;
  return r;
}

TEST(sm3genFormat, PageLayoutFieldsInOrder) {
  const auto lines = testing::ReadLines(FormatRecord(Numbered(RecordKind::kObject)));
  ASSERT_EQ(1u, lines.size());
  EXPECT_EQ("hobj", lines[0].tag);
  EXPECT_EQ("hobj", lines[0].trailer);
  const auto& f = lines[0].fields;
  ASSERT_EQ(46u, f.size());
  EXPECT_EQ("3.1.0", f[0]);
  EXPECT_EQ("0123456789abcdef0123456789abcdef", f[4]);
  EXPECT_EQ("1795450020", f[5]);
  EXPECT_EQ("2001:db8:5e::1", f[12]);
  EXPECT_EQ("1015", f[14]);
  EXPECT_EQ("1022", f[21]);
  EXPECT_EQ("/shop/cart?x=1", f[22]);
  EXPECT_EQ("N/A", f[23]);
  EXPECT_EQ("404", f[27]);
  EXPECT_EQ("1029", f[28]);
  EXPECT_EQ("1036", f[35]);
  EXPECT_EQ("www.shop.example", f[39]);
  EXPECT_EQ("x=1", f[42]);
  EXPECT_EQ("404 Not Found", f[44]);
  EXPECT_EQ("8", f[45]);
}

TEST(sm3genFormat, ObjectLayoutFieldsInOrder) {
  for (RecordKind kind : {RecordKind::kAudio, RecordKind::kVideo}) {
    const auto lines = testing::ReadLines(FormatRecord(Numbered(kind)));
    ASSERT_EQ(1u, lines.size());
    EXPECT_EQ(KindTag(kind), lines[0].tag);
    EXPECT_EQ(KindTag(kind), lines[0].trailer);
    const auto& f = lines[0].fields;
    ASSERT_EQ(31u, f.size());
    EXPECT_EQ("1015", f[14]);
    EXPECT_EQ("1022", f[21]);
    EXPECT_EQ("1023", f[22]);
    EXPECT_EQ("/shop/cart?x=1", f[23]);
    EXPECT_EQ("N/A", f[24]);
    EXPECT_EQ("404", f[28]);
    EXPECT_EQ("1030", f[29]);
    EXPECT_EQ("1036", f[30]);
  }
}

}  // namespace
}  // namespace sm3gen
