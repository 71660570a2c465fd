#pragma once

// CBaseTable: the aggregate row. A row accumulates the transactions of one key over one
// interval: request counts by outcome (good, slow, failed), response-time sum, minimum and
// maximum, client, network and server time sums, and the kind's own block (web, ARM or
// client-side data). The sixteen row classes (rows/rows.h) add their key fields.
//
// Rows live in the analyzer's trees and are changed under the analyzer's tree lock only; a row
// is never shared between threads otherwise. Percentages exist only in table rows
// (getCommonData), in thousandths of a percent (100000 is 100 %); times are ms.

#include <concepts>
#include <cstdint>

#include "core/runtime/tree_node.h"

class CTransaction;
class CDPXTransaction;
class CARMTransaction;
class CLYNTransaction;

struct common_data_t {
  int32_t dintval;  // interval length, seconds
  int32_t pcfail;   // percentages: table rows only
  int32_t pcslow;
  int32_t pcgood;
  int32_t pcavail;
  int64_t oatime;  // sum of total response times
  int32_t succreq;
  int32_t failreq;
  int32_t totreq;
  int32_t slowreq;
  int32_t mtrthres;  // response-time threshold of this row
  int32_t minrtt;    // 0 = none yet
  int32_t mmaxrtt;
  int64_t clienttime;  // sums
  int64_t netwtime;
  int64_t servtime;
};

struct dpx_data_t {
  int64_t loadtime, resolvtime, reqpacket, ackpacket, replypckt, replyack, totbytes, reqbytes,
      replybyt, objcnt, objsize, headrreq, hdrreqrslv;
  int32_t num1xx, num2xx, num3xx, num4xx, num5xx, num403, num404, num500;
};

// The web block's fields for the code that walks them all: the sums (per-request averages in
// table rows), and the status codes whose counts are num<code> (pct<code> in table rows).
// clang-format off
#define Q7_DPX_SUMS(X) \
  X(loadtime) X(resolvtime) X(reqpacket) X(ackpacket) X(replypckt) X(replyack) X(totbytes) \
  X(reqbytes) X(replybyt) X(objcnt) X(objsize) X(headrreq) X(hdrreqrslv)
// clang-format on
#define Q7_DPX_STATUS_CODES(X) X(1xx) X(2xx) X(3xx) X(4xx) X(5xx) X(403) X(404) X(500)
#define Q7_DPX_PLUS_ONE(field) +1
static_assert(sizeof(dpx_data_t) == sizeof(int64_t) * (0 Q7_DPX_SUMS(Q7_DPX_PLUS_ONE)) +
                                        sizeof(int32_t) * (0 Q7_DPX_STATUS_CODES(Q7_DPX_PLUS_ONE)),
              "a web block field is missing from its lists");
#undef Q7_DPX_PLUS_ONE

struct carm_data_t {
  int64_t totsvrrt, totcntt, totdnst, totrslvt;
};

struct lyn_data_t {
  int64_t conncttime, dwnldtime, brwsrcon, conntime, avdwnldtm;
  bool browserType;  // a transaction of true trans type 4 was added
};

// Adds one transaction's kind data; the int receives totreq and is not used.
void updateDPXData(CDPXTransaction& t, dpx_data_t& data, int totreq);
void updateARMData(CARMTransaction& t, carm_data_t& data, int totreq);
void updateLYNData(CLYNTransaction& t, lyn_data_t& data, int totreq);

// Combine another row's values into a row's block. minrtt takes the incoming value unless the
// current one is non-zero and not above it, so an incoming 0 wins.
void reaggregateCommonData(common_data_t& row, int32_t totreq, int32_t failreq, int32_t slowreq,
                           int32_t succreq, int32_t ignored1, int64_t oatime, int64_t clienttime,
                           int64_t servtime, int64_t netwtime, int32_t minrtt, int32_t mmaxrtt,
                           int32_t ignored2);
void reaggregateDPXData(dpx_data_t& row, const dpx_data_t& other);
void reaggregateARMData(carm_data_t& row, const carm_data_t& other);
void reaggregateLYNData(lyn_data_t& row, const lyn_data_t& other);

// Append the block's text form to buffer (which must have room) and return buffer.
char* dumpCommonData(const common_data_t& data, char* buffer);
char* dumpDPXData(const dpx_data_t& data, char* buffer);
char* dumpARMData(const carm_data_t& data, char* buffer);
char* dumpLYNData(const lyn_data_t& data, char* buffer);

