#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/intake/md5_generator.h"
#include "core/analyzer/intake/sm3_parser.h"
#include "core/analyzer/intake/transaction_identity.h"
#include "framework/agent_runtime.h"
#include "framework/trace_capture.h"
#include "tests/support/sm3_lines.h"

namespace {

std::string Hex(const CUUID& id) {
  char text[33];
  getUUIDToHexString(id, text);
  return text;
}

std::string Md5Hex(const std::string& data) {
  CMD5Generator md5;
  md5.Init();
  md5.Update(data.data(), data.size());
  return Hex(md5.getUUID());
}

TEST(TransactionTest, DefaultsAndCutText) {
  CDPXTransaction t;
  EXPECT_EQ(99, t.getImportance());
  EXPECT_EQ(0, t.getControlFlags());
  EXPECT_EQ(0, t.getTrueTransType());
  EXPECT_EQ(0, t.getAggBy());
  EXPECT_EQ(0, t.getInstanceRoot());
  EXPECT_EQ(0, t.getMinThreshold());
  EXPECT_STREQ("", t.getRootUUID());

  t.setApplicationName(std::string(200, 'a').c_str());
  EXPECT_EQ(std::string(127, 'a'), t.getApplicationName());
  t.setServerIPAddress("2001:db8:1:2:3:4:5:6");
  EXPECT_STREQ("2001:db8:1:2:3:", t.getServerIPAddress());
  t.setClientIPv6Address(nullptr);
  EXPECT_STREQ("", t.getClientIPv6Address());
  t.setCurrentUUID(std::string(32, 'F').c_str());
  EXPECT_EQ(std::string(32, 'F'), t.getCurrentUUID());

  t.setTimeRecorded(1795000123);
  EXPECT_EQ(1795000123, t.getTransTime());
  EXPECT_EQ(1795000123, t.getTimeRecorded());
}

TEST(TransactionTest, BadStatusStartsAt401) {
  SM3_HPAGE_ENTRY entry{};
  entry.iRequestStatus = 400;
  EXPECT_FALSE(CDPXTransaction(entry).isBadStatusCode());
  entry.iRequestStatus = 401;
  EXPECT_TRUE(CDPXTransaction(entry).isBadStatusCode());
}

// A record names itself from its line: host name (or server address), URL, and each address in
// the IPv4 or IPv6 field by whether it holds a ':'.
TEST(TransactionTest, NamesComeFromTheLine) {
  std::string line = q7test::PageLine({{11, "2001:db8::7"}, {13, "192.0.2.10"}, {23, "/cart"}});
  auto t = processHSM3Line(line.data());
  ASSERT_TRUE(t);
  EXPECT_STREQ("www.shop.example", t->getApplicationName());
  EXPECT_STREQ("/cart", t->getTransactionName());
  EXPECT_STREQ("192.0.2.10", t->getServerName());
  EXPECT_STREQ("192.0.2.10", t->getServerHostname());
  EXPECT_STREQ("192.0.2.10", t->getServerIPAddress());
  EXPECT_STREQ("", t->getServerIPv6Address());
  EXPECT_STREQ("2001:db8::7", t->getClientName());
  EXPECT_STREQ("2001:db8::7", t->getClientHostname());
  EXPECT_STREQ("", t->getClientIPAddress());
  EXPECT_STREQ("2001:db8::7", t->getClientIPv6Address());

  line = q7test::PageLine({{40, ""}, {13, "2001:db8::1"}});
  t = processHSM3Line(line.data());
  EXPECT_STREQ("2001:db8::1", t->getApplicationName());
  EXPECT_STREQ("2001:db8::1", t->getServerIPv6Address());
  EXPECT_STREQ("", t->getServerIPAddress());
}

// An entry built elsewhere than by the parser may carry a negative network time.
TEST(TransactionTest, ConstructorClampsNegativeNetworkTime) {
  fw::TraceCapture capture("*=ERROR");
  SM3_HPAGE_ENTRY entry{};
  entry.iNetworkTime = -3;
  CDPXTransaction t(entry);
  EXPECT_EQ(0, t.getNetworkTime());
  EXPECT_EQ(5, t.getTrueTransType());
  EXPECT_TRUE(capture.contains(
      "CDPXTransaction::CDPXTransaction(SM3_HPAGE_ENTRY) input iNetworkTime[-3] is negative"));
  EXPECT_TRUE(capture.contains(
      "CDPXTransaction::CDPXTransaction(SM3_HPAGE_ENTRY) setting saved iNetowrkTime to 0"));
}

TEST(Md5Test, KnownDigestsInUpperCaseHex) {
  EXPECT_EQ("D41D8CD98F00B204E9800998ECF8427E", Md5Hex(""));
  EXPECT_EQ("900150983CD24FB0D6963F7D28E17F72", Md5Hex("abc"));
  CMD5Generator md5;
  initDPXTransMD5("node:Q7", "/a", md5);
  EXPECT_EQ(Md5Hex("node:Q7/a"), Hex(md5.getUUID()));
}

// The identity a monitor run gives a sequence of records.
class IdentityTest : public ::testing::Test {
 protected:
  std::unique_ptr<CDPXTransaction> Next(int type, const char* url) {
    SM3_HPAGE_ENTRY entry{};
    snprintf(entry.szURL, sizeof(entry.szURL), "%s", url);
    auto t = std::make_unique<CDPXTransaction>(entry);
    t->setRecordType(type);
    doUUIDs(*t, &previous_, &counter_, &pageSeen_);
    return t;
  }
  std::string UrlId(const char* url) { return Md5Hex(fw::OriginNodeName() + url); }

