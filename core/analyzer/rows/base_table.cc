#include "core/analyzer/rows/base_table.h"

#include <cstdio>
#include <cstring>
#include <ctime>
#include <string>

#include "core/analyzer/intake/dpx_transaction.h"
#include "core/analyzer/intake/other_transactions.h"
#include "core/config/cconfig.h"
#include "core/runtime/clog.h"
#include "framework/clock.h"

namespace {

// A negative running sum is reset to 0. The two numbers traced are the low and high 32-bit
// halves of the new sum.
void ClampNegativeSum(int64_t* sum, const char* negativeFormat, const char* resetFormat) {
  static const char* const kWhere = "CBaseTable::updateCommonData()";
  if (*sum >= 0) {
    return;
  }
  const uint64_t bits = static_cast<uint64_t>(*sum);
  CLOG::min(negativeFormat, kWhere, static_cast<long>(static_cast<int32_t>(bits & 0xFFFFFFFFu)),
            static_cast<long>(static_cast<int32_t>(bits >> 32)));
  CLOG::min(resetFormat, kWhere);
  *sum = 0;
}

}  // namespace

CBaseTable::CBaseTable()
    : deleteOnRemoval(true),
      commonData{},
      keptWord(0),
      kindData{},
      warehoused(false),
      thresholded(false),
      timestamp{},
      lastTimeOccurred(0),
      reservedLong(0),
      aggBy(0) {
  memset(&kindData, 0, sizeof(kindData));
  // Rows are built for every lookup on the per-transaction path; the timestamp of time 0 is
  // worked out once rather than through localtime each time.
  static const std::string zero = [] {
    char text[17] = {};
    TimeSince70ToMordel(0, text);
    return std::string(text, 16);
  }();
  memcpy(timestamp, zero.data(), 16);
  timestamp[16] = '\0';
}

bool CBaseTable::equals(TreeNode&, int) {
  CLOG::error("CBaseTable::equals() Should never enter here!!!");
  return false;
}

bool CBaseTable::greater(TreeNode&, int) {
  CLOG::error("CBaseTable::greater() Should never enter here!!!");
  return false;
}

void CBaseTable::setTimestamp(const char* text) {
  memcpy(timestamp, text, 16);
  timestamp[16] = '\0';
}

void CBaseTable::Update(CDPXTransaction& t) {
  updateCommonData(commonData, t.isBadStatusCode(), t.getTimeRecorded(), t.getTotalResponseTime(),
                   t.getTotalResponseTime() - t.getServerTime(), t.getServerTime(),
                   t.getNetworkTime(), t);
  updateDPXData(t, kindData.dpx, commonData.totreq);
  lastTimeOccurred = fw::Now() - (fw::Now() % CConfig::getOverTimeIntervalSeconds());
}

void CBaseTable::Update(CARMTransaction& t) {
  updateCommonData(commonData, t.failed, 0, t.responseTime, t.responseTime - t.serverTime,
                   t.serverTime, 0, t);
  updateARMData(t, kindData.arm, commonData.totreq);
  lastTimeOccurred = fw::Now() - (fw::Now() % CConfig::getOverTimeIntervalSeconds());
}

void CBaseTable::Update(CLYNTransaction& t) {
  updateCommonData(commonData, t.failed, 0, t.responseTime, t.responseTime, 0, 0, t);
  updateLYNData(t, kindData.lyn, commonData.totreq);
  lastTimeOccurred = fw::Now() - (fw::Now() % CConfig::getOverTimeIntervalSeconds());
}