// count / n in thousandths of a percent: divided first, in extended precision, truncated
// toward zero; 0 for an empty row.
int32_t percentOfRequests(int32_t count, int32_t n);
// sum / n truncated toward zero; 0 for an empty row. Inline and mostly in double: a table row
// takes seventeen of these, and a 64-bit integer division costs several times a double one.
// Within double's exact range the double quotient is off by at most one, which the remainder
// corrects.
inline int32_t perRequest(int64_t sum, int32_t n) {
  constexpr int64_t kExact = int64_t{1} << 52;
  if (n <= 0 || sum <= -kExact || sum >= kExact) {
    return n == 0 ? 0 : static_cast<int32_t>(sum / n);
  }
  int64_t q = static_cast<int64_t>(static_cast<double>(sum) / n);
  const int64_t r = sum - q * n;
  if (sum >= 0) {
    q += r < 0 ? -1 : r >= n ? 1 : 0;
  } else {
    q += r > 0 ? 1 : r <= -n ? -1 : 0;
  }
  return static_cast<int32_t>(q);
}

// (a * 100 + b) * (100 - c), wrapping in 32 bits.
long calculateRank(long a, long b, short c);

// The common columns of a table row and the values getCommonData produces for them; the list
// is for code that copies them all.
struct CommonColumns {
  int32_t dintval, pcfail, pcslow, pcgood, pcavail, oatime, failreq, totreq, slowreq, succreq,
      minrtt, maxrtt, clienttime, netwtime, servtime;
};
// clang-format off
#define Q7_COMMON_COLUMNS(X) \
  X(dintval) X(pcfail) X(pcslow) X(pcgood) X(pcavail) X(oatime) X(failreq) X(totreq) X(slowreq) \
  X(succreq) X(minrtt) X(maxrtt) X(clienttime) X(netwtime) X(servtime)
// clang-format on
#define Q7_COMMON_PLUS_ONE(column) +1
static_assert(sizeof(CommonColumns) == sizeof(int32_t) * (0 Q7_COMMON_COLUMNS(Q7_COMMON_PLUS_ONE)),
              "a common column is missing from its list");
#undef Q7_COMMON_PLUS_ONE

class CBaseTable : public TreeNode {
 public:
  CBaseTable();
  ~CBaseTable() override = default;
  CBaseTable(const CBaseTable&) = default;
  CBaseTable& operator=(const CBaseTable&) = default;

  // Row classes override these; the base ones trace an error and answer false.
  bool equals(TreeNode& other, int mode) override;
  bool greater(TreeNode& other, int mode) override;
  const char* toString(int) override { return nullptr; }
  bool getDeleteOnRemoval() override { return deleteOnRemoval; }
  void setDeleteOnRemoval(bool value) override { deleteOnRemoval = value; }

  // Adds one transaction.
  void Update(CDPXTransaction& t);
  void Update(CARMTransaction& t);
  void Update(CLYNTransaction& t);

  // Starts a new interval at now: clears the data (keeping mtrthres), sets dintval from the
  // over-time interval and the timestamp to the interval's start.
  void reset(long now);

  void updateCommonData(common_data_t& row, bool failed, long timeRecorded, long total, long client,
                        long server, long network, CTransaction& t);

  // The common columns of a table row: counts, per-request averages and the three percentages
  // (truncated toward zero, the leftover of their sum to 100000 given to the largest), pcavail.
  CommonColumns getCommonData() const;
  // The same in two steps: the counts and averages (percentages left 0), which is all a summary
  // fold reads of a row, then the percentages added to them.
  CommonColumns getCommonCounts() const;
  void addCommonPercentages(CommonColumns* counts) const;

  const common_data_t& getCommon() const { return commonData; }
  common_data_t& getCommon() { return commonData; }
  const dpx_data_t& getDPXData() const { return kindData.dpx; }
  dpx_data_t& getDPXData() { return kindData.dpx; }
  const carm_data_t& getARMData() const { return kindData.arm; }
  const lyn_data_t& getLYNData() const { return kindData.lyn; }

  void setWarehoused(bool value) { warehoused = value; }
  bool getWarehoused() const { return warehoused; }
  void setThresholded(bool value) { thresholded = value; }
  bool getThresholded() const { return thresholded; }
  // The interval's start as a framework timestamp: 16 characters and a NUL.
  const char* getTimestamp() const { return timestamp; }
  void setTimestamp(const char* text);
  long getLastTimeOccurred() const { return lastTimeOccurred; }
  int getAggBy() const { return aggBy; }
  void setAggBy(int value) { aggBy = value; }

 protected:
  bool deleteOnRemoval;
  common_data_t commonData;
  int32_t keptWord;  // survives reset
  union KindData {
    dpx_data_t dpx;
    carm_data_t arm;
    lyn_data_t lyn;
  } kindData;
  bool warehoused;
  bool thresholded;
  char timestamp[17];
  long lastTimeOccurred;  // start of the interval of the last update, seconds since 1970
  long reservedLong;
  int aggBy;  // which own identities the row's transactions kept (1 app, 2 client, 4 transaction)
};
