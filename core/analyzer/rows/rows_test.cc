#include "core/analyzer/rows/rows.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>

#include <array>
#include <climits>
#include <memory>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "core/analyzer/intake/other_transactions.h"
#include "core/analyzer/testing/transaction_builder.h"
#include "core/config/cconfig.h"
#include "framework/clock.h"
#include "framework/trace_capture.h"

namespace {

// A web transaction with the given response time, server time and status.
CDPXTransaction Tx(int rt, int status = 200, int server = 0, int network = 0) {
  return TransactionBuilder()
      .url("/cart")
      .responseTime(rt)
      .status(status)
      .serverTime(server)
      .networkTime(network)
      .loadTime(rt * 2)
      .totalBytes(1000)
      .minThreshold(500)
      .build();
}

class RowTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("TZ", "UTC", 1);
    tzset();
    CConfig::setOverTimeInterval(5);
  }
};

// A response time exactly at the threshold is good; above it slow; a bad status is failed
// whatever its time.
TEST_F(RowTest, ClassificationAtTheThreshold) {
  CDPXTransaction first = Tx(500);
  CApplicationOverTime row(first);
  row.Update(first);
  CDPXTransaction slow = Tx(501);
  row.Update(slow);
  CDPXTransaction failed = Tx(10, 401);
  row.Update(failed);
  CDPXTransaction good = Tx(10, 400);
  row.Update(good);
  const common_data_t& c = row.getCommon();
  EXPECT_EQ(4, c.totreq);
  EXPECT_EQ(2, c.succreq);
  EXPECT_EQ(1, c.slowreq);
  EXPECT_EQ(1, c.failreq);
  EXPECT_EQ(500 + 501 + 10 + 10, c.oatime);
  EXPECT_EQ(10, c.minrtt);
  EXPECT_EQ(501, c.mmaxrtt);
}

// The three percentages are truncated and the leftover goes to the strictly largest bucket,
// else to fail over slow, else to slow.
TEST_F(RowTest, PercentagesAndLeftover) {
  CDPXTransaction good = Tx(100);
  CDPXTransaction slow = Tx(900);
  CDPXTransaction failed = Tx(100, 500);
  CApplicationOverTime mixed(good);
  mixed.Update(good);
  mixed.Update(slow);
  mixed.Update(failed);
  CommonColumns c = mixed.getCommonData();
  EXPECT_EQ(33333, c.pcgood);
  EXPECT_EQ(33333, c.pcfail);
  EXPECT_EQ(33334, c.pcslow);
  EXPECT_EQ(66667, c.pcavail);

  CApplicationOverTime mostlyGood(good);
  mostlyGood.Update(good);
  mostlyGood.Update(good);
  mostlyGood.Update(failed);
  c = mostlyGood.getCommonData();
  EXPECT_EQ(66667, c.pcgood);
  EXPECT_EQ(33333, c.pcfail);
  EXPECT_EQ(0, c.pcslow);
  EXPECT_EQ(66667, c.pcavail);
  EXPECT_EQ((100 + 100 + 100 + 100) / 4, c.oatime);

  CApplicationOverTime empty(good);
  c = empty.getCommonData();
  EXPECT_EQ(0, c.pcgood + c.pcfail + c.pcslow + c.pcavail + c.totreq + c.oatime + c.minrtt);
}

TEST_F(RowTest, StatusBuckets) {
  CDPXTransaction first = Tx(1);
  CApplicationOverTime row(first);
  for (int status : {99, 600, 404, 403, 500, 200, 199, 301}) {
    CDPXTransaction t = Tx(1, status);
    row.Update(t);
  }
  const dpx_data_t& d = row.getDPXData();
  // 1xx to 5xx, then 403, 404 and 500 (each also in its class); 99 and 600 count nowhere.
  EXPECT_EQ((std::array<int32_t, 8>{1, 1, 1, 2, 1, 1, 1, 1}),
            (std::array<int32_t, 8>{d.num1xx, d.num2xx, d.num3xx, d.num4xx, d.num5xx, d.num403,
                                    d.num404, d.num500}));
}