  CUUID previous_;  // all zero, as the monitor gives it before the first record
  int64_t counter_ = int64_t{1795000000} << 32;
  bool pageSeen_ = true;
};

// Page P, objects O1 and O2 of it, then page Q.
TEST_F(IdentityTest, ObjectsBelongToThePageBeforeThem) {
  const int64_t start = counter_;
  auto p = Next(1, "/a");
  auto o1 = Next(2, "/a.css");
  auto o2 = Next(3, "/a.mp3");
  auto q = Next(1, "/b");

  EXPECT_EQ(UrlId("/a"), p->getCurrentUUID());
  EXPECT_EQ(UrlId("/a"), p->getRootUUID());
  EXPECT_STREQ("", p->getParentUUID());
  EXPECT_EQ(start, p->getInstanceRoot());
  EXPECT_EQ(0, p->getControlFlags());
  for (const auto* o : {o1.get(), o2.get()}) {
    EXPECT_STREQ(p->getCurrentUUID(), o->getRootUUID());
    EXPECT_STREQ(p->getCurrentUUID(), o->getParentUUID());
    EXPECT_EQ(p->getInstanceRoot(), o->getInstanceRoot());
    EXPECT_EQ(1, o->getControlFlags());
  }
  EXPECT_EQ(UrlId("/a.css"), o1->getCurrentUUID());
  EXPECT_EQ(p->getInstanceRoot() + 1, q->getInstanceRoot());
  EXPECT_EQ(start + 2, counter_);
}

// One URL always has one current UUID; occurrences differ by instance root. An object before any
// page names the all-zero page.
TEST_F(IdentityTest, SameUrlSameIdAndOrphanObjects) {
  auto orphan = Next(4, "/v.mp4");
  EXPECT_EQ(std::string(32, '0'), orphan->getRootUUID());
  EXPECT_EQ(std::string(32, '0'), orphan->getParentUUID());
  EXPECT_EQ(counter_ - 1, orphan->getInstanceRoot());

  auto first = Next(1, "/same");
  auto second = Next(1, "/same");
  EXPECT_STREQ(first->getCurrentUUID(), second->getCurrentUUID());
  EXPECT_NE(first->getInstanceRoot(), second->getInstanceRoot());
}

TEST(IdentityCounterTest, StartsAtNowInTheUpperHalf) {
  const int64_t before = static_cast<int64_t>(time(nullptr));
  const int64_t counter = initialInstanceCounter();
  EXPECT_EQ(0, counter & 0xFFFFFFFF);
  EXPECT_GE(counter >> 32, before);
  EXPECT_LE(counter >> 32, before + 1);
}

}  // namespace