void CBaseTable::updateCommonData(common_data_t& row, bool failed, long /*timeRecorded*/,
                                  long total, long client, long server, long network,
                                  CTransaction& /*t*/) {
  ++row.totreq;
  if (failed) {
    ++row.failreq;
  } else if (total <= row.mtrthres) {
    ++row.succreq;
  } else {
    ++row.slowreq;
  }
  row.oatime += total;
  if (row.minrtt > total || row.minrtt == 0) {
    row.minrtt = static_cast<int32_t>(total);
  }
  if (row.mmaxrtt < total) {
    row.mmaxrtt = static_cast<int32_t>(total);
  }
  row.clienttime += client;
  ClampNegativeSum(&row.clienttime,
                   "%s new row.clienttime is negative[%ld], after incrementing by input "
                   "clienttime[%ld]",
                   "%s setting new row.clienttime to 0");
  row.servtime += server;
  // The reset line names clienttime for the server sum too; operators' log filters know it so.
  ClampNegativeSum(&row.servtime,
                   "%s new row.servtime is negative[%ld], after incrementing by input "
                   "servtime[%ld]",
                   "%s setting new row.clienttime to 0");
  row.netwtime += network;
  ClampNegativeSum(&row.netwtime,
                   "%s new row.netwtime is negative[%ld], after incrementing by input "
                   "netwtime[%ld]",
                   "%s setting new row.netwtime to 0");
}

void CBaseTable::reset(long now) {
  const int32_t threshold = commonData.mtrthres;
  const int32_t kept = keptWord;
  commonData = common_data_t{};
  memset(&kindData, 0, sizeof(kindData));
  commonData.dintval = static_cast<int32_t>(CConfig::getOverTimeIntervalSeconds());
  commonData.mtrthres = threshold;
  keptWord = kept;
  TimeSince70ToMordel(now - (now % commonData.dintval), timestamp);
  timestamp[16] = '\0';
}

CommonColumns CBaseTable::getCommonData() const {
  CommonColumns out = getCommonCounts();
  addCommonPercentages(&out);
  return out;
}

CommonColumns CBaseTable::getCommonCounts() const {
  CommonColumns out{};
  out.dintval = commonData.dintval;
  const int32_t n = commonData.totreq;
  if (n == 0) {
    return out;
  }
  out.failreq = commonData.failreq;
  out.totreq = n;
  out.slowreq = commonData.slowreq;
  out.succreq = commonData.succreq;
  out.minrtt = commonData.minrtt;
  out.maxrtt = commonData.mmaxrtt;
  out.oatime = perRequest(commonData.oatime, n);
  out.clienttime = perRequest(commonData.clienttime, n);
  out.netwtime = perRequest(commonData.netwtime, n);
  out.servtime = perRequest(commonData.servtime, n);
  return out;
}

void CBaseTable::addCommonPercentages(CommonColumns* counts) const {
  static const char* const kWhere = "CBaseTable::getCommonData";
  CommonColumns& out = *counts;
  const int32_t n = commonData.totreq;
  if (n == 0) {
    return;
  }
  int32_t slow = percentOfRequests(commonData.slowreq, n);
  int32_t fail = percentOfRequests(commonData.failreq, n);
  int32_t good = static_cast<int32_t>(
      100000.0L * (static_cast<long double>(commonData.succreq) / static_cast<long double>(n)));
  const int32_t leftover = 100000 - (fail + slow + good);
  if (leftover > 0) {
    CLOG::max("%s leftOver for good[%d] fail[%d] slow[%d] is [%d]", kWhere, good, fail, slow,
              leftover);
    if (good > fail && good > slow) {
      good += leftover;
    } else if (fail > slow) {
      fail += leftover;
    } else {
      slow += leftover;
    }
    CLOG::max("%s After updates good[%d] fail[%d] slow[%d]", kWhere, good, fail, slow);
  }
  out.pcslow = slow;
  out.pcfail = fail;
  out.pcgood = good;
  out.pcavail = 100000 - fail;
}