// Negative running sums are reset with their trace lines; the server sum's reset line names
// clienttime.
TEST_F(RowTest, NegativeSumsAreClamped) {
  fw::TraceCapture capture("*=ERROR");
  CDPXTransaction t = Tx(100, 200, 300, -5);  // client time 100 - 300 < 0
  CApplicationOverTime row(t);
  CARMTransaction arm;
  arm.responseTime = 10;
  arm.serverTime = -20;
  row.Update(t);
  EXPECT_EQ(0, row.getCommon().clienttime);
  EXPECT_TRUE(
      capture.contains("CBaseTable::updateCommonData() new row.clienttime is "
                       "negative[-200], after incrementing by input clienttime[-1]"));
  EXPECT_TRUE(capture.contains("CBaseTable::updateCommonData() setting new row.clienttime to 0"));
  capture.clear();
  CApplicationOverTime armRow(t);
  armRow.Update(arm);
  EXPECT_EQ(0, armRow.getCommon().servtime);
  EXPECT_TRUE(capture.contains("new row.servtime is negative[-20]"));
  EXPECT_EQ(1, capture.count("setting new row.clienttime to 0"));
}

TEST(RowArithmeticTest, MinimumCombinesWithZero) {
  common_data_t row{};
  row.minrtt = 120;
  reaggregateCommonData(row, 1, 0, 0, 1, 0, 50, 0, 0, 0, 0, 50, 0);
  EXPECT_EQ(0, row.minrtt);
  reaggregateCommonData(row, 1, 0, 0, 1, 0, 50, 0, 0, 0, 80, 80, 0);
  EXPECT_EQ(80, row.minrtt);
  reaggregateCommonData(row, 1, 0, 0, 1, 0, 50, 0, 0, 0, 90, 70, 0);
  EXPECT_EQ(80, row.minrtt);
  EXPECT_EQ(80, row.mmaxrtt);
  EXPECT_EQ(3, row.totreq);
}

// perRequest divides mostly in double; it must truncate as the integer division does, near
// whole quotients, for negative sums and beyond double's exact range too.
TEST(RowArithmeticTest, PerRequestIsTheIntegerQuotient) {
  std::mt19937_64 rng(9);
  std::vector<std::pair<int64_t, int32_t>> cases = {{0, 0},
                                                    {5, 0},
                                                    {7, 2},
                                                    {-7, 2},
                                                    {6, 3},
                                                    {-6, 3},
                                                    {1, 1},
                                                    {-1, 7},
                                                    {(int64_t{1} << 52) - 1, 3},
                                                    {-(int64_t{1} << 52) + 1, 3},
                                                    {int64_t{1} << 53, 7},
                                                    {INT64_MIN, 3},
                                                    {INT64_MAX, 2147483647},
                                                    {-9, -2},
                                                    {9, -2}};
  for (int i = 0; i < 200000; ++i) {
    const int32_t n = static_cast<int32_t>(1 + rng() % (i % 2 == 0 ? 1000 : 2147483647u));
    // Quotients at and next to whole numbers, where a rounded double quotient goes wrong.
    const int64_t q = static_cast<int64_t>(rng() % (int64_t{1} << (rng() % 32)));  // q * n fits
    const int64_t sum = (i % 3 == 0 ? -1 : 1) * (q * n + static_cast<int64_t>(rng() % 3) - 1);
    cases.emplace_back(sum, n);
  }
  for (const auto& [sum, n] : cases) {
    const int32_t want = n == 0 ? 0 : static_cast<int32_t>(sum / n);
    ASSERT_EQ(want, perRequest(sum, n)) << sum << " / " << n;
  }
}

TEST(RowArithmeticTest, RankWrapsIn32Bits) {
  EXPECT_EQ((33 * 100 + 33) * (100 - 99), calculateRank(33, 33, 99));
  EXPECT_EQ(-500, calculateRank(5, 0, 101));
  // (21474836 * 100 + 48) * 100 overflows: the low 32 bits, signed.
  EXPECT_EQ(static_cast<long>(static_cast<int32_t>(uint32_t{2147483648u} * 100u)),
            calculateRank(21474836, 48, 0));
}

TEST_F(RowTest, ResetKeepsThresholdAndStartsTheInterval) {
  CDPXTransaction t = Tx(100);
  CServerOverTime row(t);
  row.Update(t);
  row.reset(1230768123);  // 2009-01-01 00:02:03 UTC
  EXPECT_EQ(0, row.getCommon().totreq);
  EXPECT_EQ(500, row.getCommon().mtrthres);
  EXPECT_EQ(300, row.getCommon().dintval);
  EXPECT_STREQ("1090101000000000", row.getTimestamp());
}