void updateDPXData(CDPXTransaction& t, dpx_data_t& data, int /*totreq*/) {
  data.loadtime += t.getLoadTime();
  data.resolvtime += t.getResolveTime();
  data.reqpacket += t.getRequestPacketCount();
  data.ackpacket += t.getRequestAckPacketCount();
  data.replypckt += t.getReplyPacketCount();
  data.replyack += t.getReplyAckPacketCount();
  data.totbytes += t.getTotalBytes();
  data.reqbytes += t.getRequestBytes();
  data.replybyt += t.getReplyBytes();
  data.objcnt += t.getTotalObjectCount();
  data.objsize += t.getTotalObjectSize();
  data.headrreq += t.getTotalHeaderRequestsCount();
  data.hdrreqrslv += t.getTotalHeaderRequestResolveTime();

  // An unsigned difference from each base keeps codes outside 100 to 599 out of every bucket.
  const uint32_t status = static_cast<uint32_t>(t.getRequestStatus());
  int32_t* const buckets[] = {&data.num1xx, &data.num2xx, &data.num3xx, &data.num4xx, &data.num5xx};
  for (uint32_t i = 0; i < 5; ++i) {
    if (status - (100u * (i + 1)) < 100u) {
      ++*buckets[i];
    }
  }
  if (status == 403) {
    ++data.num403;
  } else if (status == 404) {
    ++data.num404;
  } else if (status == 500) {
    ++data.num500;
  }
}

void updateARMData(CARMTransaction& t, carm_data_t& data, int /*totreq*/) {
  data.totcntt += t.connectTime;
  data.totdnst += t.dnsTime;
  data.totrslvt += t.responseTime;
  data.totsvrrt += t.serverTime;
}

void updateLYNData(CLYNTransaction& t, lyn_data_t& data, int /*totreq*/) {
  data.conncttime += t.connectTime;
  data.dwnldtime += t.downloadTime;
  if (t.connectTime != 0 || t.downloadTime != 0) {
    ++data.brwsrcon;
  }
  if (data.brwsrcon > 0) {
    data.conntime += t.connectTime;
    data.avdwnldtm += t.downloadTime;
  } else {
    data.conntime = 0;
    data.avdwnldtm = 0;
  }
  if (t.getTrueTransType() == TRUE_TRANS_TYPE_LYN_BROWSER) {
    data.browserType = true;
  }
}

void reaggregateCommonData(common_data_t& row, int32_t totreq, int32_t failreq, int32_t slowreq,
                           int32_t succreq, int32_t /*ignored1*/, int64_t oatime,
                           int64_t clienttime, int64_t servtime, int64_t netwtime, int32_t minrtt,
                           int32_t mmaxrtt, int32_t /*ignored2*/) {
  row.totreq += totreq;
  row.failreq += failreq;
  row.slowreq += slowreq;
  row.succreq += succreq;
  row.oatime += oatime;
  row.clienttime += clienttime;
  row.servtime += servtime;
  row.netwtime += netwtime;
  if (row.mmaxrtt < mmaxrtt) {
    row.mmaxrtt = mmaxrtt;
  }
  if (!(row.minrtt != 0 && row.minrtt <= minrtt)) {
    row.minrtt = minrtt;
  }
}

void reaggregateDPXData(dpx_data_t& row, const dpx_data_t& other) {
#define Q7_ADD_SUM(sum) row.sum += other.sum;
  Q7_DPX_SUMS(Q7_ADD_SUM)
#undef Q7_ADD_SUM
#define Q7_ADD_COUNT(code) row.num##code += other.num##code;
  Q7_DPX_STATUS_CODES(Q7_ADD_COUNT)
#undef Q7_ADD_COUNT
}

void reaggregateARMData(carm_data_t& row, const carm_data_t& other) {
  row.totsvrrt += other.totsvrrt;
  row.totcntt += other.totcntt;
  row.totdnst += other.totdnst;
  row.totrslvt += other.totrslvt;
}

void reaggregateLYNData(lyn_data_t& row, const lyn_data_t& other) {
  row.conncttime += other.conncttime;
  row.dwnldtime += other.dwnldtime;
  row.brwsrcon += other.brwsrcon;
  row.conntime += other.conntime;
  row.avdwnldtm += other.avdwnldtm;
}

// The text forms print each value with %d, as they always have: these lines are for tracing
// only, so 64-bit sums are shown by their low 32 bits.
char* dumpCommonData(const common_data_t& d, char* buffer) {
  char* end = buffer + strlen(buffer);
  sprintf(end,
          "common_data_t {, dintval=%d, pcfail=%d, pcslow=%d, pcgood=%d, pcavail=%d, oatime=%d, "
          "succreq=%d, failreq=%d, totreq=%d, slowreq=%d, mtrthres=%d, minrtt=%d, mmaxrtt=%d "
          "};\n",
          d.dintval, d.pcfail, d.pcslow, d.pcgood, d.pcavail, static_cast<int>(d.oatime), d.succreq,
          d.failreq, d.totreq, d.slowreq, d.mtrthres, d.minrtt, d.mmaxrtt);
  return buffer;
}

char* dumpDPXData(const dpx_data_t& d, char* buffer) {
  char* end = buffer + strlen(buffer);
  sprintf(end,
          "dpx_data_t {loadtime=%d, resolvtime=%d, reqpacket=%d, ackpacket=%d, replypckt=%d, "
          "replyack=%d, totbytes=%d, reqbytes=%d, replybyt=%d, objcnt=%d, objsize=%d, "
          "headrreq=%d, hdrreqrslv=%d, num1xx=%d, num2xx=%d, num3xx=%d, num4xx=%d, num5xx=%d, "
          "num403=%d, num404=%d, num500=%d};\n",
          static_cast<int>(d.loadtime), static_cast<int>(d.resolvtime),
          static_cast<int>(d.reqpacket), static_cast<int>(d.ackpacket),
          static_cast<int>(d.replypckt), static_cast<int>(d.replyack), static_cast<int>(d.totbytes),
          static_cast<int>(d.reqbytes), static_cast<int>(d.replybyt), static_cast<int>(d.objcnt),
          static_cast<int>(d.objsize), static_cast<int>(d.headrreq), static_cast<int>(d.hdrreqrslv),
          d.num1xx, d.num2xx, d.num3xx, d.num4xx, d.num5xx, d.num403, d.num404, d.num500);
  return buffer;
}

char* dumpARMData(const carm_data_t& d, char* buffer) {
  char* end = buffer + strlen(buffer);
  sprintf(end, "carm_data_t {totcntt=%d, totdnst=%d, totrslvt=%d, totsvrrt=%d}; ",
          static_cast<int>(d.totcntt), static_cast<int>(d.totdnst), static_cast<int>(d.totrslvt),
          static_cast<int>(d.totsvrrt));
  return buffer;
}

char* dumpLYNData(const lyn_data_t& d, char* buffer) {
  char* end = buffer + strlen(buffer);
  sprintf(end, "lyn_data_t { conncttime=%d, dwnldtime=%d, brwsrcon=%d, conntime=%d, avdwnldtm=%d} ",
          static_cast<int>(d.conncttime), static_cast<int>(d.dwnldtime),
          static_cast<int>(d.brwsrcon), static_cast<int>(d.conntime),
          static_cast<int>(d.avdwnldtm));
  return buffer;
}

int32_t percentOfRequests(int32_t count, int32_t n) {
  // Most status counters of a row are 0; skipping the extended-precision division for them
  // (whose truncating conversion stalls the x87 unit) gives the same 0 much sooner.
  if (n == 0 || count == 0) {
    return 0;
  }
  return static_cast<int32_t>(static_cast<long double>(count) / n * 100000.0L);
}

long calculateRank(long a, long b, short c) {
  const uint32_t left = static_cast<uint32_t>(a) * 100u + static_cast<uint32_t>(b);
  const uint32_t right = 100u - static_cast<uint32_t>(static_cast<int32_t>(c));
  return static_cast<long>(static_cast<int32_t>(left * right));
}