// Client rows with one address and host name but different client names are different rows,
// sorted by client name last.
TEST_F(RowTest, ClientOrder) {
  CDPXTransaction a = Tx(1);
  CDPXTransaction b = Tx(1);
  b.setClientName("another");
  b.setClientIPAddress("10.1.2.3");
  a.setClientName("zzz");
  CClientOverTime ra(a);
  CClientOverTime rb(b);
  EXPECT_FALSE(ra.equals(rb, 0));
  EXPECT_TRUE(ra.greater(rb, 0));
  EXPECT_FALSE(rb.greater(ra, 0));
  b.setClientIPAddress("10.1.2.4");
  CClientOverTime rc(b);
  EXPECT_TRUE(rc.greater(ra, 0));  // the address decides first
  CClientOverTime same(a);
  EXPECT_TRUE(same.equals(ra, 0));
  EXPECT_FALSE(same.greater(ra, 0));
}

// Transaction rows differing only in server sort by server last over time, but ahead of
// transaction and client name in the summary tree.
TEST_F(RowTest, TransactionOrdersDifferOnPurpose) {
  CDPXTransaction a = Tx(1);
  a.setServerName("s-b");
  a.setClientName("c-a");
  CDPXTransaction b = Tx(1);
  b.setServerName("s-a");
  b.setClientName("c-b");
  CTransactionOverTime ota(a), otb(b);
  EXPECT_FALSE(ota.greater(otb, 0));  // client decides before server
  EXPECT_TRUE(otb.greater(ota, 0));
  kq7_q7txot_data_t la, lb;
  ota.getQ7Struct(la);
  otb.getQ7Struct(lb);
  CTransactionSummary sa(la), sb(lb);
  EXPECT_TRUE(sa.greater(sb, 0));  // server decides before client
  EXPECT_FALSE(sb.greater(sa, 0));
}

TEST_F(RowTest, ToStringTexts) {
  CDPXTransaction t = Tx(1);
  CClientAppOverTime ot(t);
  EXPECT_STREQ("ApplicationName=www.shop.example\nClientName=10.1.2.3\n", ot.toString(0));
  kq7_q7clntappot_data_t layout;
  ot.getQ7Struct(layout);
  CClientAppSummary sm(layout);
  EXPECT_STREQ("ApplicationName=www.shop.example\nClientNAme=10.1.2.3\n", sm.toString(0));
  CServerOverTime server(t);
  EXPECT_STREQ("ServerName=192.0.2.10\nIPAddress=192.0.2.10\n", server.toString(0));
}

// A table row carries the key, the interval, per-request averages, counters and the derived
// columns; a full-width key is copied unterminated.
TEST_F(RowTest, TableRowColumns) {
  CDPXTransaction t = Tx(200, 404, 50, 30);
  t.setImportance(10);
  t.setClientIPv6Address("2001:db8::1");
  t.setAggBy(2);
  t.setClientName(std::string(200, 'c').c_str());
  CClientOverTime row(t);
  row.reset(1230768123);
  row.Update(t);
  CDPXTransaction second = Tx(400, 200);
  row.Update(second);
  kq7_q7clntot_data_t out;
  row.getQ7Struct(out);
  EXPECT_EQ(std::string(127, 'c') + '\0', std::string(out.client, 128));
  EXPECT_EQ("10.1.2.3", rows::FieldText(out.ip, 16));
  EXPECT_EQ("2001:db8::1", rows::FieldText(out.ipv6, 128));
  EXPECT_EQ("DPX", rows::FieldText(out.datcoltype, 32));
  EXPECT_EQ("1090101000000000", std::string(out.timestamp, 16));
  EXPECT_EQ(2, out.totreq);
  EXPECT_EQ(1, out.failreq);
  EXPECT_EQ(300, out.oatime);
  EXPECT_EQ(600, out.loadtime);  // (400 + 800) / 2
  EXPECT_EQ(1000, out.totbytes);
  EXPECT_EQ(1, out.num404);
  EXPECT_EQ(50000, out.pct404);
  EXPECT_EQ(50000, out.pct2xx);
  EXPECT_EQ(2, out.aggby);
  EXPECT_EQ(500, out.mrtthres);
  EXPECT_EQ(calculateRank(50, 0, 10), out.rank);  // pcfail 50 %, the creating importance
}

// Two over-time rows of one key fold into one summary row: counts add, sums come back from
// averages times counts, so averages agree within the truncation.
TEST_F(RowTest, SummaryFoldsOverTimeRows) {
  CDPXTransaction t1 = Tx(101);
  CDPXTransaction t2 = Tx(250, 503);
  CApplicationOverTime first(t1), second(t1);
  first.Update(t1);
  first.Update(t1);
  second.Update(t2);
  kq7_q7appot_data_t l1, l2;
  first.getQ7Struct(l1);
  second.getQ7Struct(l2);
  CApplicationSummary summary(l1);
  summary.Update(l2);
  kq7_q7appsm_data_t out;
  summary.getQ7Struct(out);
  EXPECT_EQ(3, out.totreq);
  EXPECT_EQ(1, out.failreq);
  EXPECT_EQ(2, out.succreq);
  EXPECT_NEAR((101 + 101 + 250) / 3, out.oatime, 1);
  EXPECT_EQ(101, out.minrtt);
  EXPECT_EQ(250, out.maxrtt);
  EXPECT_EQ(1, out.num5xx);
  EXPECT_EQ("www.shop.example", rows::FieldText(out.applicatin, 128));
}

// Every over-time class survives the trip through its history layout.
template <class Row>
void ExpectHistoryRoundTrip(CDPXTransaction& t) {
  Row row(t);
  row.reset(1230768123);
  row.Update(t);
  row.Update(t);
  typename Row::LayoutType a;
  row.getQ7Struct(a);
  Row back(a);
  typename Row::LayoutType b;
  back.getQ7Struct(b);
  EXPECT_EQ(0, memcmp(&a, &b, sizeof(a))) << typeid(Row).name();
  EXPECT_TRUE(back.equals(row, 0));
}

TEST_F(RowTest, OverTimeRowsRoundTripThroughTheirLayouts) {
  CDPXTransaction t = Tx(123, 302, 20, 7);
  t.setParentUUID(std::string(32, 'A').c_str());
  t.setCurrentUUID(std::string(32, 'B').c_str());
  t.setRootUUID(std::string(32, 'A').c_str());
  ExpectHistoryRoundTrip<CApplicationOverTime>(t);
  ExpectHistoryRoundTrip<CClientAppOverTime>(t);
  ExpectHistoryRoundTrip<CServerAppOverTime>(t);
  ExpectHistoryRoundTrip<CTransactionOverTime>(t);
  ExpectHistoryRoundTrip<CSubTransactionOverTime>(t);
  ExpectHistoryRoundTrip<CClientOverTime>(t);
  ExpectHistoryRoundTrip<CClientServerOverTime>(t);
  ExpectHistoryRoundTrip<CServerOverTime>(t);
}

}  // namespace

namespace {

// The trace forms of the blocks, appended to what the buffer holds.
TEST(RowArithmeticTest, DumpTexts) {
  common_data_t c{};
  c.dintval = 300;
  c.totreq = 2;
  c.oatime = 250;
  char buffer[1024] = "row: ";
  EXPECT_STREQ(
      "row: common_data_t {, dintval=300, pcfail=0, pcslow=0, pcgood=0, pcavail=0, oatime=250, "
      "succreq=0, failreq=0, totreq=2, slowreq=0, mtrthres=0, minrtt=0, mmaxrtt=0 };\n",
      dumpCommonData(c, buffer));
  carm_data_t a{};
  a.totcntt = 7;
  buffer[0] = '\0';
  EXPECT_STREQ("carm_data_t {totcntt=7, totdnst=0, totrslvt=0, totsvrrt=0}; ",
               dumpARMData(a, buffer));
  lyn_data_t l{};
  buffer[0] = '\0';
  EXPECT_STREQ("lyn_data_t { conncttime=0, dwnldtime=0, brwsrcon=0, conntime=0, avdwnldtm=0} ",
               dumpLYNData(l, buffer));
  dpx_data_t d{};
  d.num404 = 3;
  buffer[0] = '\0';
  EXPECT_NE(nullptr, strstr(dumpDPXData(d, buffer), "num403=0, num404=3, num500=0};\n"));
}

// Client-side rows count browser transactions and keep their connect and download sums only
// while there are any.
TEST(RowArithmeticTest, ClientSideData) {
  lyn_data_t data{};
  CLYNTransaction quiet;
  updateLYNData(quiet, data, 1);
  EXPECT_EQ(0, data.brwsrcon);
  CLYNTransaction browser;
  browser.connectTime = 5;
  browser.downloadTime = 20;
  browser.setTrueTransType(TRUE_TRANS_TYPE_LYN_BROWSER);
  updateLYNData(browser, data, 2);
  EXPECT_EQ(1, data.brwsrcon);
  EXPECT_EQ(5, data.conntime);
  EXPECT_EQ(20, data.avdwnldtm);
  EXPECT_TRUE(data.browserType);
}

}  // namespace
